// Pixel size from the first bytes of a PNG, JPEG or GIF file.
//
// The bytes come from files the daemon did not write, so the parser trusts
// nothing in them: every offset is checked against `size` before it is
// read, and nothing outside data[0, size) is ever touched, whatever the
// bytes claim. Keeps no state; safe on any thread.
#ifndef MEDIAPARSERD_IMAGE_SIZE_H_
#define MEDIAPARSERD_IMAGE_SIZE_H_

#include <stddef.h>
#include <stdint.h>

namespace mediaparserd {

// Looks at data[0, size), the start of a file, for a PNG signature and its
// IHDR chunk, a GIF signature and its logical screen, or a JPEG start of
// image followed by segments up to a start-of-frame marker (any SOFn).
// Returns true and sets *width and *height (both at least 1) when one of
// them states the size within those bytes; returns false, leaving both
// unchanged, for other formats, truncated or malformed headers, sizes of
// zero or above INT32_MAX, and a JPEG whose frame header lies beyond
// `size` or after its first scan.
bool ReadImageSize(const uint8_t* data, size_t size, int32_t* width,
                   int32_t* height);

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_IMAGE_SIZE_H_
