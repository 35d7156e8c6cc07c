/* Host platform services: the operations that libquvaidx asks of the
 * appliance's own system library.
 *
 * libquvaidx reaches the host only through this header, so either the
 * appliance's library or the stand-in built from src/platform
 * (libquvahost.so) can be linked behind it. Everything below describes the
 * stand-in; the names and argument lists are the appliance's.
 *
 * The stand-in keeps its own files in one directory, by default
 * QUVA_HOST_ETC_DEFAULT, or the directory named by the environment variable
 * QUVA_HOST_ETC (read on every call, so it may change while the process
 * runs):
 *   shares.conf       share database (INI: one section per share name);
 *   shares.conf.lock  lock file taken by QUVAShareUpdate;
 *   host.conf         host settings (section [system], key code_page);
 *   boot_step         the boot step as a decimal number.
 *
 * Results. Unless a function says otherwise it returns 0 (or a count, or a
 * code) on success and -1 on failure. Output parameters are written only on
 * success. Every failing call records its error code (an errno value such
 * as ENOENT), the host source file and the line in the calling thread's
 * error stack (QLIBCErrGet and friends) and leaves the same code in errno.
 * Successful calls leave the error stack as it was.
 *
 * Buffers. Sizes are in bytes and include the terminating zero; nothing is
 * ever written at or beyond buffer[size - 1] except that terminator. Texts
 * are zero-terminated byte strings.
 *
 * Threads. Every function may be called from several threads at once; the
 * error stack is kept per thread. Share records belong to the caller from
 * the moment they are handed out until QUVAShareFree.
 *
 * Processes. QUVAShareUpdate serialises writers of the share database with
 * an exclusive flock on shares.conf.lock and replaces the database by an
 * atomic rename, so readers never see a half-written file.
 */
#ifndef QUVAHOST_QUVAHOST_H_
#define QUVAHOST_QUVAHOST_H_

#include <stdint.h>

#if defined(__GNUC__) || defined(__clang__)
#define QUVAHOST_API __attribute__((visibility("default")))
#else
#define QUVAHOST_API
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* Directory of the stand-in's files when QUVA_HOST_ETC is unset or empty. */
#define QUVA_HOST_ETC_DEFAULT "/usr/quva/etc"
/* Environment variable that overrides QUVA_HOST_ETC_DEFAULT. */
#define QUVA_HOST_ETC_ENV "QUVA_HOST_ETC"

/* ------------------------------------------------------------------------
 * Shares
 * ---------------------------------------------------------------------- */

#define QUVA_SHARE_NAME_SIZE 256        /* szName, terminator included */
#define QUVA_SHARE_PATH_SIZE 4096       /* szPath, terminator included */
#define QUVA_SHARE_STATUS_INDEXED 0x20u /* uStatus bit: share is indexed */

/* The host's record of a shared folder. Allocated by QUVAShareGet and
 * QUVAShareGetByAttrStr, released by QUVAShareFree. */
typedef struct ShareRecord {
  char szName[QUVA_SHARE_NAME_SIZE]; /* share name, the database section */
  char szPath[QUVA_SHARE_PATH_SIZE]; /* absolute path on disk, no final '/' */
  unsigned int uStatus;              /* status flags, see QUVA_SHARE_STATUS_* */
} ShareRecord;

/* Selector of QUVAShareGetByAttrStr: find the share that holds a path. */
#define QUVA_SHARE_ATTR_PATH 1

/* Looks up the share called `name` (exact, case-sensitive match).
 * Returns 0 and stores a new record in *record. Returns -1 when the share
 * is not in the database (ENOENT), the database cannot be read, or an
 * argument is null (EINVAL). *record is set to NULL first whenever `record`
 * is not null, so QUVAShareFree(*record) is always safe afterwards. */
QUVAHOST_API int QUVAShareGet(const char* name, ShareRecord** record);

/* With attribute QUVA_SHARE_ATTR_PATH: finds the share whose path on disk
 * holds `value`, an absolute path. Whole path components are compared (the
 * share /vol1/video holds /vol1/video and /vol1/video/a, not
 * /vol1/videos); repeated and final '/' and "." components are ignored;
 * when several shares hold the path, the longest share path wins. A path
 * with a ".." component or a relative path matches nothing (EINVAL).
 * Symbolic links are not resolved.
 * Returns 0 and stores a new record in *record; -1 when no share holds the
 * path (ENOENT), on a bad attribute or argument (EINVAL) or when the
 * database cannot be read. *record is set to NULL first, as above. */
QUVAHOST_API int QUVAShareGetByAttrStr(const char* value, int attribute,
                                       ShareRecord** record);

/* Stores record->uStatus as the status flags of the share named
 * record->szName; the name selects the section and szPath is not written.
 * The rest of the database (other shares, comments, other keys) is kept
 * byte for byte. The new database is written to a temporary file in the
 * same directory, synced and renamed over the old one while the exclusive
 * lock on shares.conf.lock is held.
 * Returns 0, or -1 when the share is not in the database (ENOENT), the
 * record is null or its name is not terminated (EINVAL), or the database
 * cannot be read or replaced (the old database then stays intact). */
QUVAHOST_API int QUVAShareUpdate(const ShareRecord* record);

/* Releases a record handed out by this library. NULL is ignored. */
QUVAHOST_API void QUVAShareFree(ShareRecord* record);

/* ------------------------------------------------------------------------
 * Filesystem types
 *
 * QUVAGetFSType names the filesystem by one of these codes. Remote ones
 * keep their data on another machine, image ones are read-only images;
 * QUVAFSIsRemoteFS and QUVAFSIsImageFS answer from this table:
 *
 *   code  filesystem                      remote  image
 *    0    any other (local or virtual)
 *    1    ext2, ext3, ext4
 *    2    XFS
 *    3    Btrfs
 *    4    tmpfs, ramfs
 *    5    ZFS
 *    6    FAT (vfat, msdos)
 *    7    exFAT
 *    8    NTFS (kernel driver)
 *    9    HFS+
 *   10    NFS                             yes
 *   11    CIFS / SMB / SMB2               yes
 *   12    FUSE (filesystem in user space) yes
 *   13    ISO 9660                                yes
 *   14    UDF                                     yes
 *   15    squashfs                                yes
 *   16    cramfs, romfs, EROFS                    yes
 *   17    AFS, Ceph, 9P, Coda             yes
 *   18    overlayfs
 *
 * Code 12 stands for FUSE: the kernel cannot tell where the data of a
 * user-space filesystem comes from (it is often a network or cloud store),
 * so it is treated like a network filesystem: not walked as local media and
 * no metadata directories written on it.
 * ---------------------------------------------------------------------- */

enum QuvaFsType {
  QUVA_FS_OTHER = 0,
  QUVA_FS_EXT = 1,
  QUVA_FS_XFS = 2,
  QUVA_FS_BTRFS = 3,
  QUVA_FS_TMPFS = 4,
  QUVA_FS_ZFS = 5,
  QUVA_FS_FAT = 6,
  QUVA_FS_EXFAT = 7,
  QUVA_FS_NTFS = 8,
  QUVA_FS_HFSPLUS = 9,
  QUVA_FS_NFS = 10,
  QUVA_FS_CIFS = 11,
  QUVA_FS_FUSE = 12,
  QUVA_FS_ISO9660 = 13,
  QUVA_FS_UDF = 14,
  QUVA_FS_SQUASHFS = 15,
  QUVA_FS_ROM_IMAGE = 16,
  QUVA_FS_NETWORK_OTHER = 17,
  QUVA_FS_OVERLAY = 18
};

/* With option 0: the type code of the filesystem that holds `path`
 * (statfs(2), symbolic links followed). Returns a code from the table, or
 * -1 with errno set when the path cannot be examined or the option is not
 * 0 (EINVAL). */
QUVAHOST_API int QUVAGetFSType(const char* path, int option);

/* 1 when `type` is a remote code of the table, else 0 (also for -1). */
QUVAHOST_API int QUVAFSIsRemoteFS(int type);

/* 1 when `type` is an image code of the table, else 0 (also for -1). */
QUVAHOST_API int QUVAFSIsImageFS(int type);

/* ------------------------------------------------------------------------
 * Metadata directories
 *
 * Data derived from a media file lives in its EA directory: a directory
 * named after the file inside the hidden metadata directory
 * QUVA_EA_HIDDEN_DIR of the file's folder:
 *   /share/a/x.jpg  ->  /share/a/.quvameta/x.jpg
 * ---------------------------------------------------------------------- */

#define QUVA_EA_HIDDEN_DIR ".quvameta"

/* With option 0: writes the EA directory path of `file_path` into
 * buffer[size]. Final '/' of file_path are ignored; a relative path gives a
 * relative result. The result always contains a '/'. Nothing is touched on
 * disk.
 * Returns 0. Returns -1 when an argument is null, size < 1 or the option
 * is not 0 (EINVAL); when the last component is empty, "." or "..", or a
 * component of the path is QUVA_EA_HIDDEN_DIR itself, because metadata has
 * no metadata (EINVAL); when the result does not fit (ERANGE). */
QUVAHOST_API int QUVAEADirPath(int option, const char* file_path, char* buffer,
                               int size);

/* With option 1: makes sure that the EA directory `ea_dir_path` (a path as
 * QUVAEADirPath gives it) exists, creating the hidden directory and then
 * the EA directory with mode 0777 less the umask where they are missing. A
 * directory made at the same moment by another process counts as success;
 * a symbolic link to a directory counts as a directory. The media folder
 * itself is never created.
 * Returns 0 when the directory exists afterwards. Returns -1 when the
 * option is not 1 or the path is not an EA directory path (EINVAL), when a
 * non-directory is in the way (ENOTDIR) or mkdir fails (its errno). */
QUVAHOST_API int QUVAEAMKDir(int option, const char* ea_dir_path);

/* 1 when `name` (a single directory entry name) is QUVA_EA_HIDDEN_DIR,
 * else 0 (also for NULL). Case-sensitive. */
QUVAHOST_API int QUVAEAIsHiddenDir(const char* name);

/* ------------------------------------------------------------------------
 * Boot state
 * ---------------------------------------------------------------------- */

#define QUVA_BOOT_STEP_READY 4 /* the appliance has finished booting */

/* The boot step: the decimal number in the file boot_step of the host
 * directory (blanks and a line end around it allowed). Without that file
 * the machine counts as booted and the result is QUVA_BOOT_STEP_READY.
 * Returns the step (0 or more), or -1 when the file exists but cannot be
 * read or does not hold a number (EINVAL). */
QUVAHOST_API int QUVASystemGetBootStep(void);

/* ------------------------------------------------------------------------
 * Error stack: the last host failure of the calling thread.
 * ---------------------------------------------------------------------- */

/* Error code of the calling thread's last failure (an errno value), 0 when
 * no host call of this thread has failed yet. */
QUVAHOST_API int QLIBCErrGet(void);

/* Base name of the host source file that recorded that failure; "" when
 * none. The text is static and stays valid. */
QUVAHOST_API const char* QLIBCErrorGetFile(void);

/* Source line that recorded that failure; 0 when none. */
QUVAHOST_API int QLIBCErrorGetLine(void);

/* ------------------------------------------------------------------------
 * Files
 * ---------------------------------------------------------------------- */

/* Option of QLIBCFileGetLine: find a line exactly equal to the key. */
#define QLIBC_GETLINE_EXACT 0x404

/* With option QLIBC_GETLINE_EXACT: looks for a line of the regular file
 * `file` equal to `key`. Lines end with '\n' ("\r" is an ordinary byte);
 * the last line may lack it. The key must not contain '\n'; an empty key
 * matches an empty line. The file is read in large blocks with one buffer
 * per call, so it suits files of hundreds of thousands of lines.
 * Returns 1 and copies the line, without its line end, into buffer[size];
 * 0 when no line matches (buffer untouched); -1 when the file cannot be
 * read or is not a regular file, an argument is null, the option is not
 * QLIBC_GETLINE_EXACT or the key holds '\n' (EINVAL), or the key does not
 * fit in the buffer (ERANGE). */
QUVAHOST_API int QLIBCFileGetLine(const char* file, const char* key,
                                  char* buffer, int size, int option);

/* Reads the value of `key` in section `section` of the INI-style file
 * `file` into buffer[size].
 * Format: "[section]" lines open a section; "key = value" lines belong to
 * the last section opened (keys before any section to section ""); blank
 * space around names and values is dropped, and a value wholly enclosed in
 * double quotes loses them; lines starting with '#' or ';' and lines
 * without '=' are ignored. Names are case-sensitive; the first matching
 * key of the first matching section wins.
 * Returns the length of the value (0 for an empty value); -1 when the file
 * cannot be read, the section or key is missing (ENOENT), an argument is
 * null or size < 1 (EINVAL), or the value does not fit (ERANGE). */
QUVAHOST_API int QLIBCFileGetSectionValue(const char* file, const char* section,
                                          const char* key, char* buffer,
                                          int size);

/* Option of QLIBCFileStat: follow links, report type and times. */
#define QLIBC_STAT_TIMES 9
/* uFlags bit: llCTime is the filesystem's own birth time. */
#define QLIBC_STAT_FLAG_BIRTH_TIME 0x1u

/* The 128-byte extended status record filled by QLIBCFileStat. */
typedef struct QLIBCFileStatRecord {
  uint32_t uMode;       /* st_mode: file type bits (S_IFMT) and permissions */
  uint32_t uFlags;      /* QLIBC_STAT_FLAG_* */
  int64_t llSize;       /* size in bytes */
  int64_t llMTime;      /* modification time, seconds since the epoch */
  int64_t llCTime;      /* creation time: the birth time where the
                           filesystem records one (uFlags says so), else the
                           status-change time */
  int64_t llChangeTime; /* status-change time (st_ctime) */
  int64_t llATime;      /* access time */
  uint32_t uUid;        /* owner */
  uint32_t uGid;        /* group */
  uint64_t ullInode;    /* inode number */
  uint64_t ullDevice;   /* device of the filesystem */
  uint8_t reserved[56]; /* zero */
} QLIBCFileStatRecord;

/* With option QLIBC_STAT_TIMES: examines `path` (links followed) and fills
 * *record (statx(2) with the birth time; stat(2) where statx is missing).
 * Returns 0; -1 when the path cannot be examined or an argument is bad
 * (EINVAL). */
QUVAHOST_API int QLIBCFileStat(const char* path, int option,
                               QLIBCFileStatRecord* record);

/* ------------------------------------------------------------------------
 * Pid files: a decimal process id, optionally surrounded by blanks and
 * line ends, and nothing else.
 * ---------------------------------------------------------------------- */

/* Returns the pid held in `pid_file` (> 0); -1 when the file cannot be
 * read, is longer than 64 bytes, or holds anything but one pid from 1 to
 * INT_MAX (EINVAL). */
QUVAHOST_API int QLIBCReadPidFile(const char* pid_file);

/* Returns 1 when the process named by `pid_file` is alive, else 0: the
 * process must exist, must not be a zombie, and must have started no later
 * than the pid file was last modified (with 2 seconds' slack for clock and
 * timestamp granularity). A process that started after its pid file was
 * written cannot be the writer: its pid was recycled. A process whose start
 * time cannot be read (e.g. hidden /proc entries) counts when it exists.
 * 0 also when the pid file is missing or bad (error stack set then). */
QUVAHOST_API int QLIBCProcAliveByPidFile(const char* pid_file);

/* ------------------------------------------------------------------------
 * Character sets
 *
 * Code page identifiers and the ICU converters behind them:
 *
 *    id  character set                       ICU converter
 *     0  UTF-8                               UTF-8
 *     1  Western European (Windows-1252)     windows-1252
 *     2  Central European (Windows-1250)     windows-1250
 *     3  Cyrillic (Windows-1251)             windows-1251
 *     4  Greek (Windows-1253)                windows-1253
 *     5  Turkish (Windows-1254)              windows-1254
 *     6  Hebrew (Windows-1255)               windows-1255
 *     7  Arabic (Windows-1256)               windows-1256
 *     8  Baltic (Windows-1257)               windows-1257
 *     9  Vietnamese (Windows-1258)           windows-1258
 *    10  Thai (Windows-874)                  windows-874
 *    11  Japanese (Shift_JIS, Windows-31J)   windows-31j
 *    12  Simplified Chinese (GBK)            windows-936
 *    13  Traditional Chinese (Big5)          windows-950
 *    14  Korean (Windows-949)                windows-949
 *    15  Latin-1 (ISO 8859-1), the fallback  ISO-8859-1
 *
 * 15 is the fallback set: every byte is a character of it, so any text
 * converts.
 * ---------------------------------------------------------------------- */

#define QLIBC_CODEPAGE_SYSTEM 1    /* selector of QLIBCCodePageGet */
#define QLIBC_CODEPAGE_FALLBACK 15 /* Latin-1 */

/* With selector QLIBC_CODEPAGE_SYSTEM: the system code page, from key
 * code_page of section [system] in host.conf, given either as an id of the
 * table or as a converter name of the table (case-insensitive).
 * Returns 0 and stores the id in *code_page; -1 when there is no setting
 * (ENOENT), the setting is not in the table or an argument is bad (EINVAL).
 * Callers use QLIBC_CODEPAGE_FALLBACK on failure. */
QUVAHOST_API int QLIBCCodePageGet(int selector, int* code_page);

/* Converts UTF-16 text to UTF-8 in out[out_size] (out_size >= 1).
 * A byte-order mark (FF FE little-endian, FE FF big-endian) selects the
 * byte order and is dropped; without one the text is little-endian. The
 * text ends at its first zero code unit and is never read beyond its first
 * out_size bytes (callers convert fixed fields whose size equals out_size),
 * an odd last byte and a surrogate pair cut there being ignored. Output
 * that does not fit is cut at a character boundary. `out` may be `text`.
 * Returns the number of bytes written before the terminator; -1 on an
 * unpaired surrogate (EILSEQ) or a bad argument (EINVAL), out untouched. */
QUVAHOST_API int QLIBCUnicodeStrUTF16ToUTF8(const char* text, char* out,
                                            int out_size);

/* Converts `text` in code page `code_page` (an id of the table) to UTF-8
 * in out[out_size] (out_size >= 1). The text is read up to its terminator
 * and never beyond its first out_size bytes, as above; output that does not
 * fit is cut at a character boundary. `out` may be `text`.
 * Returns the number of bytes written before the terminator; -1 when the
 * text is not valid in that code page (EILSEQ), the id is unknown or an
 * argument is bad (EINVAL), or ICU fails (EIO); out untouched then. */
QUVAHOST_API int QLIBCUnicodeStrCPToUTF8(int code_page, const char* text,
                                         char* out, int out_size);

/* Number of UTF-8 characters in `text`: bytes that are not continuation
 * bytes (10xxxxxx), a continuation byte at the very start counting as one
 * character of its own. Returns -1 for NULL (EINVAL). */
QUVAHOST_API int QLIBCUnicodeUTF8StrCountChar(const char* text);

/* The position just after the first n characters of `text` (characters as
 * QLIBCUnicodeUTF8StrCountChar counts them); n = 0 gives text, n equal to
 * the count gives the terminator. Returns NULL when the text has fewer than
 * n characters (ERANGE), or for NULL text or n < 0 (EINVAL). */
QUVAHOST_API const char* QLIBCUnicodeUTF8ForwardNChar(const char* text, int n);

#ifdef __cplusplus
} /* extern "C" */
#endif

#endif /* QUVAHOST_QUVAHOST_H_ */
