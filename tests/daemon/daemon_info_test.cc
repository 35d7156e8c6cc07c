#include "quvaidx/daemon_info.h"

#include <gtest/gtest.h>

namespace {

// Each field of a known daemon by either overload; any other name or field,
// spelled in any other way, is empty.
TEST(DaemonInfoTest, KnownEntriesOnly) {
  DaemonInfo info;
  EXPECT_EQ(info.get("plugind", "sock"), "/tmp/quvaindexplugind_sock");
  EXPECT_EQ(info.get("mediad", "pid"), "/var/run/quvamediaparserd.pid");
  EXPECT_EQ(info.get(std::string("controld"), "bin"),
            "/usr/quva/sbin/quvaindexd");
  for (const char* field : {"PID", "socket", "", "sock ", "bin"}) {
    EXPECT_EQ(info.get("Mediad", field), "") << field;
    EXPECT_EQ(info.get(std::string("indexd"), field), "") << field;
  }
}

}  // namespace
