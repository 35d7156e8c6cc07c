// A hand-written fault and answer layer over the host operations, for tests
// of code that calls the host (quvahost.h).
//
// While a FakeHost lives, every host operation goes through it: it counts
// the call, then fails it or answers it as told, or else passes it on to
// the stand-in (libquvahost's own implementation, on the real files under
// $QUVA_HOST_ETC). The destructor puts the previous operations back.
//
//   quvahost::test::FakeHost host;
//   host.Answer(HostOp::kSystemGetBootStep, {2, 2, 4});  // booted at 3rd ask
//   host.Fail(HostOp::kEADirPath, ENAMETOOLONG);        // every call fails
//   host.FailNth(HostOp::kShareUpdate, 2);              // only the 2nd call
//   host.AddShare("video", "/vol1/video", 0x20);        // in-memory shares
//
// A failed call returns -1 (or the result given to Fail; null for the
// operations that return a pointer), sets *record to null for the share
// lookups, records the code in the calling thread's error stack with file
// "fake_host.cc", and leaves the code in errno.
//
// Works with the static stand-in only (quvahost_static): the code under
// test must reach the host through the same dispatch table. One FakeHost
// at a time; not thread-safe: configure it while no other thread calls the
// host.
#ifndef QUVAIDX_TESTS_SUPPORT_FAKE_HOST_H_
#define QUVAIDX_TESTS_SUPPORT_FAKE_HOST_H_

#include <errno.h>

#include <initializer_list>
#include <string>
#include <utility>
#include <vector>

#include "host_ops.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {

// One entry per host operation, named after the exported function.
enum class HostOp {
  kShareGet,
  kShareGetByAttrStr,
  kShareUpdate,
  kShareFree,
  kGetFSType,
  kFSIsRemoteFS,
  kFSIsImageFS,
  kEADirPath,
  kEAMKDir,
  kEAIsHiddenDir,
  kSystemGetBootStep,
  kErrGet,
  kErrorGetFile,
  kErrorGetLine,
  kFileGetLine,
  kFileGetSectionValue,
  kFileStat,
  kReadPidFile,
  kProcAliveByPidFile,
  kCodePageGet,
  kUnicodeStrUTF16ToUTF8,
  kUnicodeStrCPToUTF8,
  kUnicodeUTF8StrCountChar,
  kUnicodeUTF8ForwardNChar,
  kCount
};

class FakeHost {
 public:
  // Installs the fake: every operation passes through, counted.
  FakeHost();
  // Restores the operations that were installed before.
  ~FakeHost();
  FakeHost(const FakeHost&) = delete;
  FakeHost& operator=(const FakeHost&) = delete;

  // Every later call of `op` fails with error `code`, returning `result`.
  void Fail(HostOp op, int code = EIO, int result = -1);
  // Only the n-th call of `op` from now on (n >= 1) fails; the others pass.
  void FailNth(HostOp op, int n, int code = EIO, int result = -1);
  // Operations with an int result: the k-th later call returns results[k],
  // the last value repeating, and does nothing else. For operations with
  // outputs use the typed answers below.
  void Answer(HostOp op, std::initializer_list<int> results);
  // Removes any failure or answer of `op` (in-memory shares stay).
  void Pass(HostOp op);

  // Typed answers: each later call succeeds with this output.
  // QUVAEADirPath: copies `path` (ERANGE failure when it does not fit).
  void AnswerEADirPath(const std::string& path);
  // QLIBCCodePageGet: 0 with *code_page set.
  void AnswerCodePage(int code_page);
  // QLIBCFileStat: 0 with *record set.
  void AnswerFileStat(const QLIBCFileStatRecord& record);
  // QLIBCFileGetLine: 1 with `line` copied (ERANGE when it does not fit).
  void AnswerFileLine(const std::string& line);
  // QLIBCFileGetSectionValue: the value's length with it copied.
  void AnswerSectionValue(const std::string& value);
  // QLIBCUnicodeStrUTF16ToUTF8 / QLIBCUnicodeStrCPToUTF8 (`op`): `utf8`
  // copied, cut to the output size.
  void AnswerConversion(HostOp op, const std::string& utf8);

  // In-memory share database. The first AddShare replaces the share file
  // for QUVAShareGet, QUVAShareGetByAttrStr (same path rules as the file)
  // and QUVAShareUpdate, which then records each update and stores it.
  void AddShare(const std::string& name, const std::string& path,
                unsigned status);
  // Status flags of an in-memory share now; 0 when there is none.
  unsigned ShareStatus(const std::string& name) const;
  // Every successful QUVAShareUpdate on the in-memory shares, in order.
  const std::vector<std::pair<std::string, unsigned>>& ShareUpdates() const;
  // Records handed out by the share lookups and not yet given to
  // QUVAShareFree: non-zero after a test means the caller leaked one.
  int OutstandingShareRecords() const;

  // Calls of `op` since the fake was installed.
  int Calls(HostOp op) const;

  // Puts `code`, `file` (static text) and `line` in the calling thread's
  // error stack, as a host failure would.
  static void SetLastError(int code, const char* file, int line);

 private:
  HostOps previous_;
};

}  // namespace quvahost::test

#endif  // QUVAIDX_TESTS_SUPPORT_FAKE_HOST_H_
