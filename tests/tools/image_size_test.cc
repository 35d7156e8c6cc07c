// The media-parser example's header parser reads files it did not write.
// Each input is copied into a buffer of exactly its size, so that
// AddressSanitizer reports any read past the end.
#include "image_size.h"

#include <stdint.h>

#include <algorithm>
#include <cstdio>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

namespace mediaparserd {
namespace {

using Bytes = std::vector<uint8_t>;

// PNG 3x2: signature and IHDR (its CRC is not read). GIF 320x240. JPEG: SOI,
// APP0 (16 bytes), SOF0 640x480 with one component, EOI.
const Bytes kPng = {0x89, 'P', 'N', 'G', 0x0D, 0x0A, 0x1A, 0x0A, 0, 0,
                    0,    13,  'I', 'H', 'D',  'R',  0,    0,    0, 3,
                    0,    0,   0,   2,   8,    2,    0,    0,    0};
const Bytes kGif = {'G', 'I', 'F', '8', '9', 'a', 0x40, 0x01, 0xF0, 0x00};
const Bytes kJpeg = {0xFF, 0xD8, 0xFF, 0xE0, 0x00, 0x10, 'J',  'F',  'I',
                     'F',  0x00, 0x01, 0x01, 0x00, 0x00, 0x01, 0x00, 0x01,
                     0x00, 0x00, 0xFF, 0xC0, 0x00, 0x0B, 0x08, 0x01, 0xE0,
                     0x02, 0x80, 0x01, 0x01, 0x11, 0x00, 0xFF, 0xD9};

// "WxH", or "-" when rejected with both outputs left alone.
std::string Parse(const Bytes& bytes) {
  Bytes exact(bytes);
  exact.shrink_to_fit();
  int32_t w = -1, h = -1;
  if (!ReadImageSize(exact.data(), exact.size(), &w, &h)) {
    return w == -1 && h == -1 ? "-" : "rejected, outputs changed";
  }
  return std::to_string(w) + "x" + std::to_string(h);
}

Bytes With(Bytes b, size_t at, std::initializer_list<uint8_t> patch) {
  std::copy(patch.begin(), patch.end(), b.begin() + at);
  return b;
}
Bytes Insert(Bytes b, size_t at, std::initializer_list<uint8_t> bytes) {
  b.insert(b.begin() + at, bytes);
  return b;
}

TEST(ImageSizeTest, ReadsSizesAndRejectsBadHeaders) {
  const struct {
    const char* name;
    Bytes bytes;
    std::string size;
  } cases[] = {
      {"png", kPng, "3x2"},
      {"gif89a", kGif, "320x240"},
      {"gif87a", With(kGif, 4, {'7'}), "320x240"},
      {"jpeg sof0", kJpeg, "640x480"},
      {"jpeg sof2", With(kJpeg, 21, {0xC2}), "640x480"},
      {"jpeg fill bytes", Insert(kJpeg, 20, {0xFF, 0xFF}), "640x480"},
      {"jpeg restart marker", Insert(kJpeg, 20, {0xFF, 0xD0}), "640x480"},
      {"empty", {}, "-"},
      {"garbage", {'h', 'e', 'l', 'l', 'o', ' ', 'w', 'o', 'r', 'l'}, "-"},
      {"png first chunk not IHDR", With(kPng, 12, {'I', 'D', 'A', 'T'}), "-"},
      {"png zero width", With(kPng, 16, {0, 0, 0, 0}), "-"},
      {"png width above INT32_MAX", With(kPng, 16, {0x80, 0, 0, 0}), "-"},
      {"gif zero height", With(kGif, 8, {0, 0}), "-"},
      {"gif bad version", With(kGif, 3, {'9', '0'}), "-"},
      {"jpeg segment past the end", With(kJpeg, 4, {0xFF, 0xF0}), "-"},
      {"jpeg segment length below 2", With(kJpeg, 4, {0x00, 0x01}), "-"},
      {"jpeg not at a marker", With(kJpeg, 20, {0x00}), "-"},
      {"jpeg scan before frame", With(kJpeg, 21, {0xDA}), "-"},
      {"jpeg end before frame", With(kJpeg, 21, {0xD9}), "-"},
      {"jpeg DHT is no frame", With(kJpeg, 21, {0xC4}), "-"},
      {"jpeg frame too short", With(kJpeg, 22, {0x00, 0x06}), "-"},
      {"jpeg height from DNL (zero)", With(kJpeg, 25, {0x00, 0x00}), "-"},
      {"jpeg only fill bytes", {0xFF, 0xD8, 0xFF, 0xFF, 0xFF}, "-"},
  };
  for (const auto& c : cases) EXPECT_EQ(c.size, Parse(c.bytes)) << c.name;
  int32_t w = -1, h = -1;
  EXPECT_FALSE(ReadImageSize(nullptr, 100, &w, &h));
}

// The size is known only once the bytes stating it were read: 24 for PNG,
// 10 for GIF, the whole frame segment (33 bytes) for JPEG.
TEST(ImageSizeTest, TruncatedHeadersAreRejectedAtEveryLength) {
  const std::pair<const Bytes*, size_t> cases[] = {
      {&kPng, 24}, {&kGif, 10}, {&kJpeg, 33}};
  for (const auto& [bytes, needed] : cases) {
    for (size_t n = 0; n <= bytes->size(); ++n) {
      std::string size = Parse(Bytes(bytes->begin(), bytes->begin() + n));
      EXPECT_EQ(n >= needed, size != "-") << "length " << n << ": " << size;
    }
  }
}

TEST(ImageSizeTest, RandomBytesAfterSignaturesNeverReadPastTheBuffer) {
  std::mt19937 random(5566);
  const Bytes prefixes[] = {{0xFF, 0xD8},
                            {0xFF, 0xD8, 0xFF},
                            Bytes(kPng.begin(), kPng.begin() + 16),
                            Bytes(kGif.begin(), kGif.begin() + 6)};
  for (int i = 0; i < 20000; ++i) {
    Bytes bytes = prefixes[i % 4];
    // Mostly marker-like bytes, so JPEG walks go deep.
    for (size_t extra = random() % 64; extra > 0; --extra) {
      bytes.push_back(random() % 3 == 0 ? 0xFF : random() % 256);
    }
    std::string size = Parse(bytes);
    int w = 0, h = 0;
    EXPECT_TRUE(size == "-" || (sscanf(size.c_str(), "%dx%d", &w, &h) == 2 &&
                                w >= 1 && h >= 1))
        << size;
  }
}

}  // namespace
}  // namespace mediaparserd
