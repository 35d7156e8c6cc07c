// A fault and answer layer over the host operations (quvahost.h), and a
// host directory for the stand-in.
//
// While a FakeHost lives, each host operation is counted, then failed or
// answered as told, or else passed on to the stand-in (the real files under
// $QUVA_HOST_ETC); the destructor restores the previous operations. A failed
// call returns -1 (or the result given to Fail; null for pointer results),
// nulls *record for share lookups (unless HandOutRecordsOnFailure), and
// leaves the code in errno and in the thread's error stack with file
// "fake_host.cc". One FakeHost at a time;
// configure it while no other thread calls the host.
#ifndef QUVAIDX_TESTS_SUPPORT_FAKE_HOST_H_
#define QUVAIDX_TESTS_SUPPORT_FAKE_HOST_H_

#include <errno.h>
#include <stdlib.h>

#include <initializer_list>
#include <string>

#include "host_ops.h"
#include "quvahost/quvahost.h"
#include "support/fd_check.h"

namespace quvahost::test {

// One per host operation, named as in QUVAHOST_OPS (host_ops.h).
// clang-format off
enum class HostOp {
#define QUVAHOST_FAKE_OP(prefix, name, result, params, args) k##name,
  QUVAHOST_OPS(QUVAHOST_FAKE_OP)
#undef QUVAHOST_FAKE_OP
  kCount
};
// clang-format on

class FakeHost {
 public:
  FakeHost();
  ~FakeHost();
  FakeHost(const FakeHost&) = delete;
  FakeHost& operator=(const FakeHost&) = delete;

  // Every later call of `op` fails with `code`, returning `result`.
  void Fail(HostOp op, int code = EIO, int result = -1);
  // Int operations: the k-th later call returns results[k] and does nothing
  // else; the last value repeats.
  void Answer(HostOp op, std::initializer_list<int> results);
  // Drops the failure and int answers of `op` (typed answers stay).
  void Pass(HostOp op);

  // Typed answers: every later call succeeds with this output; a text that
  // does not fit the caller's buffer fails with ERANGE, except conversions
  // (kUnicodeStrUTF16ToUTF8, kUnicodeStrCPToUTF8), cut on a character.
  void AnswerFileStat(const QLIBCFileStatRecord& record);
  void AnswerSectionValue(const std::string& value);
  void AnswerConversion(HostOp op, const std::string& utf8);

  // From now on a failing share lookup still hands out a blank record in
  // *record, as a host may: callers must release *record after a failed
  // lookup too.
  void HandOutRecordsOnFailure();
  // Records handed out by share lookups since installation, not freed.
  int OutstandingShareRecords() const;
  int Calls(HostOp op) const;  // calls of `op` since installation

 private:
  HostOps previous_;
};

using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

// A fresh host directory: $QUVA_HOST_ETC names it while it lives.
class HostEtc : public TempDir {
 public:
  HostEtc() {
    if (const char* old = getenv(QUVA_HOST_ETC_ENV)) old_ = old;
    setenv(QUVA_HOST_ETC_ENV, path().c_str(), 1);
  }
  ~HostEtc() {
    if (old_.empty()) {
      unsetenv(QUVA_HOST_ETC_ENV);
    } else {
      setenv(QUVA_HOST_ETC_ENV, old_.c_str(), 1);
    }
  }

 private:
  std::string old_;
};

}  // namespace quvahost::test

#endif  // QUVAIDX_TESTS_SUPPORT_FAKE_HOST_H_
