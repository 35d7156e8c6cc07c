#include "support/fake_sleep.h"

namespace quvaidx::test {
namespace {

int g_calls = 0;
int g_yields = 0;
unsigned g_total = 0;

unsigned CountingSleep(unsigned seconds) {
  g_calls += seconds > 0;
  g_yields += seconds == 0;
  g_total += seconds;
  return 0;
}

}  // namespace

FakeSleep::FakeSleep() : previous_(SetSleepFunction(CountingSleep)) {
  g_calls = 0;
  g_yields = 0;
  g_total = 0;
}

FakeSleep::~FakeSleep() { SetSleepFunction(previous_); }

int FakeSleep::calls() const { return g_calls; }
unsigned FakeSleep::total_seconds() const { return g_total; }
int FakeSleep::yields() const { return g_yields; }

}  // namespace quvaidx::test
