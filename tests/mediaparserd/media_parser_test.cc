// The media parser on make_fixtures.sh's files against ffprobe, exiftool and
// blkid; legacy tags under the host's code pages; hostile files.
#include "media_parser.h"

#include <fcntl.h>
#include <math.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "media_test_util.h"
#include "photo_exif.h"
#include "record_fill.h"
#include "support/unprivileged.h"

namespace mediaparserd::test {
namespace {

using quvaidx::test::FdLeakCheck;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

class MediaParserTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { InitMediaLibraries(kDefaultMaxAlloc); }

  // Parses `path`; on failure the reason is in reason_.
  bool Parse(const std::string& path, const ParserOptions& options = {}) {
    reason_.clear();
    return MediaParser(options).Parse(path, &media_, &reason_);
  }
  const __tag_QUVA_MEDIA_INFO& MustParse(const std::string& path) {
    EXPECT_TRUE(Parse(path)) << path << ": " << reason_;
    return media_.record;
  }

  ParsedMedia media_;
  std::string reason_;
};

// ffprobe's integer fields arrive as numbers or as decimal texts.
int64_t Number(const Json::Value& value) {
  if (value.isIntegral()) return value.asInt64();
  return value.isString() ? strtoll(value.asCString(), nullptr, 10) : 0;
}

// "25/1" as its terms.
std::pair<int64_t, int64_t> Ratio(const Json::Value& value, char separator) {
  std::string text = value.asString();
  size_t at = text.find(separator);
  if (at == std::string::npos) return {0, 0};
  return {strtoll(text.c_str(), nullptr, 10),
          strtoll(text.c_str() + at + 1, nullptr, 10)};
}

// The first stream of a kind in ffprobe's answer that is not a cover.
Json::Value ProbeStream(const Json::Value& probe, const char* kind) {
  for (const Json::Value& stream : probe["streams"]) {
    if (stream["codec_type"].asString() == kind &&
        Number(stream["disposition"]["attached_pic"]) == 0) {
      return stream;
    }
  }
  return Json::Value();
}

// ffprobe's profile names of the video fixtures, as numbers.
int64_t VideoProfile(const std::string& codec, const std::string& name) {
  if (codec == "hevc") return name == "Main" ? 1 : -1;
  if (name == "High") return 100;
  if (name == "Main") return 77;
  return name == "Constrained Baseline" ? 578 : -1;
}

// The cheap first look at the file's head: a still image or not.
bool HeadLooksLikePhoto(const std::string& path) {
  std::string head = ReadFile(path).substr(0, 4096);
  return LooksLikePhoto(reinterpret_cast<const uint8_t*>(head.data()),
                        static_cast<int64_t>(head.size()));
}

// blkid's UUID of the device behind `path`'s st_dev ("" where it cannot be
// read, as in some containers, or there is none, as for a tmpfs).
std::string BlkidUuid(const std::string& path) {
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return "?";
  std::string uuid =
      CommandOutput("d=$(sed -n 's/^DEVNAME=//p' /sys/dev/block/" +
                    std::to_string(major(st.st_dev)) + ":" +
                    std::to_string(minor(st.st_dev)) +
                    "/uevent 2>/dev/null) && [ -n \"$d\" ] && "
                    "blkid -p -s UUID -o value \"/dev/$d\" 2>/dev/null");
  if (!uuid.empty()) uuid.pop_back();
  return uuid;
}

// Fields against ffprobe, EXIF against exiftool, the file's against stat;
// only still images look like photos (exiv2 also reads QuickTime and more).
class OracleTest : public MediaParserTest,
                   public ::testing::WithParamInterface<const char*> {};

TEST_P(OracleTest, TechnicalFieldsAndTagsAgreeWithFfprobe) {
  HostCodePage host("UTF-8");
  const char* name = GetParam();
  std::string path = Fixture(name);
  const __tag_QUVA_MEDIA_INFO& r = MustParse(path);
  Json::Value probe = CommandJson(
      "ffprobe -v error -show_format -show_streams -of json " + Quoted(path));
  ASSERT_TRUE(probe.isObject());
  const Json::Value& format = probe["format"];
  EXPECT_EQ(r.szContainerType,
            ContainerTypeName(format["format_name"].asString()));
  EXPECT_EQ(r.fileSize, static_cast<uint64_t>(Number(format["size"])));
  EXPECT_EQ(r.szPath, path);
  EXPECT_STREQ(r.szName, name);
  struct stat status;
  ASSERT_EQ(stat(path.c_str(), &status), 0);
  char date[32];
  strftime(date, sizeof(date), "%Y-%m-%d %H:%M:%S",
           localtime(&status.st_mtime));
  EXPECT_STREQ(r.szDate, date);
  EXPECT_STREQ(r.szMDate, date);
  EXPECT_EQ(r.szFsUUID, BlkidUuid(path));
  int covers = 0;
  for (const Json::Value& stream : probe["streams"]) {
    covers += Number(stream["disposition"]["attached_pic"]) != 0;
  }
  Json::Value audio = ProbeStream(probe, "audio");
  Json::Value video = ProbeStream(probe, "video");
  const bool photo = strncmp(name, "photo", 5) == 0;
  EXPECT_EQ(HeadLooksLikePhoto(path), photo);
  EXPECT_EQ(media_.kind == MediaKind::kPhoto, photo);
  if (photo || !video.isNull()) {
    EXPECT_EQ(r.resolutionX, Number(video["width"]));
    EXPECT_EQ(r.resolutionY, Number(video["height"]));
  }
  if (photo) {  // the camera's fields against exiftool; only videos turn
    Json::Value exif = CommandJson("exiftool -j " + Quoted(path))[0];
    EXPECT_EQ(r.szMake, exif["Make"].asString());
    EXPECT_EQ(r.szModel, exif["Model"].asString());
    EXPECT_EQ(r.szExposure, exif["ExposureTime"].asString());
    EXPECT_DOUBLE_EQ(atof(r.szAperture), exif["FNumber"].asDouble());
    EXPECT_EQ(r.iso, exif["ISO"].asInt());
    std::string taken = exif["DateTimeOriginal"].asString();
    if (!taken.empty()) taken[4] = taken[7] = '-';
    EXPECT_EQ(r.szTakenTime, taken);
    EXPECT_EQ(media_.orientation,
              exif["Orientation"] == "Rotate 90 CW" ? 6 : 0);
    EXPECT_EQ(media_.video.rotation, 0);
    return;
  }
  EXPECT_NEAR(r.duration, atof(format["duration"].asCString()), 1e-3);
  EXPECT_EQ(r.frame_bitrate, Number(format["bit_rate"]));
  EXPECT_EQ(r.coverCount, covers);
  EXPECT_EQ(media_.kind,
            video.isNull() ? MediaKind::kMusic : MediaKind::kVideo);
  if (!audio.isNull()) {
    EXPECT_EQ(r.frequency, Number(audio["sample_rate"]));
    EXPECT_EQ(r.channel, Number(audio["channels"]));
    int64_t rate = Number(audio["bit_rate"]);
    if (rate == 0 && video.isNull()) rate = Number(format["bit_rate"]);
    EXPECT_EQ(r.audio_bitrate, rate);
    std::string codec = audio["codec_name"].asString();
    if (codec == "aac") {  // the HE-AAC fixture signals SBR but holds none
      codec = audio["profile"].asString() == "HE-AAC" ||
                      std::string(name) == "song_he.m4a"
                  ? "aac_he"
                  : "aac_lc";
    }
    EXPECT_EQ(r.szAudioCodec, codec);
  }
  if (!video.isNull()) {
    EXPECT_EQ(r.szVideoCodec, video["codec_name"].asString());
    EXPECT_EQ(r.videoProfile, VideoProfile(video["codec_name"].asString(),
                                           video["profile"].asString()));
    EXPECT_EQ(r.videoLevel, Number(video["level"]));
    EXPECT_EQ(r.video_bitrate, Number(video["bit_rate"]));
    auto [num, den] = Ratio(video["avg_frame_rate"], '/');
    EXPECT_EQ(r.frame_rate_num, num);
    EXPECT_EQ(r.frame_rate_den, den);
    int rotation = 0;
    for (const Json::Value& side : video["side_data_list"]) {
      if (side.isMember("rotation")) {
        rotation = ((-side["rotation"].asInt()) % 360 + 360) % 360;
      }
    }
    EXPECT_EQ(media_.video.rotation, rotation);
    auto [sar_w, sar_h] = Ratio(video["sample_aspect_ratio"], ':');
    if (sar_w <= 0 || sar_h <= 0) sar_w = sar_h = 1;
    EXPECT_EQ(media_.video.parWidth, sar_w);
    EXPECT_EQ(media_.video.parHeight, sar_h);
  }
  // Tags: the container's, or (Ogg) the audio stream's.
  Json::Value tags = format["tags"];
  if (tags.isNull()) tags = audio["tags"];
  auto tag = [&tags](const char* key) {
    for (const std::string& member : tags.getMemberNames()) {
      if (strcasecmp(member.c_str(), key) == 0) return tags[member].asString();
    }
    return std::string();
  };
  EXPECT_EQ(r.szTitle, tag("title"));
  EXPECT_EQ(r.szArtist, tag("artist"));
  EXPECT_EQ(r.szAlbum, tag("album"));
  EXPECT_EQ(r.szGenre, tag("genre"));
  EXPECT_EQ(r.szComposer, tag("composer"));
  EXPECT_EQ(r.szComment, tag("comment"));
  EXPECT_EQ(r.szAlbumArtist,
            tag("album_artist") + tag("albumartist") + tag("album artist"));
  EXPECT_EQ(r.track, atoi(tag("track").c_str()));
  EXPECT_EQ(r.disc, atoi(tag("disc").c_str()));
  EXPECT_EQ(r.year, atoi(tag("date").c_str()));
}

INSTANTIATE_TEST_SUITE_P(
    Fixtures, OracleTest,
    ::testing::Values("song_id3v24.mp3", "song_id3v23_utf16.mp3", "song.flac",
                      "song.ogg", "song_lc.m4a", "song_he.m4a", "song.wav",
                      "song.aiff", "song.wma", "song.wv", "song.tta",
                      "song.opus", "song.oga", "video_rot90.mp4", "video.mkv",
                      "video_baseline.mp4", "video_hevc.mp4", "photo.png",
                      "photo.gif", "photo.tif", "photo.bmp", "photo.webp",
                      "photo_exif.jpg"));

// A file system without a superblock (a tmpfs) has no UUID.
TEST_F(MediaParserTest, FileSystemWithoutSuperblockHasNoUuid) {
  if (access("/dev/shm", W_OK) != 0) GTEST_SKIP() << "no /dev/shm";
  char dir[] = "/dev/shm/quvaidx-test-XXXXXX";
  ASSERT_NE(mkdtemp(dir), nullptr);
  std::string copy = std::string(dir) + "/song.ogg";
  WriteFile(copy, ReadFile(Fixture("song.ogg")));
  bool parsed = Parse(copy);
  unlink(copy.c_str());
  rmdir(dir);
  ASSERT_TRUE(parsed) << reason_;
  EXPECT_STREQ(media_.record.szFsUUID, "");
}

// ID3v1 and Latin-1 ID3v2 texts are decoded in the host's code page; where
// they cannot be, the title is the file's name, the album its folder's.
TEST_F(MediaParserTest, LegacyTagsAreReadInTheHostCodePage) {
  std::string folder = Fixture("");
  folder = folder.substr(0, folder.size() - 1);
  folder = folder.substr(folder.rfind('/') + 1);
  const struct {
    const char *file, *code_page, *title, *artist, *album, *comment, *genre;
    int year, track;
  } cases[] = {
      {"song_id3v1_cp1251.mp3", "windows-1251", "Привет", "Кино",
       "Группа крови", "Комментарий", "Rock", 1999, 7},
      {"song_id3v23_cp1251.mp3", "windows-1251", "Привет", "Кино",
       "Группа крови", "Комментарий", "", 2001, 5},
      {"song_gbk.mp3", "windows-936", "你好", "王菲", "天空", "评论", "Rock",
       2001, 5},
      // ID3v1 cuts the comment to 28 bytes; the ID3v2 frame wins anyway.
      {"song_id3v23_utf16.mp3", "windows-1251", "Привет, мир", "Zoë",
       "The Album", "A comment", "Rock", 2021, 3},
      {"song_id3v1_cp1251.mp3", "UTF-8", "song_id3v1_cp1251", "",
       folder.c_str(), "", "Rock", 1999, 7},  // ID3v1 genre 17 by its name
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.file) + " in " + c.code_page);
    HostCodePage host(c.code_page);
    const __tag_QUVA_MEDIA_INFO& r = MustParse(Fixture(c.file));
    EXPECT_STREQ(r.szTitle, c.title);
    EXPECT_STREQ(r.szArtist, c.artist);
    EXPECT_STREQ(r.szAlbum, c.album);
    EXPECT_STREQ(r.szComment, c.comment);
    EXPECT_STREQ(r.szGenre, c.genre);
    EXPECT_EQ(r.year, c.year);
    EXPECT_EQ(r.track, c.track);
  }
}

// An ID3v2.3 frame `id` holding `body`.
std::string Id3v2Frame(const char* id, const std::string& body) {
  std::string frame = id;
  for (int shift : {24, 16, 8, 0})
    frame += static_cast<char>(body.size() >> shift);
  return frame + std::string(2, '\0') + body;
}

// Frames of an undeclared encoding give clean text or none; the comment
// without a description counts, genres by name, the disc's leading number.
TEST_F(MediaParserTest, Id3v2FramesAreReadSafely) {
  HostCodePage host("UTF-8");
  TempDir dir;
  auto latin1 = [](const char* text) { return std::string(1, '\0') + text; };
  const std::string frames =
      Id3v2Frame("COMM", std::string("\0engiTunNORM\0 0001", 18)) +
      Id3v2Frame("TPE1", latin1("Kino")) + Id3v2Frame("TCON", latin1("(17)")) +
      Id3v2Frame("TPOS", latin1("2/3"));
  const std::string notes = Id3v2Frame("COMM", std::string("\0eng\0Notes", 10));
  const std::tuple<char, std::string, const char*> cases[] = {
      {'\x04', notes, "Notes"},
      {'\x65', notes, "Notes"},
      {'\xFF', "", " 0001"}};  // only a described comment: that one
  for (const auto& [encoding, comment, expected] : cases) {
    std::string tag = "ID3\x03" + std::string(2, '\0');
    std::string all =
        Id3v2Frame("TIT2", encoding + std::string("AB\0CD\xFF\xFE", 7)) +
        frames + comment;
    for (int shift : {21, 14, 7, 0})
      tag += static_cast<char>((all.size() >> shift) & 0x7F);
    WriteFile(dir.File("odd.mp3"),
              tag + all + ReadFile(Fixture("song_id3v1_cp1251.mp3")));
    ASSERT_TRUE(Parse(dir.File("odd.mp3"))) << reason_;
    EXPECT_TRUE(IsValidUTF8(media_.record.szTitle));
    EXPECT_STREQ(media_.record.szArtist, "Kino");
    EXPECT_STREQ(media_.record.szComment, expected);
    EXPECT_STREQ(media_.record.szGenre, "Rock");
    EXPECT_EQ(media_.record.disc, 2);
    EXPECT_EQ(media_.record.year, 1999);  // from the ID3v1 tag
  }
}

// The content, not the name, decides the type and the tag reader.
TEST_F(MediaParserTest, ContentNotNameDecidesTheType) {
  TempDir dir;
  // fixture, copied to, kind, container, title
  const std::tuple<const char*, const char*, MediaKind, const char*,
                   const char*>
      cases[] = {
          {"song_id3v24.mp3", "song.mp4", MediaKind::kMusic, "mp3",
           "Überschrift ✓"},
          {"song.spx", "song.flac", MediaKind::kMusic, "ogg", "Song Title"},
          {"video.mkv", "clip.mp3", MediaKind::kVideo, "matroska,webm",
           "Matroska Clip"},
          {"photo_exif.jpg", "photo.mp4", MediaKind::kPhoto, "image2", ""}};
  for (const auto& [fixture, name, kind, container, title] : cases) {
    SCOPED_TRACE(name);
    WriteFile(dir.File(name), ReadFile(Fixture(fixture)));
    ASSERT_TRUE(Parse(dir.File(name))) << reason_;
    EXPECT_EQ(media_.kind, kind);
    EXPECT_STREQ(media_.record.szContainerType, container);
    EXPECT_STREQ(media_.record.szTitle, title);
  }
  EXPECT_STREQ(media_.record.szMake, "Canon");
}

// Non-media (or a file its mode forbids) is refused with a reason, never a
// zeroed record; a file cut after its header tells what the header tells.
TEST_F(MediaParserTest, NonMediaIsRefusedWithAReason) {
  TempDir dir;
  FdLeakCheck fds;
  const std::string mp4 = ReadFile(Fixture("video_rot90.mp4"));
  const size_t mdat = mp4.find("mdat") - 4;  // the fixture's moov is before
  const std::tuple<const char*, std::string, const char*> files[] = {
      {"fake.png", "hello", "not a media file"},
      {"zeros.mp3", std::string(1 << 20, '\0'), "not a media file"},
      {"empty.jpg", "", "empty file"},
      {"cut.mp4", mp4.substr(0, 200), "no audio or video stream"},
      {"nomoov.mp4", mp4.substr(0, 40) + mp4.substr(mdat),
       "damaged media file (mov,mp4,m4a,3gp,3g2,mj2: "},
      {"cut.jpg", ReadFile(Fixture("photo_exif.jpg")).substr(0, 40),
       "damaged image ("},
      {"nosize.png",  // a header of zero width and height
       ReadFile(Fixture("photo.png")).replace(16, 8, 8, '\0'),
       "damaged image (no pixel size)"}};
  std::vector<std::pair<std::string, const char*>> cases = {
      {dir.File("fifo.mp3"), "not a regular file"},
      {dir.File("album.png"), "not a regular file"},
      {dir.File("zero.mp3"), "not a regular file"},
      {dir.File("none.mp3"), "No such file or directory"},
      {"relative/song.mp3", "path is not absolute"},
      {std::string("/tmp/a\0b.mp3", 12), "path holds a zero byte"},
      {"/" + std::string(5000, 'a'), "path too long"}};
  for (const auto& [name, bytes, reason] : files) {
    WriteFile(dir.File(name), bytes);
    cases.emplace_back(dir.File(name), reason);
  }
  ASSERT_EQ(mkfifo(dir.File("fifo.mp3").c_str(), 0600), 0);
  ASSERT_EQ(mkdir(dir.File("album.png").c_str(), 0700), 0);
  ASSERT_EQ(symlink("/dev/zero", dir.File("zero.mp3").c_str()), 0);
  for (const auto& [path, reason] : cases) {
    EXPECT_FALSE(Parse(path)) << path;
    EXPECT_EQ(reason_.rfind(reason, 0), 0u) << path << ": " << reason_;
  }
  EXPECT_TRUE(fds.NoLeak());
  // Mode 0 keeps even the owner out: a daemon that is not root cannot read.
  const std::string secret = dir.File("secret.mp3");
  WriteFile(secret, ReadFile(Fixture("song_id3v24.mp3")));
  ASSERT_EQ(chmod(secret.c_str(), 0), 0);
  ASSERT_EQ(chmod(dir.path().c_str(), 0755), 0);
  EXPECT_EQ(quvaidx::test::RunUnprivileged([&] {
              return Parse(secret) || reason_ != "Permission denied";
            }),
            0);
  HostCodePage host("UTF-8");
  for (const char* name : {"video_rot90.mp4", "song.flac", "song_id3v24.mp3"}) {
    std::string whole = ReadFile(Fixture(name));
    WriteFile(dir.File(name), whole.substr(0, whole.size() / 2));
    ASSERT_TRUE(Parse(dir.File(name))) << name << ": " << reason_;
    EXPECT_GT(media_.record.duration, 0.5f) << name;
    EXPECT_STRNE(media_.record.szTitle, "") << name;
  }
}

// A photo without a pixel size (no frame header) is still a photo when any
// one camera field can be read; with none, a damaged image.
TEST_F(MediaParserTest, PicturesWithoutASizeInTheirHeader) {
  TempDir dir;
  const std::string jpeg = dir.File("p.jpg");
  const std::tuple<const char*, const char*, const char*> cases[] = {
      {"-Make=Leica", "szMake", "\"Leica\""},
      {"-Model=M6", "szModel", "\"M6\""},
      {"-ExposureTime=1/60", "szExposure", "\"1/60\""},
      {"-FNumber=2", "szAperture", "\"2.0\""},
      {"-ISO=100", "iso", "100"},
      {"-DateTimeOriginal=2020:01:02 03:04:05", "szTakenTime",
       "\"2020-01-02 03:04:05\""},
      {"-Artist=nobody", "", ""}};
  for (const auto& [tag, field, value] : cases) {
    SCOPED_TRACE(tag);
    WriteFile(jpeg, ReadFile(Fixture("photo_exif.jpg")));
    CommandOutput("exiftool -q -all= -overwrite_original " + Quoted(tag) + " " +
                  Quoted(jpeg));
    std::string bytes = ReadFile(jpeg);
    size_t sof = bytes.find("\xFF\xC0");  // the frame header, with the size
    ASSERT_NE(sof, std::string::npos);
    bytes.erase(sof, 2 + (static_cast<uint8_t>(bytes[sof + 2]) << 8 |
                          static_cast<uint8_t>(bytes[sof + 3])));
    WriteFile(jpeg, bytes);
    if (field[0] == '\0') {
      EXPECT_FALSE(Parse(jpeg));
      EXPECT_EQ(reason_, "damaged image (no pixel size)");
      continue;
    }
    ASSERT_TRUE(Parse(jpeg)) << reason_;
    EXPECT_EQ(media_.kind, MediaKind::kPhoto);
    Json::Value json;
    MediaInfoObject2Json(media_.record, json);
    EXPECT_EQ(Json::FastWriter().write(json[field]), std::string(value) + "\n");
    EXPECT_EQ(media_.record.resolutionX + media_.record.resolutionY, 0);
  }
  // A video header without a picture size is not trusted: the picture is
  // decoded for it.
  const std::string video = ReadFile(Fixture("video_rot90.mp4"));
  // The sample entry of the picture stream: its width, then its height.
  const size_t entry = video.find("avc1", video.find("stsd"));
  ASSERT_NE(entry, std::string::npos);
  for (size_t at : {entry + 28, entry + 30}) {
    std::string patched = video;
    patched[at] = patched[at + 1] = '\0';
    WriteFile(dir.File("zero.mp4"), patched);
    ASSERT_TRUE(Parse(dir.File("zero.mp4"))) << reason_;
    EXPECT_EQ(media_.record.resolutionX, 320) << at - entry;
    EXPECT_EQ(media_.record.resolutionY, 240) << at - entry;
  }
}

// The time and read limits end the reading with a reason; sparse files of
// 4 GiB and more are read within them (a song and zeros, or zeros alone).
TEST_F(MediaParserTest, LimitsBoundTheReadingOfFilesOfAnySize) {
  ParserOptions options;
  options.read.time_ms = 0;
  EXPECT_FALSE(Parse(Fixture("video.mkv"), options));
  EXPECT_EQ(reason_, "gave up after 0 ms (time limit)");
  options = ParserOptions();
  options.read.bytes = 8 << 10;
  EXPECT_FALSE(Parse(Fixture("song.wav"), options));
  EXPECT_EQ(reason_, "gave up after reading 0 MiB (read limit)");
  options.read.bytes = 1 << 20;
  EXPECT_TRUE(Parse(Fixture("song.wav"), options)) << reason_;
  TempDir dir;
  std::string song = dir.File("long.mp3");
  WriteFile(song, ReadFile(Fixture("song_id3v1_cp1251.mp3")));
  ASSERT_EQ(truncate(song.c_str(), (off_t{5} << 30) + 7), 0);
  std::string zeros = dir.File("zeros.mp4");
  WriteFile(zeros, "");
  ASSERT_EQ(truncate(zeros.c_str(), off_t{4} << 30), 0);
  HostCodePage host("windows-1251");
  ParserOptions patient;  // a slow machine gets the time the read limit takes
  patient.read.time_ms = 120 * 1000;
  ASSERT_TRUE(Parse(song, patient)) << reason_;
  EXPECT_EQ(media_.record.fileSize, (uint64_t{5} << 30) + 7);
  EXPECT_EQ(media_.kind, MediaKind::kMusic);
  EXPECT_FALSE(Parse(zeros, patient));
  EXPECT_EQ(reason_, "not a media file");
}

// A file rewritten, cut and grown by another process while it is read gets
// an answer every time, and the parser lives on.
TEST_F(MediaParserTest, FileChangingWhileReadIsAnswered) {
  TempDir dir;
  std::string path = dir.File("moving.mp4");
  std::string video = ReadFile(Fixture("video_rot90.mp4"));
  WriteFile(path, video);
  std::atomic<bool> done{false};
  std::thread writer([&] {
    int fd = open(path.c_str(), O_WRONLY);
    for (size_t i = 0; !done && i < 100000; ++i) {
      off_t size = static_cast<off_t>((i * 7919) % (video.size() + 4096));
      if (ftruncate(fd, size) != 0) break;
      if (i % 3 == 0) (void)!pwrite(fd, video.data(), video.size() / 2, 0);
    }
    close(fd);
  });
  int answered = 0;
  for (int i = 0; i < 40; ++i) answered += Parse(path) || !reason_.empty();
  done = true;
  writer.join();
  EXPECT_EQ(answered, 40);
  WriteFile(path, video);
  EXPECT_TRUE(Parse(path)) << reason_;
}

}  // namespace
}  // namespace mediaparserd::test
