#include "music_tags.h"

#include <ctype.h>
#include <limits.h>
#include <string.h>

#include <string>

#include <taglib/aifffile.h>
#include <taglib/apefile.h>
#include <taglib/apetag.h>
#include <taglib/asffile.h>
#include <taglib/commentsframe.h>
#include <taglib/flacfile.h>
#include <taglib/id3v1tag.h>
#include <taglib/id3v2framefactory.h>
#include <taglib/id3v2tag.h>
#include <taglib/infotag.h>
#include <taglib/mp4file.h>
#include <taglib/mpcfile.h>
#include <taglib/mpegfile.h>
#include <taglib/oggflacfile.h>
#include <taglib/opusfile.h>
#include <taglib/speexfile.h>
#include <taglib/tdebuglistener.h>
#include <taglib/textidentificationframe.h>
#include <taglib/tiostream.h>
#include <taglib/tpropertymap.h>
#include <taglib/trueaudiofile.h>
#include <taglib/vorbisfile.h>
#include <taglib/wavfile.h>
#include <taglib/wavpackfile.h>
#include <taglib/xiphcomment.h>

namespace mediaparserd {
namespace {

using Encoding = TagText::Encoding;

// TagLib's view of the file: read-only, through the reader.
class ReaderStream : public TagLib::IOStream {
 public:
  explicit ReaderStream(BoundedReader* reader) : reader_(reader) {}

  TagLib::FileName name() const override { return ""; }

  TagLib::ByteVector readBlock(unsigned long length) override {
    int64_t left = reader_->size() - position_;
    int64_t count = static_cast<int64_t>(length) < left
                        ? static_cast<int64_t>(length)
                        : left;
    if (count <= 0 || count > kMaxTagRead) return TagLib::ByteVector();
    TagLib::ByteVector block(static_cast<unsigned>(count), '\0');
    int64_t n = reader_->ReadAt(position_, block.data(), count);
    if (n <= 0) return TagLib::ByteVector();
    block.resize(static_cast<unsigned>(n));
    position_ += n;
    return block;
  }

  void writeBlock(const TagLib::ByteVector&) override {}
  void insert(const TagLib::ByteVector&, unsigned long,
              unsigned long) override {}
  void removeBlock(unsigned long, unsigned long) override {}
  bool readOnly() const override { return true; }
  bool isOpen() const override { return true; }

  void seek(long offset, Position from) override {
    long base = from == Beginning ? 0
                : from == Current ? position_
                                  : static_cast<long>(reader_->size());
    if (offset < 0 && base + offset < 0) {
      position_ = 0;
    } else if (offset > 0 && base > LONG_MAX - offset) {
      position_ = LONG_MAX;
    } else {
      position_ = base + offset;
    }
  }

  long tell() const override { return position_; }
  long length() override { return static_cast<long>(reader_->size()); }
  void truncate(long) override {}

 private:
  BoundedReader* reader_;
  long position_ = 0;
};

// RIFF INFO texts are 8-bit text in whatever code page the writer used;
// decoded as Latin-1, every byte survives, so to8Bit(false) gives them back.
class InfoBytes : public TagLib::RIFF::Info::StringHandler {
 public:
  TagLib::String parse(const TagLib::ByteVector& data) const override {
    unsigned length = 0;
    while (length < data.size() && data[length] != '\0') ++length;
    return TagLib::String(data.mid(0, length), TagLib::String::Latin1);
  }
};

// TagLib's messages about damaged files are of no use in a daemon's log.
class Silent : public TagLib::DebugListener {
 public:
  void printMessage(const TagLib::String&) override {}
};

// TagLib's process-wide settings, made once.
void SetUpTagLib() {
  static InfoBytes info_bytes;
  static Silent silent;
  static const bool done = [] {
    TagLib::RIFF::Info::Tag::setStringHandler(&info_bytes);
    TagLib::setDebugListener(&silent);
    return true;
  }();
  (void)done;
}

// The encoding a frame declares, as a number: TagLib keeps the frame's
// encoding byte in its enum type unchecked, so a damaged frame holds values
// outside it, which may not be read through the enum type.
int Declared(TagLib::String::Type encoding) {
  static_assert(sizeof(encoding) == sizeof(int), "an int-sized enum");
  int number;
  memcpy(&number, &encoding, sizeof(number));
  return number;
}

// The text in the encoding its frame declares. TagLib decodes any
// declaration but Latin-1 and UTF-8 as UTF-16, damaged ones included.
TagText MakeText(const TagLib::String& text, int stored) {
  switch (stored) {
    case TagLib::String::Latin1:
      return {Encoding::kBytes, text.to8Bit(false)};
    case TagLib::String::UTF8:
      return {Encoding::kUTF8, text.to8Bit(true)};
    default: {
      TagLib::ByteVector units = text.data(TagLib::String::UTF16LE);
      return {Encoding::kUTF16, std::string(units.data(), units.size())};
    }
  }
}

int64_t LeadingNumber(const TagLib::String& text) {
  std::string bytes = text.to8Bit(true);
  int64_t value = 0;
  for (size_t i = 0; i < bytes.size() && i < 9 &&
                     isdigit(static_cast<unsigned char>(bytes[i]));
       ++i) {
    value = value * 10 + (bytes[i] - '0');
  }
  return value;
}

// The first frame `id` of the tag, or null.
const TagLib::ID3v2::Frame* FirstFrame(const TagLib::ID3v2::Tag& tag,
                                       const char* id) {
  const TagLib::ID3v2::FrameListMap& map = tag.frameListMap();
  TagLib::ID3v2::FrameListMap::ConstIterator it = map.find(id);
  if (it == map.end() || it->second.isEmpty()) return nullptr;
  return it->second.front();
}

// The text of the first frame `id` with its declared encoding.
TagText FrameText(const TagLib::ID3v2::Tag& tag, const char* id) {
  const auto* frame =
      dynamic_cast<const TagLib::ID3v2::TextIdentificationFrame*>(
          FirstFrame(tag, id));
  if (frame == nullptr) return {};
  return MakeText(frame->toString(), Declared(frame->textEncoding()));
}

// The comment without a description if there is one (others hold player
// data such as "iTunNORM"), else the first.
TagText CommentText(const TagLib::ID3v2::Tag& tag) {
  const TagLib::ID3v2::FrameListMap& map = tag.frameListMap();
  TagLib::ID3v2::FrameListMap::ConstIterator it = map.find("COMM");
  const TagLib::ID3v2::FrameList none;
  const TagLib::ID3v2::CommentsFrame* chosen = nullptr;
  for (const TagLib::ID3v2::Frame* frame :
       it == map.end() ? none : it->second) {
    const auto* comment =
        dynamic_cast<const TagLib::ID3v2::CommentsFrame*>(frame);
    if (comment == nullptr) continue;
    if (chosen == nullptr) chosen = comment;
    if (comment->description().isEmpty()) {
      chosen = comment;
      break;
    }
  }
  if (chosen != nullptr)
    return MakeText(chosen->text(), Declared(chosen->textEncoding()));
  // Some writers (ffmpeg among them) keep the comment in a user-defined
  // text frame described "comment".
  it = map.find("TXXX");
  if (it == map.end()) return {};
  for (const TagLib::ID3v2::Frame* frame : it->second) {
    const auto* text =
        dynamic_cast<const TagLib::ID3v2::UserTextIdentificationFrame*>(frame);
    if (text != nullptr && text->fieldList().size() >= 2 &&
        text->description().upper() == "COMMENT") {
      return MakeText(text->fieldList()[1], Declared(text->textEncoding()));
    }
  }
  return {};
}

MusicTags FromID3v2(const TagLib::ID3v2::Tag& tag) {
  MusicTags tags;
  tags.title = FrameText(tag, "TIT2");
  tags.artist = FrameText(tag, "TPE1");
  tags.album = FrameText(tag, "TALB");
  tags.album_artist = FrameText(tag, "TPE2");
  tags.composer = FrameText(tag, "TCOM");
  tags.comment = CommentText(tag);
  // Numbered genres ("(17)") read as their names, which are ASCII.
  if (const auto* genre =
          dynamic_cast<const TagLib::ID3v2::TextIdentificationFrame*>(
              FirstFrame(tag, "TCON"))) {
    tags.genre = MakeText(tag.genre(), Declared(genre->textEncoding()));
  }
  tags.track = tag.track();
  tags.year = tag.year();
  if (const TagLib::ID3v2::Frame* disc = FirstFrame(tag, "TPOS")) {
    tags.disc = LeadingNumber(disc->toString());
  }
  return tags;
}

// Any other tag: its texts all stored in `stored`. TagType is the tag's
// own class, whose properties() (not virtual in TagLib 1) knows its fields.
template <typename TagType>
MusicTags FromTag(const TagType& tag, TagLib::String::Type stored) {
  MusicTags tags;
  tags.title = MakeText(tag.title(), stored);
  tags.artist = MakeText(tag.artist(), stored);
  tags.album = MakeText(tag.album(), stored);
  tags.genre = MakeText(tag.genre(), stored);
  tags.comment = MakeText(tag.comment(), stored);
  tags.track = tag.track();
  tags.year = tag.year();
  TagLib::PropertyMap properties = tag.properties();
  auto first = [&properties](const char* key) {
    TagLib::PropertyMap::ConstIterator it = properties.find(key);
    return it == properties.end() || it->second.isEmpty() ? TagLib::String()
                                                          : it->second.front();
  };
  tags.album_artist = MakeText(first("ALBUMARTIST"), stored);
  tags.composer = MakeText(first("COMPOSER"), stored);
  tags.disc = LeadingNumber(first("DISCNUMBER"));
  return tags;
}

// Fills the fields of *into that are empty from `from`.
void Merge(const MusicTags& from, MusicTags* into) {
  TagText MusicTags::*texts[] = {&MusicTags::title,  &MusicTags::artist,
                                 &MusicTags::album,  &MusicTags::album_artist,
                                 &MusicTags::genre,  &MusicTags::composer,
                                 &MusicTags::comment};
  for (TagText MusicTags::*text : texts) {
    if ((into->*text).bytes.empty()) into->*text = from.*text;
  }
  int64_t MusicTags::*numbers[] = {&MusicTags::track, &MusicTags::disc,
                                   &MusicTags::year};
  for (int64_t MusicTags::*number : numbers) {
    if (into->*number <= 0) into->*number = from.*number;
  }
}

// Adds the tags of one source, if present, after those already read.
void AddID3v2(const TagLib::ID3v2::Tag* tag, MusicTags* tags, bool* found) {
  if (tag == nullptr || tag->isEmpty()) return;
  Merge(FromID3v2(*tag), tags);
  *found = true;
}

template <typename TagType>
void AddTag(const TagType* tag, TagLib::String::Type stored, MusicTags* tags,
            bool* found) {
  if (tag == nullptr || tag->isEmpty()) return;
  Merge(FromTag(*tag, stored), tags);
  *found = true;
}

// The Xiph comment of an Ogg file of class FileType.
template <typename FileType>
void AddOgg(TagLib::IOStream* stream, MusicTags* tags, bool* found) {
  FileType file(stream, false);
  AddTag(file.tag(), TagLib::String::UTF8, tags, found);
}

const std::string& AudioCodec(const ContainerFacts& container) {
  static const std::string kNone;
  for (const StreamFacts& stream : container.streams) {
    if (stream.type == StreamFacts::Type::kAudio) return stream.codec;
  }
  return kNone;
}

bool Read(TagLib::IOStream* stream, const ContainerFacts& container,
          MusicTags* tags) {
  using TagLib::String;
  TagLib::ID3v2::FrameFactory* frames = TagLib::ID3v2::FrameFactory::instance();
  const std::string& format = container.format;
  bool found = false;
  if (format == "mp3") {
    TagLib::MPEG::File file(stream, frames, false);
    AddID3v2(file.ID3v2Tag(), tags, &found);
    AddTag(file.APETag(), String::UTF8, tags, &found);
    AddTag(file.ID3v1Tag(), String::Latin1, tags, &found);
  } else if (format == "flac") {
    TagLib::FLAC::File file(stream, frames, false);
    AddTag(file.xiphComment(), String::UTF8, tags, &found);
    AddID3v2(file.ID3v2Tag(), tags, &found);
    AddTag(file.ID3v1Tag(), String::Latin1, tags, &found);
  } else if (format == "ogg") {
    const std::string& codec = AudioCodec(container);
    if (codec == "vorbis") {
      AddOgg<TagLib::Ogg::Vorbis::File>(stream, tags, &found);
    } else if (codec == "opus") {
      AddOgg<TagLib::Ogg::Opus::File>(stream, tags, &found);
    } else if (codec == "flac") {
      AddOgg<TagLib::Ogg::FLAC::File>(stream, tags, &found);
    } else if (codec == "speex") {
      AddOgg<TagLib::Ogg::Speex::File>(stream, tags, &found);
    }
  } else if (format.rfind("mov,mp4,", 0) == 0) {
    TagLib::MP4::File file(stream, false);
    AddTag(file.tag(), String::UTF8, tags, &found);
  } else if (format == "wav") {
    TagLib::RIFF::WAV::File file(stream, false);
    AddID3v2(file.ID3v2Tag(), tags, &found);
    AddTag(file.InfoTag(), String::Latin1, tags, &found);
  } else if (format == "aiff") {
    TagLib::RIFF::AIFF::File file(stream, false);
    AddID3v2(file.tag(), tags, &found);
  } else if (format == "asf") {
    TagLib::ASF::File file(stream, false);
    AddTag(file.tag(), String::UTF16LE, tags, &found);
  } else if (format == "ape") {
    TagLib::APE::File file(stream, false);
    AddTag(file.APETag(), String::UTF8, tags, &found);
    AddTag(file.ID3v1Tag(), String::Latin1, tags, &found);
  } else if (format == "wv") {
    TagLib::WavPack::File file(stream, false);
    AddTag(file.APETag(), String::UTF8, tags, &found);
    AddTag(file.ID3v1Tag(), String::Latin1, tags, &found);
  } else if (format == "mpc" || format == "mpc8") {
    TagLib::MPC::File file(stream, false);
    AddTag(file.APETag(), String::UTF8, tags, &found);
    AddTag(file.ID3v1Tag(), String::Latin1, tags, &found);
  } else if (format == "tta") {
    TagLib::TrueAudio::File file(stream, frames, false);
    AddID3v2(file.ID3v2Tag(), tags, &found);
    AddTag(file.ID3v1Tag(), String::Latin1, tags, &found);
  }
  return found;
}

}  // namespace

bool ReadMusicTags(BoundedReader* reader, const ContainerFacts& container,
                   MusicTags* tags) {
  *tags = MusicTags();
  SetUpTagLib();
  try {
    ReaderStream stream(reader);
    if (Read(&stream, container, tags)) return true;
  } catch (...) {
    // TagLib throws nothing of its own; allocation failures end up here.
  }
  *tags = MusicTags();
  return false;
}

}  // namespace mediaparserd
