// Media type classification by file-name extension.
//
// A file's kind is told by its extension alone; the file is never read.
// Ten fixed lists of lowercase extensions (without the dot) back the
// predicates below; every predicate asks the same membership test, which
// compares whole extensions with ASCII case folding only (no locale, no
// trimming, no prefix match) and allocates nothing.
//
// Results: predicates return 1 for yes and 0 for no; a null argument is a
// no. Nothing is logged.
//
// Threads: the lists are constants and no function keeps state, so all may
// be called from any thread at once.
//
// These names are exported without parameter types (C linkage).
#ifndef QUVAIDX_MEDIA_TYPE_H_
#define QUVAIDX_MEDIA_TYPE_H_

#include "quvaidx/export.h"

#ifdef __cplusplus
extern "C" {
#endif

// Media tables of the index, as GetMediaTableTypeFromExt names them. The
// values 4 and 5 belong to tables that no extension selects.
enum {
  MEDIA_TABLE_MUSIC = 0,
  MEDIA_TABLE_VIDEO = 1,
  MEDIA_TABLE_PHOTO = 2,
  MEDIA_TABLE_PLAYLIST = 3,
  MEDIA_TABLE_NONE = 6
};

// Returns a pointer into `path` just after its last '.', searched in the
// whole string (so "/media/album.old/track" gives "old/track"), or null when
// `path` is null or holds no '.'. Nothing is copied; the result lives as
// long as `path`.
QUVAIDX_API const char* QUVAIndexExtGet(const char* path);

// Predicates on an extension given without its dot ("jpg", "JPG").
// Video for the web: mpg mpeg avi wmv asf mov flv f4v 3gp 3g2 mp4 m4v qt
// divx xvid dat m2ts m2t mts.
QUVAIDX_API int BlQUVAIndexIsVideoOnWeb(const char* ext);
// Photo for the web: jpg jpeg jpe bmp png tif tiff gif and the raw images.
QUVAIDX_API int BlQUVAIndexIsPhotoOnWeb(const char* ext);
// Raw camera images: arw srf sr2 dcr k25 kdc cr2 crw nef mrw ptx pef raf
// 3fr erf mef mos orf rw2 dng x3f raw.
QUVAIDX_API int BlQUVAIndexIsRawImage(const char* ext);
// JPEG: jpg jpeg jpe.
QUVAIDX_API int BlQUVAIndexIsJpeg(const char* ext);
// Video, subtitles and disc images included (36 extensions, "dvr-ms" with
// its hyphen among them).
QUVAIDX_API int BlQUVAIndexIsVideo(const char* ext);
// Photo: jpg jpeg jpe bmp png gif ico tif tiff psd ufo and the raw images.
QUVAIDX_API int BlQUVAIndexIsPhoto(const char* ext);
// Playlist: m3u wpl pls.
QUVAIDX_API int BlQUVAIndexIsPlaylist(const char* ext);
// Music: mp3 mp1 mp2 mpa wma wav ogg m4a aac ac3 ram ra m4p flac aiff aif
// pcm m4b ape dsf dff.
QUVAIDX_API int BlQUVAIndexIsMusic(const char* ext);

// Predicates on a path: its extension is taken with QUVAIndexExtGet, and a
// path without one is a no.
// Subtitle: srt ass ssa smi psb.
QUVAIDX_API int BlQUVAIndexIsSubtitleFile(const char* path);
// The Video list.
QUVAIDX_API int BlQUVAIndexIsVideoFile(const char* path);
// The Video for the web list.
QUVAIDX_API int BlQUVAIndexIsVideoOnWebFile(const char* path);
// Photo for web conversion: the Photo for the web list without gif.
QUVAIDX_API int BlQUVAIndexIsPhotoOnWebConvertFile(const char* path);
// The Photo for the web list.
QUVAIDX_API int BlQUVAIndexIsPhotoOnWebFile(const char* path);
// The Music list.
QUVAIDX_API int BlQUVAIndexIsMusicFile(const char* path);

// The media table of an extension: MEDIA_TABLE_MUSIC, _VIDEO, _PHOTO or
// _PLAYLIST for the first of the Music, Video, Photo and Playlist lists that
// holds it (the four share no extension), else MEDIA_TABLE_NONE, also for
// null.
QUVAIDX_API int GetMediaTableTypeFromExt(const char* ext);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // QUVAIDX_MEDIA_TYPE_H_
