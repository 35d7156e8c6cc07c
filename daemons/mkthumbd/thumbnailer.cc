// Sections: 1. small helpers; 2. the EA directory and its items; 3. reading
// the photo and estimating its decode; 4. decoding and writing; 5. the
// public functions.
#include "thumbnailer.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <malloc.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <utility>
#include <vector>

#include <quvaidx/ea_file.h>
#include <vips/vips.h>

#include "atomic_file.h"
#include "fs_identity.h"
#include "preview_names.h"

namespace mkthumbd {
namespace {

using quvaidx_daemons::kThumbSizes;
using quvaidx_daemons::ThumbSize;
using Format = DecodeFacts::Format;

// ---------------------------------------------------------------------------
// 1. Small helpers

// Temporary files are "<item>.part-XXXXXX"; this marks them for clean-up.
constexpr char kPartMarker[] = ".part-";
// The common prefix of the thumbnail items.
constexpr char kItemPrefix[] = "QUVAPHOTO_THUMB_";

// Owns one VipsImage reference.
struct ImageUnref {
  void operator()(VipsImage* image) const { g_object_unref(image); }
};
using Image = std::unique_ptr<VipsImage, ImageUnref>;

// Owns one descriptor.
class Fd {
 public:
  explicit Fd(int fd = -1) : fd_(fd) {}
  ~Fd() {
    if (fd_ >= 0) close(fd_);
  }
  Fd(const Fd&) = delete;
  Fd& operator=(const Fd&) = delete;
  void reset(int fd) {
    if (fd_ >= 0) close(fd_);
    fd_ = fd;
  }
  int get() const { return fd_; }

 private:
  int fd_;
};

// libvips's last error, without its final line feed, and cleared.
std::string VipsError() {
  std::string text = vips_error_buffer();
  vips_error_clear();
  while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) {
    text.pop_back();
  }
  size_t newline = text.find('\n');  // the first line says enough
  if (newline != std::string::npos) text.resize(newline);
  return text.empty() ? "unknown libvips error" : text;
}

mode_t g_umask = 022;                   // the process's, read at start
quvaidx_daemons::FsUser g_daemon_user;  // the process's own identity

bool Newer(const struct timespec& a, const struct timespec& b) {
  return a.tv_sec > b.tv_sec || (a.tv_sec == b.tv_sec && a.tv_nsec > b.tv_nsec);
}

PhotoResult Skipped(std::string reason) {
  PhotoResult result;
  result.outcome = PhotoOutcome::kSkipped;
  result.reason = std::move(reason);
  return result;
}

// ---------------------------------------------------------------------------
// 2. The EA directory and its items

// Why OpenEADir failed with `err`, in a few words.
std::string EADirProblem(int err) {
  if (err == ELOOP) return "a symbolic link is in the way of its EA directory";
  return std::string("cannot open its EA directory: ") + strerror(err);
}

// True when the thumbnail `size` is up to date in the EA directory open as
// `ea_fd`: either name a regular file (not a link) of 2 bytes or more,
// modified after the photo.
bool UpToDate(int ea_fd, const struct stat& photo, const ThumbSize& size) {
  for (const char* name : {size.name, size.second_name}) {
    struct stat st;
    if (fstatat(ea_fd, name, &st, AT_SYMLINK_NOFOLLOW) == 0) {
      return S_ISREG(st.st_mode) && st.st_size >= 2 &&
             Newer(st.st_mtim, photo.st_mtim);
    }
  }
  return false;
}

// Removes the temporary thumbnail files that a killed daemon left in the EA
// directory open as `ea_fd`: regular files only, never a link.
void RemoveLeftoverParts(int ea_fd) {
  int listing = dup(ea_fd);
  DIR* dir = listing < 0 ? nullptr : fdopendir(listing);
  if (dir == nullptr) {
    if (listing >= 0) close(listing);
    return;
  }
  rewinddir(dir);  // the duplicate shares its position with ea_fd
  std::vector<std::string> parts;
  while (struct dirent* entry = readdir(dir)) {
    const char* name = entry->d_name;
    if (strncmp(name, kItemPrefix, strlen(kItemPrefix)) == 0 &&
        strstr(name, kPartMarker) != nullptr) {
      parts.push_back(name);
    }
  }
  closedir(dir);
  for (const std::string& name : parts) {
    struct stat st;
    if (fstatat(ea_fd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 &&
        S_ISREG(st.st_mode)) {
      unlinkat(ea_fd, name.c_str(), 0);  // gone meanwhile: as good
    }
  }
}

// Gives the thumbnail open as `fd` the owner and group of `photo`, and its
// read bits. chown needs the daemon's own identity (root's CAP_CHOWN, which
// the folder owner's file-system identity does not carry); it is taken for
// these two calls on the descriptor only.
std::string GiveAccessOfPhoto(int fd, const struct stat& photo) {
  mode_t mode = ((photo.st_mode & 0444) | 0200) & ~g_umask;
  struct stat st;
  if (fstat(fd, &st) != 0) return strerror(errno);
  quvaidx_daemons::FsIdentity as_daemon(g_daemon_user);
  bool owned = st.st_uid == photo.st_uid && st.st_gid == photo.st_gid;
  if (!owned) owned = fchown(fd, photo.st_uid, photo.st_gid) == 0;
  // Readers of the photo's group and others are not those of this file:
  // only its owner, who has just read the photo, may read it.
  if (!owned) mode &= 0600;
  if (fchmod(fd, mode) != 0) return strerror(errno);
  return "";
}

// ---------------------------------------------------------------------------
// 3. Reading the photo and estimating its decode

// Reads up to `size` bytes of the file open as `fd` from its start. Returns
// the bytes read (fewer when it shrank meanwhile), or false on an error.
bool ReadWhole(int fd, off_t size, std::vector<unsigned char>* bytes,
               std::string* error) {
  bytes->resize(static_cast<size_t>(size));
  size_t done = 0;
  while (done < bytes->size()) {
    ssize_t got = pread(fd, bytes->data() + done, bytes->size() - done,
                        static_cast<off_t>(done));
    if (got < 0 && errno == EINTR) continue;  // Retry
    if (got < 0) {
      *error = std::string("cannot read it: ") + strerror(errno);
      return false;
    }
    if (got == 0) break;
    done += static_cast<size_t>(got);
  }
  bytes->resize(done);
  return true;
}

// The format of a loader's nickname, or false for a loader not used here.
bool FormatOfLoader(const char* loader, Format* format) {
  static const std::pair<const char*, Format> kLoaders[] = {
      {"jpegload", Format::kJpeg}, {"pngload", Format::kPng},
      {"gifload", Format::kGif},   {"webpload", Format::kWebp},
      {"tiffload", Format::kTiff}, {"heifload", Format::kHeif},
  };
  for (const auto& [prefix, value] : kLoaders) {
    if (strncmp(loader, prefix, strlen(prefix)) == 0) {
      *format = value;
      return true;
    }
  }
  return false;
}

int IntField(VipsImage* image, const char* field, int otherwise) {
  int value = otherwise;
  if (vips_image_get_typeof(image, field) != 0) {
    vips_image_get_int(image, field, &value);
  }
  return value;
}

// The shrink-on-load factor for a photo of long side `long_side` whose
// largest thumbnail needs `target`: the largest of 8, 4, 2 that keeps at
// least `target` pixels, else 1.
int LoadShrink(long long long_side, int target) {
  for (int shrink : {8, 4, 2}) {
    if (long_side / shrink >= target) return shrink;
  }
  return 1;
}

// True when the WebP file `bytes` holds one lossy (VP8) image: its first
// image chunk is "VP8 ". Lossless ("VP8L"), animated ("ANIM", "ANMF") and
// unknown layouts are not.
bool LossyWebp(const std::vector<unsigned char>& bytes) {
  size_t at = 12;  // after "RIFF", the size and "WEBP"
  for (int chunk = 0; chunk < 64 && at + 8 <= bytes.size(); ++chunk) {
    const unsigned char* head = bytes.data() + at;
    if (memcmp(head, "VP8 ", 4) == 0) return true;
    if (memcmp(head, "VP8L", 4) == 0 || memcmp(head, "ANIM", 4) == 0 ||
        memcmp(head, "ANMF", 4) == 0) {
      return false;
    }
    const size_t size = head[4] | head[5] << 8 | head[6] << 16 |
                        static_cast<size_t>(head[7]) << 24;
    at += 8 + size + (size & 1);  // chunks are padded to an even size
  }
  return false;
}

// The facts of the photo `bytes` whose header is `header`.
DecodeFacts FactsOf(Format format, VipsImage* header,
                    const std::vector<unsigned char>& bytes, int target) {
  DecodeFacts facts;
  facts.format = format;
  facts.width = header->Xsize;
  facts.height = header->Ysize;
  facts.bands = header->Bands;
  facts.sample_bytes = static_cast<int>(vips_format_sizeof(header->BandFmt));
  facts.alpha = vips_image_hasalpha(header) != 0;
  facts.file_bytes = static_cast<long long>(bytes.size());
  if (format == Format::kJpeg) {
    facts.progressive = IntField(header, "jpeg-multiscan", 0) != 0;
    const char* subsample = nullptr;
    facts.subsampled =
        vips_image_get_typeof(header, "jpeg-chroma-subsample") != 0 &&
        vips_image_get_string(header, "jpeg-chroma-subsample", &subsample) ==
            0 &&
        strcmp(subsample, "4:2:0") == 0;
  } else if (format == Format::kPng) {
    facts.progressive = IntField(header, "interlaced", 0) != 0;
  } else if (format == Format::kHeif) {
    facts.sample_bytes = IntField(header, "heif-bitdepth", 8) > 8 ? 2 : 1;
  } else if (format == Format::kWebp) {
    facts.lossless = !LossyWebp(bytes);
  }
  if (format == Format::kJpeg || format == Format::kWebp) {
    facts.shrink = LoadShrink(std::max(facts.width, facts.height), target);
  }
  return facts;
}

}  // namespace

long long DecodePeakBytes(const DecodeFacts& facts) {
  // The factors were measured (peak resident memory of one photo's
  // thumbnails, 9 to 52 megapixels, each format) and rounded up.
  const long long pixels = facts.width * facts.height;
  const long long shrunk = pixels / (facts.shrink * facts.shrink);
  const long long sample = facts.bands * facts.sample_bytes;
  // libvips's lines between the decoder and the first reduction: about
  // 2400 lines of the image as loaded, at 3 bytes a pixel or more; with
  // transparency, premultiplied in floats (4 bytes a band), about 1600.
  const long long loaded_width = facts.width / facts.shrink + 1;
  const long long loaded_height = facts.height / facts.shrink + 1;
  const long long window =
      facts.alpha
          ? std::min(1600LL, loaded_height) * loaded_width * facts.bands * 4
          : std::min(2400LL, loaded_height) * loaded_width *
                std::max(sample, 3LL);
  long long decoder = 0;
  switch (facts.format) {
    case Format::kJpeg:
      // A progressive JPEG holds every DCT coefficient (2 bytes) of every
      // component, whatever the shrink: 3 bands at 4:2:0 make 1.5 a pixel,
      // otherwise one a band.
      if (facts.progressive) {
        decoder = facts.subsampled ? 3 * pixels : 2 * facts.bands * pixels;
      }
      decoder += shrunk * sample;  // the scaled output
      break;
    case Format::kPng:
      // Interlaced: the whole image is read before the first line is given.
      if (facts.progressive) decoder = pixels * sample;
      break;
    case Format::kGif:
      decoder = 4 * pixels;  // libnsgif's RGBA frame
      break;
    case Format::kWebp:
      // libwebp decodes a lossless (or animated) image whole as ARGB before
      // scaling; a lossy one by rows (its alpha plane whole).
      decoder = (facts.lossless ? 4 : 1) * pixels + 4 * shrunk;
      break;
    case Format::kTiff:
      // A TIFF may be one strip, or compressed in one block: the whole
      // image, held once by libtiff.
      decoder = pixels * sample;
      break;
    case Format::kHeif:
      // libheif's decoded planes and the interleaved image converted from
      // them.
      decoder = pixels * facts.sample_bytes * (facts.bands + 3);
      break;
  }
  // The largest thumbnail and its first reduction, and an eighth more for
  // what the allocator keeps.
  const long long total =
      facts.file_bytes + decoder + window + 2 * 1280 * 1280 * 3;
  return total + total / 8;
}

namespace {

// ---------------------------------------------------------------------------
// 4. Decoding and writing

// vips_thumbnail_image to fit `target`, upright, with colour management
// when profiles are given (import_profile only with export_profile).
int ThumbnailImage(VipsImage* in, VipsImage** out, int target,
                   const char* import_profile, const char* export_profile) {
  if (export_profile == nullptr) {
    return vips_thumbnail_image(in, out, target, "height", target, "size",
                                VIPS_SIZE_DOWN, nullptr);
  }
  if (import_profile == nullptr) {
    return vips_thumbnail_image(in, out, target, "height", target, "size",
                                VIPS_SIZE_DOWN, "export_profile",
                                export_profile, nullptr);
  }
  return vips_thumbnail_image(in, out, target, "height", target, "size",
                              VIPS_SIZE_DOWN, "import_profile", import_profile,
                              "export_profile", export_profile, nullptr);
}

// The loaded (not yet decoded) photo: libvips's loader over `bytes`, with
// shrink-on-load for JPEG and WebP.
Image Load(const std::vector<unsigned char>& bytes, const DecodeFacts& facts,
           VipsImage* header, std::string* error) {
  VipsImage* loaded = nullptr;
  void* data = const_cast<unsigned char*>(bytes.data());
  int failed = 0;
  if (facts.format == Format::kJpeg && facts.shrink > 1) {
    // vips_thumbnail keeps a factor of two for its final reduction, which
    // makes a 4000-pixel photo decode at full size for 1280; decoding at 1/2
    // and reducing by 1.56 with lanczos3 looks the same and costs half.
    failed = vips_jpegload_buffer(
        data, bytes.size(), &loaded, "shrink", facts.shrink, "access",
        VIPS_ACCESS_SEQUENTIAL, "fail_on", VIPS_FAIL_ON_TRUNCATED, nullptr);
  } else if (facts.format == Format::kWebp && facts.shrink > 1) {
    failed = vips_webpload_buffer(
        data, bytes.size(), &loaded, "scale", 1.0 / facts.shrink, "access",
        VIPS_ACCESS_SEQUENTIAL, "fail_on", VIPS_FAIL_ON_TRUNCATED, nullptr);
  } else {
    g_object_ref(header);
    loaded = header;
  }
  if (failed) {
    *error = "cannot read it: " + VipsError();
    return nullptr;
  }
  return Image(loaded);
}

// Decodes `loaded` once into an upright sRGB 8-bit image, without alpha,
// that fits `target`, held in memory.
Image DecodeUpright(VipsImage* loaded, int target, std::string* error) {
  const bool has_profile =
      vips_image_get_typeof(loaded, VIPS_META_ICC_NAME) != 0;
  const bool cmyk = loaded->Type == VIPS_INTERPRETATION_CMYK;
  // Only a photo with a profile (or CMYK, which needs one) goes through
  // colour management; the others are plain sRGB already or converted below.
  const char* export_profile = has_profile || cmyk ? "srgb" : nullptr;
  const char* import_profile = cmyk && !has_profile ? "cmyk" : nullptr;
  VipsImage* out = nullptr;
  if (ThumbnailImage(loaded, &out, target, import_profile, export_profile)) {
    *error = "cannot read it: " + VipsError();
    return nullptr;
  }
  Image image(out);
  if (image->Type != VIPS_INTERPRETATION_sRGB) {
    VipsImage* converted = nullptr;
    if (vips_colourspace(image.get(), &converted, VIPS_INTERPRETATION_sRGB,
                         nullptr) != 0) {
      *error = "cannot convert it to sRGB: " + VipsError();
      return nullptr;
    }
    image.reset(converted);
  }
  if (vips_image_hasalpha(image.get())) {
    VipsImage* flat = nullptr;
    double white[] = {255, 255, 255};
    VipsArrayDouble* background = vips_array_double_new(white, 3);
    int failed =
        vips_flatten(image.get(), &flat, "background", background, nullptr);
    vips_area_unref(VIPS_AREA(background));
    if (failed) {
      *error = "cannot flatten it: " + VipsError();
      return nullptr;
    }
    image.reset(flat);
  }
  if (image->BandFmt != VIPS_FORMAT_UCHAR) {
    VipsImage* cast = nullptr;
    if (vips_cast(image.get(), &cast, VIPS_FORMAT_UCHAR, nullptr) != 0) {
      *error = "cannot make it 8-bit: " + VipsError();
      return nullptr;
    }
    image.reset(cast);
  }
  // The one decode happens here; every thumbnail is made from memory.
  VipsImage* held = vips_image_copy_memory(image.get());
  if (held == nullptr) {
    *error = "cannot read it: " + VipsError();
    return nullptr;
  }
  return Image(held);
}

// Reduces `from` (in memory) to fit `side`, in memory.
Image Reduce(VipsImage* from, int side, std::string* error) {
  VipsImage* out = nullptr;
  if (vips_thumbnail_image(from, &out, side, "height", side, "size",
                           VIPS_SIZE_DOWN, "no_rotate", TRUE, nullptr) != 0) {
    *error = "cannot reduce it: " + VipsError();
    return nullptr;
  }
  Image reduced(out);
  VipsImage* held = vips_image_copy_memory(reduced.get());
  if (held == nullptr) {
    *error = "cannot reduce it: " + VipsError();
    return nullptr;
  }
  return Image(held);
}

// Encodes `image` as the thumbnail JPEG and writes it as the item `name`
// of the EA directory open as `ea_fd`, readable as `photo` is. Returns ""
// or what failed.
std::string SaveJpeg(VipsImage* image, int ea_fd, const char* name,
                     const struct stat& photo) {
  void* buffer = nullptr;
  size_t length = 0;
  if (vips_jpegsave_buffer(image, &buffer, &length, "Q", kJpegQuality, "strip",
                           TRUE, "interlace", FALSE, nullptr) != 0) {
    return "cannot encode a thumbnail: " + VipsError();
  }
  std::string problem = quvaidx_daemons::WriteAtomicallyAt(
      ea_fd, name, kPartMarker, buffer, length,
      [&photo](int fd) { return GiveAccessOfPhoto(fd, photo); }, false, name);
  g_free(buffer);
  return problem;
}

// Opens the photo `name` of `folder_fd` for reading, once: no link, no
// blocking open, a regular file. Fills *st from the descriptor.
int OpenPhoto(int folder_fd, const std::string& name, struct stat* st,
              std::string* problem) {
  const int fd =
      openat(folder_fd, name.c_str(),
             O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
  if (fd < 0) {
    if (errno == ENOENT) {
      *problem = "it is gone";
    } else if (errno == ELOOP || errno == ENXIO) {  // a link, a socket
      *problem = "not a regular file";
    } else {
      *problem = std::string("cannot open it: ") + strerror(errno);
    }
    return -1;
  }
  if (fstat(fd, st) != 0 || !S_ISREG(st->st_mode)) {
    close(fd);
    *problem = "not a regular file";
    return -1;
  }
  return fd;
}

}  // namespace

// ---------------------------------------------------------------------------
// 5. The public functions

bool InitThumbnailer(const char* program, std::string* error) {
  // One malloc arena for all threads: libvips's worker thread would get an
  // arena of its own, and the two together hold on to about twice the
  // memory one photo needs (measured: 82 MB peak against 48 MB over eight
  // 12-megapixel photos).
  mallopt(M_ARENA_MAX, 1);
  if (VIPS_INIT(program) != 0) {
    *error = VipsError();
    return false;
  }
  vips_cache_set_max(0);
  vips_cache_set_max_mem(0);
  vips_cache_set_max_files(0);
  vips_concurrency_set(1);
  vips_block_untrusted_set(TRUE);
  g_umask = umask(0);
  umask(g_umask);
  g_daemon_user.uid = geteuid();
  g_daemon_user.gid = getegid();
  int count = getgroups(0, nullptr);
  if (count > 0) {
    g_daemon_user.groups.resize(static_cast<size_t>(count));
    count = getgroups(count, g_daemon_user.groups.data());
    g_daemon_user.groups.resize(static_cast<size_t>(std::max(count, 0)));
  }
  return true;
}

void ShutdownThumbnailer() { vips_shutdown(); }

PhotoResult MakePhotoThumbnails(int folder_fd, const std::string& folder,
                                const std::string& name,
                                const PhotoLimits& limits) {
  const std::string path = (folder == "/" ? "" : folder) + "/" + name;
  std::string problem;
  struct stat st;
  Fd photo(OpenPhoto(folder_fd, name, &st, &problem));
  if (photo.get() < 0) return Skipped(problem);

  // Missing, or a file in its place that the making replaces: no item yet.
  Fd ea(OpenEADir(path.c_str(), folder_fd, 0));
  if (ea.get() < 0 && errno != ENOENT && errno != ENOTDIR) {
    return Skipped(EADirProblem(errno));
  }
  int needed = 0;
  int target = 0;
  for (const ThumbSize& size : kThumbSizes) {
    if (ea.get() >= 0 && UpToDate(ea.get(), st, size)) continue;
    needed |= size.bit;
    target = std::max(target, size.long_side);
  }
  if (needed == 0) {
    // A daemon killed while writing this photo may have left a temporary
    // file although every thumbnail was in place.
    RemoveLeftoverParts(ea.get());
    PhotoResult result;
    result.outcome = PhotoOutcome::kUpToDate;
    return result;
  }

  // The bytes that are checked are the bytes that are decoded. They count
  // towards the decode's memory: a larger file is not even read.
  if (st.st_size > limits.max_decode_bytes) {
    return Skipped("a file of " + std::to_string(st.st_size >> 20) +
                   " MiB, more than the decode limit of " +
                   std::to_string(limits.max_decode_bytes >> 20) + " MiB");
  }
  std::vector<unsigned char> bytes;
  if (!ReadWhole(photo.get(), st.st_size, &bytes, &problem)) {
    return Skipped(problem);
  }
  photo.reset(-1);
  // The loader libvips would choose, by its nickname ("jpegload_buffer").
  const char* type = vips_foreign_find_load_buffer(bytes.data(), bytes.size());
  if (type == nullptr) return Skipped("cannot read it: " + VipsError());
  const char* loader = vips_nickname_find(g_type_from_name(type));
  Format format;
  if (loader == nullptr) loader = type;
  if (!FormatOfLoader(loader, &format)) {
    return Skipped(std::string("cannot read it: not a photo format (") +
                   loader + ")");
  }
  // The header alone, to refuse a bomb before anything is decoded.
  VipsImage* opened = vips_image_new_from_buffer(
      bytes.data(), bytes.size(), "", "access", VIPS_ACCESS_SEQUENTIAL,
      "fail_on", VIPS_FAIL_ON_TRUNCATED, nullptr);
  if (opened == nullptr) return Skipped("cannot read it: " + VipsError());
  Image header(opened);
  const DecodeFacts facts = FactsOf(format, header.get(), bytes, target);
  if (facts.width * facts.height > limits.max_pixels) {
    return Skipped(
        std::to_string(facts.width) + " x " + std::to_string(facts.height) +
        " pixels, more than the limit of " + std::to_string(limits.max_pixels));
  }
  const long long peak = DecodePeakBytes(facts);
  if (peak > limits.max_decode_bytes) {
    return Skipped(std::to_string(facts.width) + " x " +
                   std::to_string(facts.height) + " pixels would take " +
                   std::to_string(peak >> 20) + " MiB to decode, more than " +
                   "the limit of " +
                   std::to_string(limits.max_decode_bytes >> 20) + " MiB");
  }

  if (ea.get() < 0) ea.reset(OpenEADir(path.c_str(), folder_fd, 1));
  if (ea.get() < 0) return Skipped(EADirProblem(errno));
  RemoveLeftoverParts(ea.get());

  std::string error;
  Image loaded = Load(bytes, facts, header.get(), &error);
  header.reset();
  Image current =
      loaded ? DecodeUpright(loaded.get(), target, &error) : nullptr;
  loaded.reset();
  if (!current) return Skipped(error);
  std::vector<unsigned char>().swap(bytes);  // not needed any more

  PhotoResult result;
  for (const ThumbSize& size : kThumbSizes) {
    if (size.long_side > target) continue;
    if (size.long_side < target) {
      // Each size from the one above it: the smallest input that will do.
      Image reduced = Reduce(current.get(), size.long_side, &error);
      if (!reduced) break;
      current = std::move(reduced);
      target = size.long_side;
    }
    if ((needed & size.bit) == 0) continue;
    // One item that cannot be written (a folder or a link in its place)
    // does not keep the others from being made.
    std::string failed = SaveJpeg(current.get(), ea.get(), size.name, st);
    if (failed.empty()) {
      result.made |= size.bit;
    } else {
      error = failed;
    }
  }
  if (result.made == 0) return Skipped(error);
  result.outcome = PhotoOutcome::kMade;
  result.reason = error;  // a later size may have failed
  return result;
}

PhotoResult MakePhotoThumbnails(const std::string& photo,
                                const PhotoLimits& limits) {
  const size_t slash = photo.rfind('/');
  if (photo.empty() || photo[0] != '/' || slash + 1 >= photo.size()) {
    return Skipped("not an absolute path of a file");
  }
  const std::string folder = slash == 0 ? "/" : photo.substr(0, slash);
  Fd folder_fd(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (folder_fd.get() < 0) {
    return Skipped(std::string("cannot open its folder: ") + strerror(errno));
  }
  return MakePhotoThumbnails(folder_fd.get(), folder, photo.substr(slash + 1),
                             limits);
}

}  // namespace mkthumbd
