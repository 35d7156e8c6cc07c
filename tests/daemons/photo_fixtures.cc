#include "photo_fixtures.h"

#include <arpa/inet.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <fstream>

#include <vips/vips.h>

namespace quvaidx::daemon_test {
namespace {

bool SaveFromMemory(const std::string& path, std::vector<unsigned char>& pixels,
                    int width, int height, int bands) {
  VipsImage* image = vips_image_new_from_memory(
      pixels.data(), pixels.size(), width, height, bands, VIPS_FORMAT_UCHAR);
  if (image == nullptr) return false;
  int failed = vips_image_write_to_file(image, path.c_str(), nullptr);
  g_object_unref(image);
  vips_error_clear();
  return failed == 0;
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

bool StartVips() {
  static const bool started = VIPS_INIT("quvaidx-daemon-tests") == 0;
  return started;
}

bool WriteSplitJpeg(const std::string& path, int width, int height, Rgb left,
                    Rgb right) {
  std::vector<unsigned char> pixels(static_cast<size_t>(width) * height * 3);
  for (int y = 0; y < height; ++y) {
    for (int x = 0; x < width; ++x) {
      const Rgb& c = x < width / 2 ? left : right;
      unsigned char* p = &pixels[(static_cast<size_t>(y) * width + x) * 3];
      p[0] = static_cast<unsigned char>(c.r);
      p[1] = static_cast<unsigned char>(c.g);
      p[2] = static_cast<unsigned char>(c.b);
    }
  }
  return SaveFromMemory(path + "[Q=90]", pixels, width, height, 3);
}

bool WritePng(const std::string& path, int width, int height, int bands,
              Rgb colour, int alpha) {
  const unsigned char r = static_cast<unsigned char>(colour.r);
  const unsigned char g = static_cast<unsigned char>(colour.g);
  const unsigned char b = static_cast<unsigned char>(colour.b);
  const unsigned char a = static_cast<unsigned char>(alpha);
  std::vector<unsigned char> pixel;
  switch (bands) {
    case 1:
      pixel = {r};
      break;
    case 2:
      pixel = {r, a};
      break;
    case 3:
      pixel = {r, g, b};
      break;
    default:
      pixel = {r, g, b, a};
      break;
  }
  std::vector<unsigned char> pixels;
  pixels.reserve(static_cast<size_t>(width) * height * pixel.size());
  for (long i = 0; i < static_cast<long>(width) * height; ++i) {
    pixels.insert(pixels.end(), pixel.begin(), pixel.end());
  }
  return SaveFromMemory(path, pixels, width, height,
                        static_cast<int>(pixel.size()));
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
  std::vector<std::string> args = {"exiftool", "-q", "-overwrite_original"};
  for (size_t i = 0; i < files.size(); ++i) {
    if (i > 0) args.push_back("-execute");
    args.push_back("-Orientation#=" + std::to_string(files[i].second));
    args.push_back(files[i].first);
  }
  std::vector<char*> argv;
  for (std::string& arg : args) argv.push_back(arg.data());
  argv.push_back(nullptr);
  pid_t pid = fork();
  if (pid < 0) return false;
  if (pid == 0) {
    execvp(argv[0], argv.data());
    _exit(127);
  }
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
  }
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

ImageFacts ReadImage(const std::string& path) {
  ImageFacts facts;
  VipsImage* image = vips_image_new_from_file(path.c_str(), nullptr);
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
    facts.has_metadata =
        facts.has_metadata || vips_image_get_typeof(image, field) != 0;
  }
  const char* loader = nullptr;
  if (vips_image_get_string(image, VIPS_META_LOADER, &loader) == 0) {
    facts.loader = loader;
  }
  g_object_unref(image);
  return facts;
}

Rgb MeanColour(const std::string& path, double x, double y, double w,
               double h) {
  Rgb mean = {-1, -1, -1};
  VipsImage* image = vips_image_new_from_file(path.c_str(), nullptr);
  if (image == nullptr) {
    vips_error_clear();
    return mean;
  }
  VipsImage* held = vips_image_copy_memory(image);
  g_object_unref(image);
  if (held == nullptr || held->Bands < 3 ||
      held->BandFmt != VIPS_FORMAT_UCHAR) {
    if (held != nullptr) g_object_unref(held);
    vips_error_clear();
    return mean;
  }
  const int left = static_cast<int>(x * held->Xsize);
  const int top = static_cast<int>(y * held->Ysize);
  const int right = std::max(left + 1, static_cast<int>((x + w) * held->Xsize));
  const int bottom = std::max(top + 1, static_cast<int>((y + h) * held->Ysize));
  long sum[3] = {0, 0, 0};
  long count = 0;
  for (int row = top; row < bottom && row < held->Ysize; ++row) {
    for (int col = left; col < right && col < held->Xsize; ++col) {
      const unsigned char* p = VIPS_IMAGE_ADDR(held, col, row);
      for (int c = 0; c < 3; ++c) sum[c] += p[c];
      ++count;
    }
  }
  g_object_unref(held);
  if (count > 0) {
    mean = {static_cast<int>(sum[0] / count), static_cast<int>(sum[1] / count),
            static_cast<int>(sum[2] / count)};
  }
  return mean;
}

bool Near(Rgb colour, Rgb expected, int tolerance) {
  return abs(colour.r - expected.r) <= tolerance &&
         abs(colour.g - expected.g) <= tolerance &&
         abs(colour.b - expected.b) <= tolerance;
}

}  // namespace quvaidx::daemon_test
