#include "quvaidx/codec_names.h"

#include <stdio.h>
#include <string.h>
#include <syslog.h>

#include "util/log_internal.h"

namespace {

constexpr char kModule[] = "quvaidx_file";

struct ConvertedVideo {
  const char* file_name;
  const char* conversion_type;
};

// The '_' names, then the ':' names in the same order.
constexpr ConvertedVideo kConvertedVideos[] = {
    {"QUVAPHOTO_FILM_H264.mp4", ""},
    {"QUVAPHOTO_FILM_MPEG4.mp4", ""},
    {"QUVAPHOTO_FILM_CONVERT_MPEG4.mp4", ""},
    {"QUVAPHOTO_FILM_MOBILE.mp4", ""},
    {"QUVAPHOTO_FILM_MOBILE_IPHONE", ""},
    {"QUVAPHOTO_FILM_MOBILE_ANDROID", "ANDROID_UPLOAD"},
    {"QUVAPHOTO_FILM.flv", "GALVENTA_FLV"},
    {"QUVAPHOTO_FILM_H.mp4", "CONVERTA_HIGH"},
    {"QUVAPHOTO_FILM_M.mp4", "CONVERTA_MEDIUM"},
    {"QUVAPHOTO_FILM_L.mp4", "CONVERTA_LOW"},
    {"QUVAPHOTO:FILM_H264.mp4", ""},
    {"QUVAPHOTO:FILM_MPEG4.mp4", ""},
    {"QUVAPHOTO:FILM_CONVERT_MPEG4.mp4", ""},
    {"QUVAPHOTO:FILM_MOBILE.mp4", ""},
    {"QUVAPHOTO:FILM_MOBILE_IPHONE", ""},
    {"QUVAPHOTO:FILM_MOBILE_ANDROID", "ANDROID_UPLOAD"},
    {"QUVAPHOTO:FILM.flv", "GALVENTA_FLV"},
    {"QUVAPHOTO:FILM_H.mp4", "CONVERTA_HIGH"},
    {"QUVAPHOTO:FILM_M.mp4", "CONVERTA_MEDIUM"},
    {"QUVAPHOTO:FILM_L.mp4", "CONVERTA_LOW"},
};

struct NamedNumber {
  const char* name;
  int number;
};

// MPEG-4 audio object types; the first row is the default. 10, 11, 18, 29
// and 30 have no row. "aac_hxvc_er" is spelled so.
constexpr NamedNumber kAacObjectTypes[] = {
    {"aac_invalid", 0},    {"aac_main", 1},     {"aac_lc", 2},
    {"aac_ssr", 3},        {"aac_ltp", 4},      {"aac_he", 5},
    {"aac_scale", 6},      {"aac_twinvq", 7},   {"aac_celp", 8},
    {"aac_hvxc", 9},       {"aac_ttsi", 12},    {"aac_ms", 13},
    {"aac_wave", 14},      {"aac_midi", 15},    {"aac_fx", 16},
    {"aac_lc_er", 17},     {"aac_ltp_er", 19},  {"aac_scale_er", 20},
    {"aac_twinvq_er", 21}, {"aac_bsac_er", 22}, {"aac_ld_er", 23},
    {"aac_celp_er", 24},   {"aac_hxvc_er", 25}, {"aac_hiln_er", 26},
    {"aac_param_er", 27},  {"aac_ssc", 28},     {"aac_he_l3", 31},
};

// Container types for DLNA serving, 0 to 17; the first row is the default.
// Rows 1 to 12 are libavformat's format names (row 8 is one name).
constexpr NamedNumber kDlnaContainers[] = {
    {"unknown", 0},
    {"image2", 1},
    {"asf", 2},
    {"amr", 3},
    {"aac", 4},
    {"ac3", 5},
    {"mp3", 6},
    {"wav", 7},
    {"mov,mp4,m4a,3gp,3g2,mj2", 8},
    {"3gp", 9},
    {"mp4", 10},
    {"mpeg", 11},
    {"mpegts", 12},
    {"mpeg_elementary_stream", 13},
    {"mpeg_program_stream", 14},
    {"mpeg_transport_stream", 15},
    {"mpeg_transport_stream_dlna", 16},
    {"mpeg_transport_stream_dlna_no_ts", 17},
};

static_assert(sizeof(kConvertedVideos) / sizeof(kConvertedVideos[0]) == 20);
static_assert(sizeof(kAacObjectTypes) / sizeof(kAacObjectTypes[0]) == 27);
static_assert(sizeof(kDlnaContainers) / sizeof(kDlnaContainers[0]) == 18);

template <size_t N>
const char* NameOf(const NamedNumber (&table)[N], int number) {
  // Rows after the first only: the first row is also the default.
  for (size_t i = 1; i < N; ++i) {
    if (table[i].number == number) return table[i].name;
  }
  return table[0].name;
}

template <size_t N>
int NumberOf(const NamedNumber (&table)[N], const char* name) {
  if (name == nullptr) return 0;
  for (const NamedNumber& row : table) {
    if (strcmp(row.name, name) == 0) return row.number;
  }
  return 0;
}

}  // namespace

extern "C" {

int ConvertVideoTypeGet(const char* name, char* out, int out_size) {
  if (name == nullptr || name[0] == '\0') {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Bad parameter: szName.", kModule,
                       __LINE__);
    return -1;
  }
  // A missing or empty out receives nothing rather than being overrun.
  const bool writable = out != nullptr && out_size > 0;
  if (writable) out[0] = '\0';
  for (const ConvertedVideo& row : kConvertedVideos) {
    if (strcmp(row.file_name, name) == 0) {
      if (writable) snprintf(out, out_size, "%s", row.conversion_type);
      return 1;
    }
  }
  return 0;
}

const char* QUVAAacCodecNameGet(int number) {
  return NameOf(kAacObjectTypes, number);
}

int QUVAAacObjectTypeGet(const char* name) {
  return NumberOf(kAacObjectTypes, name);
}

const char* QUVADlnaContainerNameGet(int number) {
  return NameOf(kDlnaContainers, number);
}

int QUVADlnaContainerTypeGet(const char* name) {
  return NumberOf(kDlnaContainers, name);
}

}  // extern "C"
