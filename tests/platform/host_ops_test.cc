// The dispatch table's seam: what SetHostOps installs and restores.
#include "host_ops.h"

#include <gtest/gtest.h>

namespace quvahost {
namespace {

int FixedErrorCode() { return 4242; }

// A table with null entries must not leave a null pointer for an exported
// function to call, and null must bring the stand-in back.
TEST(HostOpsTest, NullEntriesAndNullTableRestoreTheStandIn) {
  HostOps mine{};
  mine.ErrGet = FixedErrorCode;
  HostOps before = SetHostOps(&mine);
  EXPECT_EQ(QLIBCErrGet(), 4242);
  EXPECT_EQ(QLIBCUnicodeUTF8StrCountChar("ab"), 2);  // null: the stand-in's
  HostOps replaced = SetHostOps(nullptr);
  EXPECT_EQ(replaced.ErrGet, &FixedErrorCode);
  EXPECT_EQ(replaced.UnicodeUTF8StrCountChar, before.UnicodeUTF8StrCountChar);
  HostOps restored = SetHostOps(&before);
  EXPECT_EQ(restored.ErrGet, before.ErrGet);
}

}  // namespace
}  // namespace quvahost
