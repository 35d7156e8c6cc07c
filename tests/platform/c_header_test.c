/* Compiled as C and linked against libquvahost.so: the header is C and the
 * shared library resolves every operation. Exits 1 on the first failure. */
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
  int code_page = 0;
  setenv(QUVA_HOST_ETC_ENV, "/nonexistent-quvahost-etc", 1); /* no files */
  CHECK(sizeof(QLIBCFileStatRecord) == 128);
  CHECK(QUVAEADirPath(0, "/share/a/x.jpg", buf, (int)sizeof buf) == 0);
  CHECK(strcmp(buf, "/share/a/" QUVA_EA_HIDDEN_DIR "/x.jpg") == 0);
  CHECK(QUVAEAIsHiddenDir(QUVA_EA_HIDDEN_DIR) == 1 &&
        QUVAEAMKDir(0, "x") == -1);
  CHECK(QUVASystemGetBootStep() == QUVA_BOOT_STEP_READY);
  CHECK(QUVAShareGet("video", &record) == -1 && record == NULL);
  QUVAShareFree(record);
  CHECK(QLIBCErrGet() == ENOENT);
  CHECK(QLIBCErrorGetFile()[0] != '\0' && QLIBCErrorGetLine() > 0);
  CHECK(QUVAShareGetByAttrStr("/a", QUVA_SHARE_ATTR_PATH, &record) == -1);
  CHECK(QUVAShareUpdate(NULL) == -1);
  CHECK(QUVAFSIsRemoteFS(QUVA_FS_FUSE) && QUVAFSIsImageFS(QUVA_FS_UDF));
  CHECK(QUVAGetFSType("/", 0) >= 0);
  CHECK(QLIBCFileStat("/", QLIBC_STAT_TIMES, &stat_record) == 0);
  CHECK(QLIBCCodePageGet(QLIBC_CODEPAGE_SYSTEM, &code_page) == -1);
  CHECK(QLIBCUnicodeStrCPToUTF8(QLIBC_CODEPAGE_FALLBACK, "\xE9", buf, 255) ==
        2);
  CHECK(QLIBCUnicodeUTF8StrCountChar(buf) == 1);
  CHECK(QLIBCUnicodeUTF8ForwardNChar(buf, 1) == buf + 2);
  CHECK(QLIBCUnicodeStrUTF16ToUTF8("h\0i\0\0", buf, 255) == 2);
  CHECK(QLIBCReadPidFile("/nonexistent.pid") < 0);
  CHECK(QLIBCProcAliveByPidFile("/nonexistent.pid") == 0);
  CHECK(QLIBCFileGetLine("/none", "k", buf, 4097, QLIBC_GETLINE_EXACT) == -1);
  CHECK(QLIBCFileGetSectionValue("/none", "s", "k", buf, 256) == -1);
  puts("quvahost C interface OK");
  return 0;
}
