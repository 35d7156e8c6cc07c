#include "av_probe.h"

#include <ctype.h>
#include <stdio.h>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/display.h>
}

namespace mediaparserd {
namespace {

constexpr int kIoBufferSize = 32 * 1024;

// What libavformat sees of the reader: a read position of its own, and an
// end where its allowance of bytes runs out.
struct IoState {
  BoundedReader* reader;
  int64_t position;
  int64_t allowance;  // bytes it may still read
};

int ReadPacket(void* opaque, uint8_t* buffer, int size) {
  auto* state = static_cast<IoState*>(opaque);
  if (size > state->allowance) size = static_cast<int>(state->allowance);
  if (size <= 0) return AVERROR_EOF;
  int64_t n = state->reader->ReadAt(state->position, buffer, size);
  if (n < 0) return AVERROR_EXIT;
  if (n == 0) return AVERROR_EOF;
  state->position += n;
  state->allowance -= n;
  return static_cast<int>(n);
}

int64_t Seek(void* opaque, int64_t offset, int whence) {
  auto* state = static_cast<IoState*>(opaque);
  int64_t size = state->reader->size();
  int64_t base;
  switch (whence & ~AVSEEK_FORCE) {
    case AVSEEK_SIZE:
      return size;
    case SEEK_SET:
      base = 0;
      break;
    case SEEK_CUR:
      base = state->position;
      break;
    case SEEK_END:
      base = size;
      break;
    default:
      return AVERROR(EINVAL);
  }
  if ((offset > 0 && base > INT64_MAX - offset) || base + offset < 0) {
    return AVERROR(EINVAL);
  }
  state->position = base + offset;
  return state->position;
}

int Interrupt(void* opaque) {
  auto* reader = static_cast<BoundedReader*>(opaque);
  return reader->stop() != BoundedReader::Stop::kNone || reader->Expired();
}

// An AVIOContext over the reader, freed with its (possibly replaced)
// buffer.
class CustomIo {
 public:
  CustomIo(BoundedReader* reader, int64_t allowance)
      : state_{reader, 0, allowance} {
    auto* buffer = static_cast<unsigned char*>(av_malloc(kIoBufferSize));
    if (buffer == nullptr) return;
    io_ = avio_alloc_context(buffer, kIoBufferSize, 0, &state_, ReadPacket,
                             nullptr, Seek);
    if (io_ == nullptr) av_free(buffer);
  }
  ~CustomIo() {
    if (io_ != nullptr) {
      av_freep(&io_->buffer);
      avio_context_free(&io_);
    }
  }
  CustomIo(const CustomIo&) = delete;
  CustomIo& operator=(const CustomIo&) = delete;
  AVIOContext* get() { return io_; }

 private:
  IoState state_;
  AVIOContext* io_ = nullptr;
};

// The MPEG-4 audio object type of an AAC stream. Explicitly signalled SBR
// in the stream's configuration (object type 5 or 29) makes it HE-AAC even
// before the decoder met SBR data; otherwise the decoder's profile, whose
// numbers are the object type less one, names it. HE-AAC v2 is HE-AAC.
int64_t AacObjectType(const AVCodecParameters* par) {
  int configured = 0;
  if (par->extradata != nullptr && par->extradata_size >= 2) {
    configured = par->extradata[0] >> 3;
    if (configured == 31) {
      configured =
          32 + (((par->extradata[0] & 7) << 3) | (par->extradata[1] >> 5));
    }
  }
  if (configured == 5 || configured == 29) return 5;
  switch (par->profile) {
    case FF_PROFILE_AAC_MAIN:
    case FF_PROFILE_AAC_LOW:
    case FF_PROFILE_AAC_SSR:
    case FF_PROFILE_AAC_LTP:
    case FF_PROFILE_AAC_LD:
    case FF_PROFILE_AAC_ELD:
      return par->profile + 1;
    case FF_PROFILE_AAC_HE:
    case FF_PROFILE_AAC_HE_V2:
    case FF_PROFILE_MPEG2_AAC_HE:
      return 5;
    case FF_PROFILE_MPEG2_AAC_LOW:
      return 2;
    default:
      return configured;
  }
}

void AddTags(const AVDictionary* dictionary, ContainerFacts* facts) {
  const AVDictionaryEntry* entry = nullptr;
  while ((entry = av_dict_get(dictionary, "", entry, AV_DICT_IGNORE_SUFFIX))) {
    std::string key = entry->key;
    for (char& c : key) c = static_cast<char>(tolower(c));
    facts->tags.emplace_back(std::move(key), entry->value);
  }
}

StreamFacts FactsOf(AVFormatContext* context, AVStream* stream) {
  const AVCodecParameters* par = stream->codecpar;
  StreamFacts facts;
  if (stream->disposition & AV_DISPOSITION_ATTACHED_PIC) {
    facts.type = StreamFacts::Type::kCover;
  } else if (par->codec_type == AVMEDIA_TYPE_VIDEO) {
    facts.type = StreamFacts::Type::kVideo;
  } else if (par->codec_type == AVMEDIA_TYPE_AUDIO) {
    facts.type = StreamFacts::Type::kAudio;
  }
  facts.codec = avcodec_get_name(par->codec_id);
  facts.profile = par->profile;
  facts.level = par->level;
  if (par->codec_id == AV_CODEC_ID_AAC) {
    facts.aac_object_type = AacObjectType(par);
  }
  facts.bit_rate = par->bit_rate;
  facts.sample_rate = par->sample_rate;
  facts.channels = par->ch_layout.nb_channels;
  facts.width = par->width;
  facts.height = par->height;
  AVRational sar = av_guess_sample_aspect_ratio(context, stream, nullptr);
  facts.sar_num = sar.num;
  facts.sar_den = sar.den;
  AVRational rate = stream->avg_frame_rate;
  if (rate.num <= 0 || rate.den <= 0) rate = stream->r_frame_rate;
  facts.frame_rate_num = rate.num;
  facts.frame_rate_den = rate.den;
  size_t size = 0;
  const uint8_t* matrix =
      av_stream_get_side_data(stream, AV_PKT_DATA_DISPLAYMATRIX, &size);
  if (matrix != nullptr && size >= 9 * sizeof(int32_t)) {
    facts.has_rotation = true;
    facts.rotation =
        av_display_rotation_get(reinterpret_cast<const int32_t*>(matrix));
  }
  return facts;
}

void Collect(AVFormatContext* context, ContainerFacts* facts) {
  facts->format = context->iformat->name;
  if (context->duration != AV_NOPTS_VALUE && context->duration > 0) {
    facts->duration = static_cast<double>(context->duration) / AV_TIME_BASE;
  }
  facts->bit_rate = context->bit_rate;
  AddTags(context->metadata, facts);
  bool stream_tags = false;
  for (unsigned i = 0; i < context->nb_streams; ++i) {
    AVStream* stream = context->streams[i];
    facts->streams.push_back(FactsOf(context, stream));
    // Ogg and some others keep the tags with the first stream; the
    // container's own come first and win.
    if (!stream_tags &&
        facts->streams.back().type != StreamFacts::Type::kCover &&
        facts->streams.back().type != StreamFacts::Type::kOther) {
      AddTags(stream->metadata, facts);
      stream_tags = true;
    }
  }
}

std::string ErrorText(int error) {
  char text[AV_ERROR_MAX_STRING_SIZE] = {};
  av_strerror(error, text, sizeof(text));
  return text;
}

}  // namespace

ProbeResult ProbeContainer(BoundedReader* reader, const ProbeLimits& limits,
                           ContainerFacts* facts, std::string* detail) {
  CustomIo io(reader, limits.read_bytes);
  if (io.get() == nullptr) return ProbeResult::kStopped;
  const AVInputFormat* format = nullptr;
  int error = av_probe_input_buffer2(io.get(), &format, "", nullptr, 0,
                                     static_cast<unsigned>(limits.probe_bytes));
  if (reader->stop() != BoundedReader::Stop::kNone)
    return ProbeResult::kStopped;
  if (error < 0 || format == nullptr) return ProbeResult::kNotMedia;

  AVFormatContext* context = avformat_alloc_context();
  if (context == nullptr) return ProbeResult::kStopped;
  context->pb = io.get();
  context->flags |= AVFMT_FLAG_CUSTOM_IO;
  context->interrupt_callback.callback = Interrupt;
  context->interrupt_callback.opaque = reader;
  context->probesize = limits.analyze_bytes;
  context->format_probesize = static_cast<int>(limits.probe_bytes);
  context->max_analyze_duration = limits.analyze_us;
  context->max_streams = limits.max_streams;
  // Frees the context on failure.
  error = avformat_open_input(&context, "", format, nullptr);
  if (error < 0) {
    if (reader->stop() != BoundedReader::Stop::kNone) {
      return ProbeResult::kStopped;
    }
    *detail = std::string(format->name) + ": " + ErrorText(error);
    return ProbeResult::kDamaged;
  }
  error = avformat_find_stream_info(context, nullptr);
  ProbeResult result = ProbeResult::kOk;
  if (reader->stop() != BoundedReader::Stop::kNone) {
    result = ProbeResult::kStopped;
  } else {
    // A failed analysis still leaves what the header told.
    *facts = ContainerFacts();
    Collect(context, facts);
  }
  (void)error;
  avformat_close_input(&context);
  return result;
}

}  // namespace mediaparserd
