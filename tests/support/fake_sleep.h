// Replaces the library's sleeps with a counter, for the lifetime of the
// object, so attempt loops run at full speed.
#ifndef QUVAIDX_TESTS_SUPPORT_FAKE_SLEEP_H_
#define QUVAIDX_TESTS_SUPPORT_FAKE_SLEEP_H_

#include "util/hooks.h"

namespace quvaidx::test {

class FakeSleep {
 public:
  FakeSleep();
  ~FakeSleep();

  FakeSleep(const FakeSleep&) = delete;
  FakeSleep& operator=(const FakeSleep&) = delete;

  // Number of sleeps of one second or more, and their total in seconds.
  int calls() const;
  unsigned total_seconds() const;
  // Number of sleep(0) calls: the yields of the retry loops.
  int yields() const;

 private:
  SleepFunction previous_;
};

}  // namespace quvaidx::test

#endif  // QUVAIDX_TESTS_SUPPORT_FAKE_SLEEP_H_
