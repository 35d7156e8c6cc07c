// Text encoding: the clean-up of a media record's tag texts to UTF-8, and
// the small text utilities used around it.
//
// Tag texts reach a media record (quvaidx/mediainfo.h) in whatever encoding
// the media file used: UTF-8, UTF-16 or the system's 8-bit code page.
// MediaInfoValid turns them into UTF-8; a text that cannot be converted is
// dropped, or replaced by a name taken from the file's path, and a text that
// holds a control character is emptied.
//
// Character-set work is done by ICU (the strict UTF-8 test) and by the host
// library (quvahost/quvahost.h: conversion from UTF-16 and from a code page,
// the code page setting).
//
// Texts are zero-terminated byte strings; their length is the bytes before
// the terminator. "Structurally UTF-8" means what IsUnicodeString accepts.
//
// Log lines carry the module name "quvaidx_unicode" and go straight to the
// system log at LOG_ERR priority, whatever g_log_level, in the form
// "quvaidx_unicode (<line>) Bad parameter.".
//
// Threads. No state survives between calls; calls on distinct records and
// buffers may run in parallel, as far as the host's character-set calls
// allow.
//
// These names are exported without parameter types (C linkage).
#ifndef QUVAIDX_TEXT_H_
#define QUVAIDX_TEXT_H_

#include "quvaidx/export.h"
#include "quvaidx/mediainfo.h"

extern "C" {

// Rewrites the tag texts of *record in place so that they are UTF-8:
//  1. szTitle, szArtist, szComposer, szComment, szAlbum, szGenre, in this
//     order: a text that TryUTF8ToUTF16 accepts stays as it is; otherwise it
//     is converted by the host from UTF-16 when its bl...UTF16 flag is
//     nonzero, else from the code page QUVAIndexCodePageGet names, the result
//     cut at a character boundary to fit the field. When the host cannot
//     convert it, the field is zeroed and, for the title, replaced by the
//     file's name without its extension (the text after the last '/' of
//     szPath, ended at its last '.'), for the album by the name of the folder
//     that holds the file; both cut to 254 bytes at a character boundary
//     when the name is structurally UTF-8. Without a '/' (two for the album)
//     the field stays empty.
//  2. szAlbum, szArtist, szAlbumArtist, szComposer, szComment, szGenre,
//     szTitle: a text holding a byte from 1 to 31 becomes empty.
// szAlbumArtist is never re-encoded; the other fields are not touched.
// A null record logs "Bad parameter." and returns.
// Unterminated fields are tolerated: szPath is read up to its first zero
// byte or its capacity, and a tag field that holds no zero byte is treated
// as ending at its last byte, which becomes the terminator.
QUVAIDX_API void MediaInfoValid(__tag_QUVA_MEDIA_INFO* record);

// Returns 1 when `text` is null, empty or valid UTF-8 by ICU's rules
// (u_strFromUTF8 reports no error), else 0. Texts under 512 bytes are
// converted on the stack; for longer ones a failed allocation of the scratch
// buffer counts as 0.
QUVAIDX_API int TryUTF8ToUTF16(const char* text);

// Returns 1 when `text` is null, empty or structurally UTF-8: every lead
// byte 0x01-0x7F, 0xC0-0xDF, 0xE0-0xEF, 0xF0-0xF7, 0xF8-0xFB or 0xFC-0xFD is
// followed by 0, 1, 2, 3, 4 or 5 continuation bytes (0x80-0xBF). Overlong
// forms, surrogates and values above U+10FFFF pass; a continuation byte as a
// lead byte, 0xFE, 0xFF or a sequence cut by the terminator give 0. Looser
// than TryUTF8ToUTF16.
QUVAIDX_API int IsUnicodeString(const char* text);

// Writes into dst[size] the longest prefix of `src` shorter than `size`
// bytes, terminated. When `src` is structurally UTF-8 the prefix ends at a
// character boundary (empty when even the first character is `size` bytes or
// longer); otherwise it is a plain byte cut. Works for texts of any length.
// Writes nothing when src or dst is null, src is empty or size < 1.
// REQUIRES: dst has room for `size` bytes; dst does not overlap src.
QUVAIDX_API void ShortenString(const char* src, char* dst, int size);

// Removes leading and trailing blanks (0x20 only; tabs and line ends stay)
// from `text` in place. A text made only of blanks, and a null text, are
// left unchanged.
QUVAIDX_API void StringTrim(char* text);

// Writes into dst[size] a copy of `src` in which every '%' is doubled, so
// that it can serve as a printf format that prints `src`. The escaped text
// is cut to size - 1 output bytes (a doubled sign straddling the limit
// leaves a single '%' last) and terminated; nothing is written at or beyond
// dst[size].
// Returns the bytes written before the terminator. Returns -1, writing
// nothing, when src or dst is null or size is 0. A negative size writes only
// a terminator at dst[0] and returns 0.
// REQUIRES: dst does not overlap src.
QUVAIDX_API int EscapePercentSign(const char* src, char* dst, int size);

// The host's system code page identifier (QLIBCCodePageGet with selector
// QLIBC_CODEPAGE_SYSTEM), asked afresh on every call; QLIBC_CODEPAGE_FALLBACK
// (15) when the host cannot report it.
QUVAIDX_API int QUVAIndexCodePageGet(void);

}  // extern "C"

#endif  // QUVAIDX_TEXT_H_
