#include "photo_fixtures.h"

#include <arpa/inet.h>
#include <stdlib.h>
#include <string.h>
#include <zlib.h>

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

void PutChunk(std::ofstream& out, const char type[4], const std::string& data) {
  uint32_t length = htonl(static_cast<uint32_t>(data.size()));
  out.write(reinterpret_cast<const char*>(&length), 4);
  out.write(type, 4);
  out.write(data.data(), static_cast<std::streamsize>(data.size()));
  uLong crc = crc32(0, reinterpret_cast<const Bytef*>(type), 4);
  crc = crc32(crc, reinterpret_cast<const Bytef*>(data.data()),
              static_cast<uInt>(data.size()));
  uint32_t crc_be = htonl(static_cast<uint32_t>(crc));
  out.write(reinterpret_cast<const char*>(&crc_be), 4);
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

bool WritePngBomb(const std::string& path, int width, int height) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write("\x89PNG\r\n\x1a\n", 8);
  std::string header(13, '\0');
  uint32_t w = htonl(static_cast<uint32_t>(width));
  uint32_t h = htonl(static_cast<uint32_t>(height));
  memcpy(&header[0], &w, 4);
  memcpy(&header[4], &h, 4);
  header[8] = 1;  // bit depth 1, colour type 0 (grey), the rest 0
  PutChunk(out, "IHDR", header);
  // Every row: filter byte 0 and width/8 zero bytes, deflated as a stream.
  const size_t row = 1 + (static_cast<size_t>(width) + 7) / 8;
  std::vector<unsigned char> zeros(row * 64, 0);
  z_stream z = {};
  if (deflateInit(&z, 9) != Z_OK) return false;
  std::string data;
  std::vector<unsigned char> chunk(1 << 16);
  for (int rows = 0; rows < height; rows += 64) {
    const int n = std::min(64, height - rows);
    z.next_in = zeros.data();
    z.avail_in = static_cast<uInt>(row * n);
    const int flush = rows + n >= height ? Z_FINISH : Z_NO_FLUSH;
    do {
      z.next_out = chunk.data();
      z.avail_out = static_cast<uInt>(chunk.size());
      deflate(&z, flush);
      data.append(reinterpret_cast<char*>(chunk.data()),
                  chunk.size() - z.avail_out);
    } while (z.avail_out == 0);
  }
  deflateEnd(&z);
  PutChunk(out, "IDAT", data);
  PutChunk(out, "IEND", "");
  return static_cast<bool>(out);
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
    names.push_back(std::filesystem::relative(entry.path(), dir).string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace quvaidx::daemon_test
