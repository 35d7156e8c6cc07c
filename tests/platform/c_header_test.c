/* Compiled as C and linked against libquvahost.so: the header is C, and a C
 * caller reaches the operations through the shared library. Exits 1 on the
 * first failure. */
#define _POSIX_C_SOURCE 200809L /* setenv */

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "quvahost/quvahost.h"

#define CHECK(cond)                                                            \
  do {                                                                         \
    if (!(cond)) {                                                             \
      fprintf(stderr, "%s:%d: check failed: %s\n", __FILE__, __LINE__, #cond); \
      return 1;                                                                \
    }                                                                          \
  } while (0)

int main(void) {
  char buf[4096];
  ShareRecord* record = NULL;
  QLIBCFileStatRecord stat_record;
  setenv(QUVA_HOST_ETC_ENV, "/nonexistent-quvahost-etc", 1); /* no files */
  CHECK(QLIBCFileStat("/", QLIBC_STAT_TIMES, &stat_record) == 0);
  CHECK(QUVAEADirPath(0, "/share/a/x.jpg", buf, (int)sizeof buf) == 0);
  CHECK(strcmp(buf, "/share/a/" QUVA_EA_HIDDEN_DIR "/x.jpg") == 0);
  CHECK(QUVASystemGetBootStep() == QUVA_BOOT_STEP_READY);
  CHECK(QUVAShareGet("video", &record) == -1 && record == NULL);
  CHECK(QLIBCErrGet() == ENOENT && QLIBCErrorGetLine() > 0);
  CHECK(QUVAFSIsRemoteFS(QUVA_FS_FUSE) && QUVAFSIsImageFS(QUVA_FS_UDF));
  CHECK(QLIBCUnicodeStrCPToUTF8(QLIBC_CODEPAGE_FALLBACK, "\xE9", buf, 255) ==
        2);
  CHECK(QLIBCUnicodeStrUTF16ToUTF8("h\0i\0\0", buf, 255) == 2);
  puts("quvahost C interface OK");
  return 0;
}
