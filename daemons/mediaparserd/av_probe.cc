#include "av_probe.h"

#include <ctype.h>
#include <stdio.h>
#include <string.h>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/display.h>
#include <libavutil/mathematics.h>
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

// The audio object type an AAC stream's AudioSpecificConfig starts with
// (ISO/IEC 14496-3), 0 without one.
int ConfiguredAacType(const AVCodecParameters* par) {
  if (par->extradata == nullptr || par->extradata_size < 2) return 0;
  int type = par->extradata[0] >> 3;
  if (type == 31) {
    type = 32 + (((par->extradata[0] & 7) << 3) | (par->extradata[1] >> 5));
  }
  return type;
}

// The profile and level an H.264 or HEVC stream's configuration record
// (avcC, hvcC) states, numbered as libavcodec's decoders report them.
// False when there is no such record.
bool ConfiguredProfile(const AVCodecParameters* par, int* profile, int* level) {
  const uint8_t* config = par->extradata;
  int size = par->extradata_size;
  if (config == nullptr || size < 4 || config[0] != 1) return false;
  if (par->codec_id == AV_CODEC_ID_H264) {
    int constraints = config[2];  // constraint_set0_flag is the top bit
    *profile = config[1];
    if (*profile == FF_PROFILE_H264_BASELINE && (constraints & 0x40)) {
      *profile |= FF_PROFILE_H264_CONSTRAINED;
    }
    if ((*profile == FF_PROFILE_H264_HIGH_10 ||
         *profile == FF_PROFILE_H264_HIGH_422 ||
         *profile == FF_PROFILE_H264_HIGH_444_PREDICTIVE) &&
        (constraints & 0x10)) {
      *profile |= FF_PROFILE_H264_INTRA;
    }
    *level = config[3];
    return *profile > 0;
  }
  if (par->codec_id == AV_CODEC_ID_HEVC && size >= 23) {
    *profile = config[1] & 0x1F;
    *level = config[12];
    return *profile > 0;
  }
  return false;
}

// The MPEG-4 audio object type of an AAC stream. Explicitly signalled SBR
// in the stream's configuration (object type 5 or 29) makes it HE-AAC even
// before the decoder met SBR data; otherwise the decoder's profile, whose
// numbers are the object type less one, names it. HE-AAC v2 is HE-AAC.
int64_t AacObjectType(const AVCodecParameters* par) {
  int configured = ConfiguredAacType(par);
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
  int profile, level;
  if (par->profile == FF_PROFILE_UNKNOWN &&
      ConfiguredProfile(par, &profile, &level)) {
    facts.profile = profile;
    facts.level = level;
  }
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

// The duration the container states, in AV_TIME_BASE units: its own, or
// its longest stream's; 0 when unknown.
int64_t StatedDuration(const AVFormatContext* context) {
  if (context->duration != AV_NOPTS_VALUE && context->duration > 0) {
    return context->duration;
  }
  int64_t longest = 0;
  for (unsigned i = 0; i < context->nb_streams; ++i) {
    const AVStream* stream = context->streams[i];
    if (stream->duration == AV_NOPTS_VALUE || stream->duration <= 0 ||
        stream->time_base.num <= 0 || stream->time_base.den <= 0) {
      continue;
    }
    longest = FFMAX(longest, av_rescale_q(stream->duration, stream->time_base,
                                          AV_TIME_BASE_Q));
  }
  return longest;
}

// Containers whose header states everything the record needs, so that
// avformat_find_stream_info, which decodes frames (a good part of a
// millisecond for H.264, more for large pictures), can be skipped.
bool HeaderTellsAll(const AVFormatContext* context) {
  static const char* const kFormats[] = {"mov,mp4,m4a,3gp,3g2,mj2",
                                         "matroska,webm", "wav", "ogg", "flac"};
  bool known = false;
  for (const char* format : kFormats) {
    known = known || strcmp(context->iformat->name, format) == 0;
  }
  if (!known || StatedDuration(context) <= 0) return false;
  bool media = false;
  for (unsigned i = 0; i < context->nb_streams; ++i) {
    const AVStream* stream = context->streams[i];
    const AVCodecParameters* par = stream->codecpar;
    if (stream->disposition & AV_DISPOSITION_ATTACHED_PIC) continue;
    if (par->codec_type == AVMEDIA_TYPE_AUDIO) {
      if (par->codec_id == AV_CODEC_ID_NONE || par->sample_rate <= 0 ||
          par->ch_layout.nb_channels <= 0) {
        return false;
      }
      if (par->codec_id == AV_CODEC_ID_AAC) {
        // Below 24 kHz plain AAC may carry SBR that only decoding finds.
        int type = ConfiguredAacType(par);
        if (type == 0 || (type == 2 && par->sample_rate <= 24000)) {
          return false;
        }
      }
      media = true;
    } else if (par->codec_type == AVMEDIA_TYPE_VIDEO) {
      int profile, level;
      if (!ConfiguredProfile(par, &profile, &level) || par->width <= 0 ||
          par->height <= 0 || stream->avg_frame_rate.num <= 0 ||
          stream->avg_frame_rate.den <= 0) {
        return false;
      }
      media = true;
    }
  }
  return media;
}

void Collect(AVFormatContext* context, int64_t file_size,
             ContainerFacts* facts) {
  facts->format = context->iformat->name;
  int64_t duration = StatedDuration(context);
  if (duration > 0) {
    facts->duration = static_cast<double>(duration) / AV_TIME_BASE;
  }
  facts->bit_rate = context->bit_rate;
  // As libavformat's analysis works it out: the whole file over its time.
  if (facts->bit_rate <= 0 && duration > 0 && file_size > 0) {
    double rate = static_cast<double>(file_size) * 8.0 * AV_TIME_BASE /
                  static_cast<double>(duration);
    if (rate <= static_cast<double>(INT64_MAX)) {
      facts->bit_rate = static_cast<int64_t>(rate);
    }
  }
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
  // A failed analysis still leaves what the header told: its result does
  // not matter, only whether the reader stopped.
  if (!HeaderTellsAll(context)) avformat_find_stream_info(context, nullptr);
  ProbeResult result = ProbeResult::kOk;
  if (reader->stop() != BoundedReader::Stop::kNone) {
    result = ProbeResult::kStopped;
  } else {
    *facts = ContainerFacts();
    Collect(context, reader->size(), facts);
  }
  avformat_close_input(&context);
  return result;
}

}  // namespace mediaparserd
