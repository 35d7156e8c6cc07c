// Header walks for ReadImageSize. Each reader checks the bytes it needs
// against `size` before reading them; a length taken from the file is
// compared with what is left, never added to an offset unchecked.
#include "image_size.h"

#include <string.h>

namespace mediaparserd {
namespace {

uint32_t Big16(const uint8_t* p) { return (p[0] << 8) | p[1]; }
uint32_t Big32(const uint8_t* p) {
  return (uint32_t{p[0]} << 24) | (p[1] << 16) | (p[2] << 8) | p[3];
}
uint32_t Little16(const uint8_t* p) { return p[0] | (p[1] << 8); }

bool Store(uint32_t w, uint32_t h, int32_t* width, int32_t* height) {
  if (w == 0 || h == 0 || w > INT32_MAX || h > INT32_MAX) return false;
  *width = static_cast<int32_t>(w);
  *height = static_cast<int32_t>(h);
  return true;
}

// Signature (8), then the first chunk: length (4), "IHDR" (4), width (4),
// height (4), both big-endian.
bool PngSize(const uint8_t* data, size_t size, int32_t* width,
             int32_t* height) {
  static const uint8_t kSignature[8] = {0x89, 'P',  'N',  'G',
                                        0x0D, 0x0A, 0x1A, 0x0A};
  if (size < 24 || memcmp(data, kSignature, 8) != 0) return false;
  if (memcmp(data + 12, "IHDR", 4) != 0) return false;
  return Store(Big32(data + 16), Big32(data + 20), width, height);
}

// "GIF87a" or "GIF89a", then the logical screen's width and height,
// little-endian.
bool GifSize(const uint8_t* data, size_t size, int32_t* width,
             int32_t* height) {
  if (size < 10) return false;
  if (memcmp(data, "GIF87a", 6) != 0 && memcmp(data, "GIF89a", 6) != 0) {
    return false;
  }
  return Store(Little16(data + 6), Little16(data + 8), width, height);
}

// Start of image, then marker segments: 0xFF (plus fill bytes), the marker
// and, except for the standalone markers, a big-endian length that counts
// itself. A start-of-frame segment holds precision (1), height (2) and
// width (2).
bool JpegSize(const uint8_t* data, size_t size, int32_t* width,
              int32_t* height) {
  if (size < 2 || data[0] != 0xFF || data[1] != 0xD8) return false;
  size_t pos = 2;
  while (pos < size) {
    if (data[pos] != 0xFF) return false;  // not at a marker: corrupt
    while (pos < size && data[pos] == 0xFF) ++pos;
    if (pos >= size) return false;
    uint8_t marker = data[pos++];
    // TEM and RSTn stand alone; a second SOI is tolerated likewise.
    if (marker == 0x01 || (marker >= 0xD0 && marker <= 0xD8)) continue;
    // End of image or start of scan: no frame header came first.
    if (marker == 0xD9 || marker == 0xDA) return false;
    if (size - pos < 2) return false;
    size_t length = Big16(data + pos);
    if (length < 2 || length > size - pos) return false;
    // SOF0-SOF15, less DHT (C4), JPG (C8) and DAC (CC).
    bool frame = marker >= 0xC0 && marker <= 0xCF && marker != 0xC4 &&
                 marker != 0xC8 && marker != 0xCC;
    if (frame) {
      if (length < 7) return false;
      return Store(Big16(data + pos + 5), Big16(data + pos + 3), width, height);
    }
    pos += length;
  }
  return false;
}

}  // namespace

bool ReadImageSize(const uint8_t* data, size_t size, int32_t* width,
                   int32_t* height) {
  if (data == nullptr) return false;
  return PngSize(data, size, width, height) ||
         JpegSize(data, size, width, height) ||
         GifSize(data, size, width, height);
}

}  // namespace mediaparserd
