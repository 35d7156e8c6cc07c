// Converted-video and codec names: three constant tables and their lookups.
//
// - Converted-video names: the file names under which converted copies of
//   a video are stored ("QUVAPHOTO_FILM_H.mp4", and the same with ':' after
//   QUVAPHOTO), each with its conversion type ("CONVERTA_HIGH", or empty).
// - AAC audio object types: names for the MPEG-4 audio object numbers
//   1..28 and 31, with "aac_invalid" (0) as the default; 10, 11, 18, 29 and
//   30 have no name of their own.
// - DLNA container types: names for 0..17, "unknown" (0) the default.
//
// Module "quvaidx_file" for the one log line. The tables are constants and
// no function keeps state: every function may be called from any thread.
//
// These names are exported without parameter types (C linkage).
#ifndef QUVAIDX_CODEC_NAMES_H_
#define QUVAIDX_CODEC_NAMES_H_

#include "quvaidx/export.h"

#ifdef __cplusplus
extern "C" {
#endif

// Looks up the bare file name `name` (never a path; letter case counts) in
// the converted-video table.
// Returns 1 and the conversion type in out (possibly empty) when found; 0
// and an empty out when not; -1 for a null or empty name, which also writes
// "quvaidx_file:<line> Bad parameter: szName." to the system log at error
// priority, out untouched.
// The type is cut to fit out[out_size] (size 8 keeps "ANDROID" of
// "ANDROID_UPLOAD"). A null out or out_size < 1 receives nothing; the
// result is the same.
QUVAIDX_API int ConvertVideoTypeGet(const char* name, char* out, int out_size);

// The AAC object type name of `number`; "aac_invalid" for 0 and for every
// number without a row. The text is static.
QUVAIDX_API const char* QUVAAacCodecNameGet(int number);

// The number whose AAC name equals `name` exactly (letter case counts);
// 0 for "aac_invalid", for no match and for null.
QUVAIDX_API int QUVAAacObjectTypeGet(const char* name);

// The DLNA container name of `number`; "unknown" for 0 and for every number
// outside 1..17. The text is static.
QUVAIDX_API const char* QUVADlnaContainerNameGet(int number);

// The number whose container name equals `name` exactly (the whole text
// "mov,mp4,m4a,3gp,3g2,mj2" for 8); 0 for "unknown", no match and null.
QUVAIDX_API int QUVADlnaContainerTypeGet(const char* name);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // QUVAIDX_CODEC_NAMES_H_
