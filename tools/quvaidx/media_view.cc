#include "media_view.h"

#include <math.h>
#include <stdio.h>
#include <string.h>

#include <string_view>

namespace quvaidx_cli {
namespace {

constexpr int kLabelWidth = 13;

struct Name {
  const char* codec;  // libavformat's codec name, or the record's AAC name
  const char* shown;
};

constexpr Name kAudioNames[] = {
    {"mp3", "MP3"},
    {"mp2", "MP2"},
    {"aac_lc", "AAC LC"},
    {"aac_he", "HE-AAC"},
    {"aac_main", "AAC Main"},
    {"aac_ltp", "AAC LTP"},
    {"flac", "FLAC"},
    {"alac", "ALAC"},
    {"vorbis", "Vorbis"},
    {"opus", "Opus"},
    {"ac3", "AC-3"},
    {"eac3", "E-AC-3"},
    {"dts", "DTS"},
    {"wmav2", "WMA"},
    {"wmapro", "WMA Pro"},
    {"pcm_s16le", "PCM 16-bit"},
    {"pcm_s24le", "PCM 24-bit"},
    {"ape", "Monkey's Audio"},
    {"wavpack", "WavPack"},
};

constexpr Name kVideoNames[] = {
    {"h264", "H.264"},        {"hevc", "HEVC"},         {"mpeg4", "MPEG-4"},
    {"mpeg2video", "MPEG-2"}, {"mpeg1video", "MPEG-1"}, {"vp8", "VP8"},
    {"vp9", "VP9"},           {"av1", "AV1"},           {"vc1", "VC-1"},
    {"wmv3", "WMV9"},         {"mjpeg", "Motion JPEG"}, {"theora", "Theora"},
};

// Profile numbers as libavcodec gives them.
struct Profile {
  const char* codec;
  int number;
  const char* shown;
};

constexpr Profile kProfiles[] = {
    {"h264", 66, "Baseline"},
    {"h264", 578, "Constrained Baseline"},
    {"h264", 77, "Main"},
    {"h264", 88, "Extended"},
    {"h264", 100, "High"},
    {"h264", 110, "High 10"},
    {"h264", 122, "High 4:2:2"},
    {"h264", 244, "High 4:4:4"},
    {"hevc", 1, "Main"},
    {"hevc", 2, "Main 10"},
    {"hevc", 3, "Main Still Picture"},
    {"hevc", 4, "Rext"},
    {"mpeg4", 0, "Simple"},
    {"mpeg4", 15, "Advanced Simple"},
    {"av1", 0, "Main"},
    {"av1", 1, "High"},
    {"av1", 2, "Professional"},
};

template <size_t N>
std::string Shown(const Name (&names)[N], const char* codec) {
  for (const Name& name : names) {
    if (strcmp(name.codec, codec) == 0) return name.shown;
  }
  return codec;
}

std::string ProfileOf(const char* codec, int number) {
  for (const Profile& profile : kProfiles) {
    if (number == profile.number && strcmp(profile.codec, codec) == 0) {
      return profile.shown;
    }
  }
  return "";
}

std::string Printf(const char* format, double value) {
  char text[64];
  snprintf(text, sizeof(text), format, value);
  return text;
}

// 44100 as "44.1 kHz", 48000 as "48 kHz".
std::string Frequency(int hertz) {
  std::string text = Printf("%.2f", hertz / 1000.0);
  while (text.back() == '0') text.pop_back();
  if (text.back() == '.') text.pop_back();
  return text + " kHz";
}

std::string Channels(int count) {
  switch (count) {
    case 1:
      return "mono";
    case 2:
      return "stereo";
    case 6:
      return "5.1";
    case 8:
      return "7.1";
    default:
      return std::to_string(count) + " channels";
  }
}

std::string BitRate(uint32_t bits) {
  return std::to_string((bits + 500) / 1000) + " kb/s";
}

// "17179 bytes (17.2 kB)".
std::string Size(uint64_t bytes) {
  const char* units[] = {"kB", "MB", "GB", "TB"};
  std::string text = std::to_string(bytes) + (bytes == 1 ? " byte" : " bytes");
  double value = static_cast<double>(bytes);
  int unit = -1;
  while (value >= 1000 && unit < 3) {
    value /= 1000;
    ++unit;
  }
  if (unit >= 0) text += " (" + Printf("%.1f", value) + " " + units[unit] + ")";
  return text;
}

std::string Join(std::initializer_list<std::string> parts) {
  std::string text;
  for (const std::string& part : parts) {
    if (part.empty()) continue;
    if (!text.empty()) text += ' ';
    text += part;
  }
  return text;
}

class Lines {
 public:
  void Add(const char* label, const std::string& value) {
    if (value.empty()) return;
    std::string line = label;
    line.resize(kLabelWidth, ' ');
    lines_.push_back(line + value);
  }
  std::vector<std::string> Take() { return std::move(lines_); }

 private:
  std::vector<std::string> lines_;
};

std::string AudioLine(const __tag_QUVA_MEDIA_INFO& r) {
  if (r.szAudioCodec[0] == '\0') return "";
  return Join({Shown(kAudioNames, r.szAudioCodec),
               r.audio_bitrate != 0 ? BitRate(r.audio_bitrate) : "",
               r.frequency > 0 ? Frequency(r.frequency) : "",
               r.channel > 0 ? Channels(r.channel) : ""});
}

std::string VideoLine(const __tag_QUVA_MEDIA_INFO& r) {
  if (r.szVideoCodec[0] == '\0') return "";
  std::string rate;
  if (r.frame_rate_num > 0 && r.frame_rate_den > 0) {
    double fps = static_cast<double>(r.frame_rate_num) / r.frame_rate_den;
    rate = Printf(fps == floor(fps) ? "%.0f fps" : "%.2f fps", fps);
  }
  return Join(
      {Shown(kVideoNames, r.szVideoCodec),
       ProfileOf(r.szVideoCodec, r.videoProfile),
       r.resolutionX > 0 && r.resolutionY > 0
           ? std::to_string(r.resolutionX) + "x" + std::to_string(r.resolutionY)
           : "",
       rate, r.video_bitrate != 0 ? BitRate(r.video_bitrate) : ""});
}

// "Canon EOS 5D" rather than "Canon Canon EOS 5D".
std::string Camera(const __tag_QUVA_MEDIA_INFO& r) {
  std::string_view make = r.szMake, model = r.szModel;
  if (model.empty()) return std::string(make);
  if (make.empty() || model.substr(0, make.size()) == make) {
    return std::string(model);
  }
  return std::string(make) + " " + std::string(model);
}

std::string Exposure(const __tag_QUVA_MEDIA_INFO& r) {
  std::string text;
  if (r.szExposure[0] != '\0') text = std::string(r.szExposure) + " s";
  if (r.szAperture[0] != '\0') {
    text += (text.empty() ? "f/" : ", f/") + std::string(r.szAperture);
  }
  if (r.iso > 0)
    text += (text.empty() ? "ISO " : ", ISO ") + std::to_string(r.iso);
  return text;
}

std::string Kind(const MediaViewExtras& extras) {
  if (extras.kind.empty()) return extras.table;
  if (extras.kind == extras.table) return extras.kind;
  return extras.kind + " (the name says " + extras.table + ")";
}

}  // namespace

std::string FormatDuration(double seconds) {
  long total = seconds > 0 ? static_cast<long>(seconds + 0.5) : 0;
  char text[32];
  if (total >= 3600) {
    snprintf(text, sizeof(text), "%ld:%02ld:%02ld", total / 3600,
             total / 60 % 60, total % 60);
  } else {
    snprintf(text, sizeof(text), "%ld:%02ld", total / 60, total % 60);
  }
  return text;
}

std::vector<std::string> MediaViewLines(const __tag_QUVA_MEDIA_INFO& r,
                                        const MediaViewExtras& extras) {
  Lines lines;
  lines.Add("Type", Kind(extras));
  lines.Add("Title", r.szTitle);
  lines.Add("Artist", r.szArtist);
  lines.Add("Album", r.szAlbum);
  lines.Add("Album artist", r.szAlbumArtist);
  lines.Add("Composer", r.szComposer);
  lines.Add("Genre", r.szGenre);
  lines.Add("Track", r.track > 0 ? std::to_string(r.track) : "");
  lines.Add("Disc", r.disc > 0 ? std::to_string(r.disc) : "");
  lines.Add("Year", r.year > 0 ? std::to_string(r.year) : "");
  lines.Add("Comment", r.szComment);
  lines.Add("Duration", r.duration > 0 ? FormatDuration(r.duration) : "");
  lines.Add("Video", VideoLine(r));
  if (extras.has_video_metadata) {
    const _VIDEO_METADATA_& video = extras.video;
    lines.Add("Rotation", video.rotation != 0
                              ? std::to_string(video.rotation) + "° clockwise"
                              : "");
    lines.Add("Pixel aspect", video.parWidth != video.parHeight &&
                                      video.parWidth > 0 && video.parHeight > 0
                                  ? std::to_string(video.parWidth) + ":" +
                                        std::to_string(video.parHeight)
                                  : "");
  }
  lines.Add("Audio", AudioLine(r));
  lines.Add("Covers", r.coverCount > 0 ? std::to_string(r.coverCount) : "");
  lines.Add("Camera", Camera(r));
  lines.Add("Exposure", Exposure(r));
  lines.Add("Taken", r.szTakenTime);
  if (r.szVideoCodec[0] == '\0' && r.resolutionX > 0 && r.resolutionY > 0) {
    lines.Add("Picture", std::to_string(r.resolutionX) + "x" +
                             std::to_string(r.resolutionY));
  }
  lines.Add("Container", r.szContainerType);
  lines.Add("Size", Size(r.fileSize));
  lines.Add("Modified", r.szMDate);
  lines.Add("File system", r.szFsUUID);
  return lines.Take();
}

}  // namespace quvaidx_cli
