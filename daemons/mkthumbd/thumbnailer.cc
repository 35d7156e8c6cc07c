#include "thumbnailer.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <malloc.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <vector>

#include <quvaidx/ea_file.h>
#include <vips/vips.h>

#include "atomic_file.h"
#include "preview_names.h"

namespace mkthumbd {
namespace {

using quvaidx_daemons::kThumbSizes;
using quvaidx_daemons::ThumbSize;

// Temporary files are "<item>.part-XXXXXX"; this marks them for clean-up.
constexpr char kPartMarker[] = ".part-";
// The common prefix of the thumbnail items.
constexpr char kItemPrefix[] = "QUVAPHOTO_THUMB_";

// Owns one VipsImage reference.
struct ImageUnref {
  void operator()(VipsImage* image) const { g_object_unref(image); }
};
using Image = std::unique_ptr<VipsImage, ImageUnref>;

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

mode_t g_file_mode = 0644;  // 0666 less the umask, as a file made by open

bool Newer(const struct timespec& a, const struct timespec& b) {
  return a.tv_sec > b.tv_sec || (a.tv_sec == b.tv_sec && a.tv_nsec > b.tv_nsec);
}

// True when the thumbnail `size` of `photo` exists (either name, 2 bytes or
// more, as the library's EA-item functions count) and is newer than the
// photo's modification time. When it exists, *ea_dir receives the folder it
// is in: the photo's EA directory.
bool UpToDate(const std::string& photo, const struct stat& photo_st,
              const ThumbSize& size, std::string* ea_dir) {
  char item[PATH_MAX];
  if (GetEAFilePath(photo.c_str(), size.name, size.second_name, item,
                    sizeof(item)) != 0) {
    return false;
  }
  const char* slash = strrchr(item, '/');
  if (slash != nullptr) ea_dir->assign(item, static_cast<size_t>(slash - item));
  struct stat st;
  return stat(item, &st) == 0 && Newer(st.st_mtim, photo_st.st_mtim);
}

// Removes temporary thumbnail files that a killed daemon left in `ea_dir`.
void RemoveLeftoverParts(const char* ea_dir) {
  DIR* dir = opendir(ea_dir);
  if (dir == nullptr) return;
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
    unlinkat(AT_FDCWD, (std::string(ea_dir) + "/" + name).c_str(), 0);
  }
}

// The JPEG shrink-on-load factor for a photo of long side `long_side` whose
// largest thumbnail needs `target`: the largest of 8, 4, 2 that keeps at
// least `target` pixels, else 1.
int JpegShrink(int long_side, int target) {
  for (int shrink : {8, 4, 2}) {
    if (long_side / shrink >= target) return shrink;
  }
  return 1;
}

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

// Decodes `photo` (whose header is `header`) once into an upright sRGB
// 8-bit image, without alpha, that fits `target`, held in memory.
Image DecodeUpright(const std::string& photo, VipsImage* header, int target,
                    std::string* error) {
  const char* loader = nullptr;
  vips_image_get_string(header, VIPS_META_LOADER, &loader);
  const bool jpeg = loader != nullptr && strcmp(loader, "jpegload") == 0;
  const bool has_profile =
      vips_image_get_typeof(header, VIPS_META_ICC_NAME) != 0;
  const bool cmyk = header->Type == VIPS_INTERPRETATION_CMYK;
  // Only a photo with a profile (or CMYK, which needs one) goes through
  // colour management; the others are plain sRGB already or converted below.
  const char* export_profile = has_profile || cmyk ? "srgb" : nullptr;
  const char* import_profile = cmyk && !has_profile ? "cmyk" : nullptr;

  VipsImage* loaded = nullptr;
  int failed;
  if (jpeg) {
    // vips_thumbnail keeps a factor of two for its final reduction, which
    // makes a 4000-pixel photo decode at full size for 1280; decoding at 1/2
    // and reducing by 1.56 with lanczos3 looks the same and costs half.
    const int shrink =
        JpegShrink(std::max(header->Xsize, header->Ysize), target);
    failed = vips_jpegload(photo.c_str(), &loaded, "shrink", shrink, "access",
                           VIPS_ACCESS_SEQUENTIAL, "fail_on",
                           VIPS_FAIL_ON_TRUNCATED, nullptr);
  } else {
    loaded = vips_image_new_from_file(photo.c_str(), "access",
                                      VIPS_ACCESS_SEQUENTIAL, "fail_on",
                                      VIPS_FAIL_ON_TRUNCATED, nullptr);
    failed = loaded == nullptr;
  }
  VipsImage* out = nullptr;
  if (!failed) {
    Image in(loaded);
    failed =
        ThumbnailImage(in.get(), &out, target, import_profile, export_profile);
  }
  if (failed) {
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
    failed =
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

// Encodes `image` as the thumbnail JPEG and writes it to `path`. Returns ""
// or what failed.
std::string SaveJpeg(VipsImage* image, const std::string& path) {
  void* buffer = nullptr;
  size_t length = 0;
  if (vips_jpegsave_buffer(image, &buffer, &length, "Q", kJpegQuality, "strip",
                           TRUE, "interlace", FALSE, nullptr) != 0) {
    return "cannot encode a thumbnail: " + VipsError();
  }
  std::string problem = quvaidx_daemons::WriteAtomically(
      path, kPartMarker, buffer, length, g_file_mode, false, path);
  g_free(buffer);
  return problem;
}

PhotoResult Skipped(std::string reason) {
  PhotoResult result;
  result.outcome = PhotoOutcome::kSkipped;
  result.reason = std::move(reason);
  return result;
}

}  // namespace

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
  mode_t mask = umask(0);
  umask(mask);
  g_file_mode = 0666 & ~mask;
  return true;
}

void ShutdownThumbnailer() { vips_shutdown(); }

PhotoResult MakePhotoThumbnails(const std::string& photo,
                                long long max_pixels) {
  struct stat before;
  if (lstat(photo.c_str(), &before) != 0) {
    return Skipped(errno == ENOENT
                       ? "it is gone"
                       : std::string("cannot examine it: ") + strerror(errno));
  }
  if (!S_ISREG(before.st_mode)) return Skipped("not a regular file");

  int needed = 0;
  int target = 0;
  std::string seen_ea_dir;
  for (const ThumbSize& size : kThumbSizes) {
    if (UpToDate(photo, before, size, &seen_ea_dir)) continue;
    needed |= size.bit;
    target = std::max(target, size.long_side);
  }
  if (needed == 0) {
    // A daemon killed while writing this photo may have left a temporary
    // file although every thumbnail was in place.
    RemoveLeftoverParts(seen_ea_dir.c_str());
    PhotoResult result;
    result.outcome = PhotoOutcome::kUpToDate;
    return result;
  }

  // The header alone, to refuse a bomb before anything is decoded.
  VipsImage* opened = vips_image_new_from_file(photo.c_str(), "access",
                                               VIPS_ACCESS_SEQUENTIAL, nullptr);
  if (opened == nullptr) return Skipped("cannot read it: " + VipsError());
  Image header(opened);
  const long long pixels =
      static_cast<long long>(header->Xsize) * header->Ysize;
  if (pixels > max_pixels) {
    return Skipped(
        std::to_string(header->Xsize) + " x " + std::to_string(header->Ysize) +
        " pixels, more than the limit of " + std::to_string(max_pixels));
  }

  char ea_dir[PATH_MAX];
  if (MakeEADir(photo.c_str(), ea_dir, sizeof(ea_dir)) != 0) {
    return Skipped("cannot make its EA directory");
  }
  RemoveLeftoverParts(ea_dir);

  std::string error;
  Image current = DecodeUpright(photo, header.get(), target, &error);
  header.reset();
  if (!current) return Skipped(error);

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
    // One item that cannot be written (a folder in its place) does not keep
    // the others from being made.
    std::string problem =
        SaveJpeg(current.get(), std::string(ea_dir) + "/" + size.name);
    if (problem.empty()) {
      result.made |= size.bit;
    } else {
      error = problem;
    }
  }
  if (result.made == 0) return Skipped(error);
  result.outcome = PhotoOutcome::kMade;
  result.reason = error;  // a later size may have failed
  return result;
}

}  // namespace mkthumbd
