// The media information record: one media file's location, tags, photo data
// and technical parameters, its JSON form, and two diagnostic dumps.
//
// Record. __tag_QUVA_MEDIA_INFO is a plain value of fixed layout that the
// caller allocates; it holds no pointers and may be copied bytewise. Its 47
// fields, their order, types and text capacities are part of the binary
// interface (checked at compile time in src/mediainfo/media_record.cc). A text
// field is a byte array holding a zero-terminated string; its capacity counts
// the terminator. A zeroed record has every number 0 and every text empty.
//
// JSON form. An object with one member per field, named after the field
// exactly (case included): texts are strings, signed fields (the six UTF-16
// flags included) are integers, ID and the three bit rates unsigned
// integers, fileSize an unsigned 64-bit integer, duration a real (the float
// widened to double, narrowed back on reading).
//
// Reading JSON never throws and never writes beyond a field. A member that
// is absent, null, of another JSON type (a string where a number belongs, an
// object, an array) or out of range for its field (a negative value for an
// unsigned field, a value too large) converts to 0; a real number within
// range is cut toward zero; true and false read as 1 and 0. A text member
// that is not a string becomes an empty text. A string longer than its field's
// capacity less one is cut to that many bytes, at a character boundary when
// the string is UTF-8, so the field always stays zero-terminated.
//
// Threads. Every function here touches only its arguments and may run on any
// thread, concurrently on distinct objects; concurrent dumps may interleave.
//
// These names are exported with their parameter types (C++ linkage).
#ifndef QUVAIDX_MEDIAINFO_H_
#define QUVAIDX_MEDIAINFO_H_

#include <stdint.h>

#include <json/json.h>

#include "quvaidx/export.h"

// Capacities of the record's text fields, terminator included.
constexpr int kMediaPathSize = 4096;    // szPath, szDesc
constexpr int kMediaTagSize = 255;      // names, tags, codecs, szFsUUID
constexpr int kMediaCameraSize = 100;   // szMake, szModel
constexpr int kMediaExposureSize = 20;  // szExposure, szAperture
constexpr int kMediaDateSize = 32;      // szTakenTime, szDate, szMDate

// One media file. Field order, types and capacities are fixed (see above).
struct __tag_QUVA_MEDIA_INFO {
  uint32_t ID;                          // numeric identifier of the item
  char szPath[kMediaPathSize];          // full path of the media file
  char szName[kMediaTagSize];           // name of the item
  char szDesc[kMediaPathSize];          // description
  int32_t track;                        // track number
  int32_t disc;                         // disc number
  int32_t year;                         // year
  char szTitle[kMediaTagSize];          // title
  char szAlbum[kMediaTagSize];          // album
  char szArtist[kMediaTagSize];         // artist
  char szAlbumArtist[kMediaTagSize];    // album artist
  char szGenre[kMediaTagSize];          // genre
  char szComposer[kMediaTagSize];       // composer
  char szComment[kMediaTagSize];        // comment
  char szMake[kMediaCameraSize];        // camera make
  char szModel[kMediaCameraSize];       // camera model
  char szExposure[kMediaExposureSize];  // exposure, as text
  char szAperture[kMediaExposureSize];  // aperture, as text
  char szTakenTime[kMediaDateSize];     // time the picture was taken
  char szDate[kMediaDateSize];          // date, as text
  char szMDate[kMediaDateSize];         // modification date, as text
  float duration;                       // duration
  uint32_t audio_bitrate;               // audio bit rate
  uint32_t frame_bitrate;               // frame bit rate
  uint32_t video_bitrate;               // video bit rate
  int32_t frame_rate_num;               // frame rate numerator
  int32_t frame_rate_den;               // frame rate denominator
  int32_t frequency;                    // audio sampling frequency
  int32_t channel;                      // number of audio channels
  int32_t resolutionX;                  // width in pixels
  int32_t resolutionY;                  // height in pixels
  uint64_t fileSize;                    // file size in bytes
  int32_t song_count;                   // number of songs
  int32_t blTitleUTF16;                 // nonzero: szTitle holds UTF-16 text
  int32_t blArtistUTF16;                // nonzero: szArtist holds UTF-16 text
  int32_t blAlbumUTF16;                 // nonzero: szAlbum holds UTF-16 text
  int32_t blGenreUTF16;                 // nonzero: szGenre holds UTF-16 text
  int32_t blComposerUTF16;              // nonzero: szComposer holds UTF-16 text
  int32_t blCommentUTF16;               // nonzero: szComment holds UTF-16 text
  int32_t coverCount;                   // number of cover pictures
  int32_t iso;                          // ISO speed
  char szVideoCodec[kMediaTagSize];     // video codec name
  char szContainerType[kMediaTagSize];  // container type name
  int32_t videoProfile;                 // video codec profile
  int32_t videoLevel;                   // video codec level
  char szAudioCodec[kMediaTagSize];     // audio codec name
  char szFsUUID[kMediaTagSize];         // UUID of the file's file system
};

// A video's orientation and pixel aspect ratio. JSON form:
// {"rotation": int, "par": {"width": int, "height": int}}.
struct _VIDEO_METADATA_ {
  int32_t rotation;   // rotation as reported by the media parser
  int32_t parWidth;   // "par" "width"
  int32_t parHeight;  // "par" "height"
};

// The pixel size of a media file. No JSON form of its own.
struct Resolution {
  int32_t width;   // width in pixels
  int32_t height;  // height in pixels
};

// Replaces `out` with the record's JSON form: exactly 47 members, whatever
// `out` held before. A text field contributes its bytes up to its first zero
// byte (or its whole capacity if it has none). `record` is only read.
QUVAIDX_API void MediaInfoObject2Json(__tag_QUVA_MEDIA_INFO& record,
                                      Json::Value& out);

// Zeroes `record`, then fills every field from the member of `in` named
// after it, with the guarded reads described above. Members that are not
// field names are ignored. When `in` is an object (or null), each field's
// lookup is the non-const member access, so an absent key is added to `in`
// as a null member (and a null `in` becomes an object); any other value of
// `in` is left unchanged and yields a zeroed record. Never fails, never
// logs.
QUVAIDX_API void MediaInfoJson2Object(Json::Value& in,
                                      __tag_QUVA_MEDIA_INFO& record);

// Replaces `out` with {"rotation": rotation, "par": {"width": parWidth,
// "height": parHeight}}, all signed integers.
QUVAIDX_API void VideoMetadataObject2Json(_VIDEO_METADATA_& metadata,
                                          Json::Value& out);

// Zeroes the three fields, then reads "rotation" and "par"."width" /
// "par"."height" from `in` with the guarded reads above: a missing,
// mistyped or out-of-range member, or a "par" that is not an object, leaves
// its field 0. Lookups add absent keys as MediaInfoJson2Object's do. Never
// fails, never logs.
QUVAIDX_API void VideoMetadataJson2Object(Json::Value& in,
                                          _VIDEO_METADATA_& metadata);

// Writes the record's 47 items to standard output with printf, in field
// order, with nothing between them and no final newline; stdout is not
// flushed. An item is the field name left-justified in 16 columns, "= ",
// the value and ",": for example "szTitle         = Song," or
// "duration        = 1.500000,". ID prints as unsigned long, the bit rates as
// unsigned, fileSize in full as an unsigned 64-bit number, duration with
// "%f", texts verbatim (a '%' prints as itself) up to their first zero byte
// or their capacity.
QUVAIDX_API void PrintMediaInfoObject(__tag_QUVA_MEDIA_INFO& record);

// Writes the same 47 items as PrintMediaInfoObject to the system log, one
// line each at LOG_ERR priority whatever g_log_level, each prefixed with
// "quvaidx_mediainfo:<line> ".
QUVAIDX_API void SyslogMediaInfoObject(__tag_QUVA_MEDIA_INFO& record);

#endif  // QUVAIDX_MEDIAINFO_H_
