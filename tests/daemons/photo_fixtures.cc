#include "photo_fixtures.h"

#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include <vips/vips.h>

namespace quvaidx::daemon_test {
namespace {

// Starts libvips once per process; a later VIPS_INIT (the thumbnailer's)
// finds it started.
bool StartVips() {
  static const bool started = VIPS_INIT("quvaidx-daemon-tests") == 0;
  return started;
}

}  // namespace

bool WritePhoto(const std::string& path, int width, int height, Rgb left,
                Rgb right, int bands, int alpha) {
  if (!StartVips()) return false;
  std::vector<unsigned char> pixels;
  pixels.reserve(static_cast<size_t>(width) * height * bands);
  for (int y = 0; y < height; ++y) {
    for (int x = 0; x < width; ++x) {
      const Rgb& c = x < width / 2 ? left : right;
      const int pixel[] = {c.r, c.g, c.b, alpha};
      for (int b = 0; b < bands; ++b) pixels.push_back(pixel[b]);
    }
  }
  VipsImage* image = vips_image_new_from_memory(
      pixels.data(), pixels.size(), width, height, bands, VIPS_FORMAT_UCHAR);
  if (image == nullptr) return false;
  int failed = vips_image_write_to_file(image, path.c_str(), nullptr);
  g_object_unref(image);
  vips_error_clear();
  return failed == 0;
}

bool WritePlainPhoto(const std::string& path, int width, int height,
                     Rgb colour) {
  const std::string file = path.substr(0, path.find('['));
  if (file.size() > 4 && file.compare(file.size() - 4, 4, ".gif") == 0) {
    // Through the vips command: libvips's GIF encoder (libimagequant) leaks,
    // and the tests run under LeakSanitizer too. The test's own paths under
    // mkdtemp hold no quote.
    const std::string png = file + ".png";
    const bool ok =
        WritePlainPhoto(png, width, height, colour) &&
        system(("vips copy '" + png + "' '" + path + "'").c_str()) == 0;
    unlink(png.c_str());
    return ok;
  }
  VipsImage* black = nullptr;
  VipsImage* coloured = nullptr;
  VipsImage* cast = nullptr;
  double zero[] = {1, 1, 1};
  double add[] = {static_cast<double>(colour.r), static_cast<double>(colour.g),
                  static_cast<double>(colour.b)};
  bool ok = StartVips() &&
            vips_black(&black, width, height, "bands", 3, nullptr) == 0 &&
            vips_linear(black, &coloured, zero, add, 3, nullptr) == 0 &&
            vips_cast(coloured, &cast, VIPS_FORMAT_UCHAR, nullptr) == 0;
  if (ok) {
    cast->Type = VIPS_INTERPRETATION_sRGB;
    ok = vips_image_write_to_file(cast, path.c_str(), nullptr) == 0;
  }
  for (VipsImage* image : {black, coloured, cast}) {
    if (image != nullptr) g_object_unref(image);
  }
  vips_error_clear();
  return ok;
}

bool WritePngBomb(const std::string& path, int width, int height) {
  VipsImage* black = nullptr;
  if (!StartVips() || vips_black(&black, width, height, nullptr) != 0) {
    return false;
  }
  // libvips writes it a strip at a time: never the whole image in memory.
  int failed = vips_pngsave(black, path.c_str(), "bitdepth", 1, "compression",
                            9, nullptr);
  g_object_unref(black);
  return failed == 0;
}

bool HaveExiftool() { return system("exiftool -ver >/dev/null 2>&1") == 0; }

bool SetOrientations(const std::vector<std::pair<std::string, int>>& files) {
  // The test's own paths under mkdtemp: no quote in them.
  std::string command = "exiftool -q -overwrite_original";
  for (size_t i = 0; i < files.size(); ++i) {
    command += (i > 0 ? " -execute" : "") + std::string(" -Orientation#=") +
               std::to_string(files[i].second) + " '" + files[i].first + "'";
  }
  return system(command.c_str()) == 0;
}

ImageFacts ReadImage(const std::string& path) {
  ImageFacts facts;
  VipsImage* image =
      StartVips() ? vips_image_new_from_file(path.c_str(), nullptr) : nullptr;
  if (image == nullptr) {
    vips_error_clear();
    return facts;
  }
  facts.readable = true;
  facts.width = image->Xsize;
  facts.height = image->Ysize;
  facts.bands = image->Bands;
  facts.srgb = image->Type == VIPS_INTERPRETATION_sRGB;
  for (const char* field : {VIPS_META_EXIF_NAME, VIPS_META_XMP_NAME,
                            VIPS_META_IPTC_NAME, VIPS_META_ICC_NAME}) {
    facts.has_metadata |= vips_image_get_typeof(image, field) != 0;
  }
  const char* loader = nullptr;
  if (vips_image_get_string(image, VIPS_META_LOADER, &loader) == 0) {
    facts.loader = loader;
  }
  g_object_unref(image);
  return facts;
}

Rgb ColourAt(const std::string& path, double x, double y) {
  Rgb colour = {-1, -1, -1};
  VipsImage* image =
      StartVips() ? vips_image_new_from_file(path.c_str(), nullptr) : nullptr;
  double* values = nullptr;
  int n = 0;
  if (image != nullptr &&
      vips_getpoint(image, &values, &n, static_cast<int>(x * image->Xsize),
                    static_cast<int>(y * image->Ysize), nullptr) == 0 &&
      n >= 3) {
    colour = {static_cast<int>(values[0]), static_cast<int>(values[1]),
              static_cast<int>(values[2])};
  }
  g_free(values);
  if (image != nullptr) g_object_unref(image);
  vips_error_clear();
  return colour;
}

bool Near(Rgb colour, Rgb expected, int tolerance) {
  return abs(colour.r - expected.r) <= tolerance &&
         abs(colour.g - expected.g) <= tolerance &&
         abs(colour.b - expected.b) <= tolerance;
}

std::string ThumbItem(const std::string& photo, const std::string& label) {
  const size_t slash = photo.rfind('/');
  return photo.substr(0, slash) + "/.quvameta" + photo.substr(slash) +
         "/QUVAPHOTO_THUMB_" + label + ".jpg";
}

std::vector<std::string> NamesUnder(const std::string& dir) {
  std::vector<std::string> names;
  std::error_code ignored;
  for (const auto& entry :
       std::filesystem::recursive_directory_iterator(dir, ignored)) {
    names.push_back(entry.path().lexically_relative(dir).string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

void WriteShares(
    const std::string& etc_dir,
    const std::vector<std::pair<std::string, std::string>>& shares) {
  mkdir(etc_dir.c_str(), 0755);
  std::ofstream out(etc_dir + "/shares.conf", std::ios::trunc);
  for (const auto& [name, path] : shares) {
    out << "[" << name << "]\npath = " << path << "\n";
  }
}

bool Own(const std::string& path, unsigned uid, unsigned gid, unsigned mode) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0 || lchown(path.c_str(), uid, gid) != 0) {
    return false;
  }
  return S_ISLNK(st.st_mode) || chmod(path.c_str(), mode) == 0;
}

bool MakeOwnedDir(const std::string& path, unsigned uid, unsigned gid,
                  unsigned mode) {
  return mkdir(path.c_str(), 0700) == 0 && Own(path, uid, gid, mode);
}

}  // namespace quvaidx::daemon_test
