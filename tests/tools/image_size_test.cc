// The media-parser example's header parser reads files it did not write:
// every case below is a header that is truncated, lies about a length or
// states an impossible size. Each input is copied into a buffer of exactly
// its size, so that AddressSanitizer reports any read past the end.
#include "image_size.h"

#include <stdint.h>

#include <random>
#include <vector>

#include <gtest/gtest.h>

namespace mediaparserd {
namespace {

using Bytes = std::vector<uint8_t>;

// 3x2 RGB: signature, then the IHDR chunk (its CRC left out: not read).
const Bytes kPng = {0x89, 'P', 'N', 'G', 0x0D, 0x0A, 0x1A, 0x0A, 0, 0,
                    0,    13,  'I', 'H', 'D',  'R',  0,    0,    0, 3,
                    0,    0,   0,   2,   8,    2,    0,    0,    0};
const Bytes kGif = {'G', 'I', 'F', '8', '9', 'a', 0x40, 0x01, 0xF0, 0x00};
// SOI, APP0 (16 bytes), SOF0 640x480 with one component, EOI.
const Bytes kJpeg = {0xFF, 0xD8, 0xFF, 0xE0, 0x00, 0x10, 'J',  'F',  'I',
                     'F',  0x00, 0x01, 0x01, 0x00, 0x00, 0x01, 0x00, 0x01,
                     0x00, 0x00, 0xFF, 0xC0, 0x00, 0x0B, 0x08, 0x01, 0xE0,
                     0x02, 0x80, 0x01, 0x01, 0x11, 0x00, 0xFF, 0xD9};

struct Size {
  bool found;
  int32_t width;
  int32_t height;
};

Size Parse(const Bytes& bytes) {
  Bytes exact(bytes);  // heap buffer of exactly bytes.size()
  exact.shrink_to_fit();
  Size size = {false, -1, -1};
  size.found =
      ReadImageSize(exact.data(), exact.size(), &size.width, &size.height);
  return size;
}

Bytes With(Bytes bytes, size_t at, std::initializer_list<uint8_t> patch) {
  for (uint8_t b : patch) bytes[at++] = b;
  return bytes;
}

TEST(ImageSizeTest, ReadsEachFormat) {
  struct Case {
    const char* name;
    Bytes bytes;
    int32_t width, height;
  } cases[] = {
      {"png", kPng, 3, 2},
      {"gif89a", kGif, 320, 240},
      {"gif87a", With(kGif, 4, {'7'}), 320, 240},
      {"jpeg sof0", kJpeg, 640, 480},
      {"jpeg sof2", With(kJpeg, 21, {0xC2}), 640, 480},
      {"jpeg fill bytes",
       [] {
         Bytes b(kJpeg);
         b.insert(b.begin() + 20, {0xFF, 0xFF});
         return b;
       }(),
       640, 480},
      {"jpeg restart marker",
       [] {
         Bytes b(kJpeg);
         b.insert(b.begin() + 20, {0xFF, 0xD0});
         return b;
       }(),
       640, 480},
  };
  for (const Case& c : cases) {
    Size size = Parse(c.bytes);
    EXPECT_TRUE(size.found) << c.name;
    EXPECT_EQ(c.width, size.width) << c.name;
    EXPECT_EQ(c.height, size.height) << c.name;
  }
}

TEST(ImageSizeTest, BadHeadersAreRejectedAndLeaveOutputsAlone) {
  struct Case {
    const char* name;
    Bytes bytes;
  } cases[] = {
      {"empty", {}},
      {"garbage", {'h', 'e', 'l', 'l', 'o', ' ', 'w', 'o', 'r', 'l', 'd'}},
      {"png first chunk not IHDR", With(kPng, 12, {'I', 'D', 'A', 'T'})},
      {"png zero width", With(kPng, 16, {0, 0, 0, 0})},
      {"png width above INT32_MAX", With(kPng, 16, {0x80, 0, 0, 0})},
      {"gif zero height", With(kGif, 8, {0, 0})},
      {"gif bad version", With(kGif, 3, {'9', '0'})},
      {"jpeg segment length past the end", With(kJpeg, 4, {0xFF, 0xF0})},
      {"jpeg segment length below 2", With(kJpeg, 4, {0x00, 0x01})},
      {"jpeg not at a marker", With(kJpeg, 20, {0x00})},
      {"jpeg scan before frame", With(kJpeg, 21, {0xDA})},
      {"jpeg end before frame", With(kJpeg, 21, {0xD9})},
      {"jpeg frame too short", With(kJpeg, 22, {0x00, 0x06})},
      {"jpeg height from DNL (zero)", With(kJpeg, 25, {0x00, 0x00})},
      {"jpeg only fill bytes", {0xFF, 0xD8, 0xFF, 0xFF, 0xFF}},
      {"jpeg DHT is no frame", With(kJpeg, 21, {0xC4})},
  };
  for (const Case& c : cases) {
    Size size = Parse(c.bytes);
    EXPECT_FALSE(size.found) << c.name;
    EXPECT_EQ(-1, size.width) << c.name;
    EXPECT_EQ(-1, size.height) << c.name;
  }
  int32_t w = -1, h = -1;
  EXPECT_FALSE(ReadImageSize(nullptr, 100, &w, &h));
}

TEST(ImageSizeTest, TruncatedHeadersAreRejectedAtEveryLength) {
  // The size is known only once the bytes that state it were read: 24 for
  // PNG, 10 for GIF, the whole frame segment (33 bytes) for JPEG.
  struct Case {
    const Bytes* bytes;
    size_t needed;
  } cases[] = {{&kPng, 24}, {&kGif, 10}, {&kJpeg, 33}};
  for (const Case& c : cases) {
    for (size_t n = 0; n <= c.bytes->size(); ++n) {
      Size size = Parse(Bytes(c.bytes->begin(), c.bytes->begin() + n));
      EXPECT_EQ(n >= c.needed, size.found) << "length " << n;
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
    size_t extra = random() % 64;
    for (size_t j = 0; j < extra; ++j) {
      // Mostly marker-like bytes, so JPEG walks go deep.
      bytes.push_back(random() % 3 == 0 ? 0xFF : random() % 256);
    }
    Size size = Parse(bytes);
    if (size.found) {
      EXPECT_GE(size.width, 1);
      EXPECT_GE(size.height, 1);
    }
  }
}

}  // namespace
}  // namespace mediaparserd
