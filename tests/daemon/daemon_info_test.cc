#include "quvaidx/daemon_info.h"

#include <gtest/gtest.h>

namespace {

TEST(DaemonInfoTest, KnownEntriesOnlyAndBothOverloadsAgree) {
  DaemonInfo info;
  EXPECT_EQ(info.get("plugind", "sock"), "/tmp/quvaindexplugind_sock");
  EXPECT_EQ(info.get("mediad", "pid"), "/var/run/quvamediaparserd.pid");
  EXPECT_EQ(info.get(std::string("controld"), "bin"),
            "/usr/quva/sbin/quvaindexd");
  for (const char* name : {"indexd", "Mediad", "mediad", "scand"}) {
    for (const char* field : {"PID", "socket", "", "sock "}) {
      EXPECT_EQ(info.get(name, field), "") << name << "." << field;
      EXPECT_EQ(info.get(std::string(name), field), "");
    }
  }
  EXPECT_EQ(info.get("indexd", "pid"), "");
  EXPECT_EQ(info.get("Mediad", "pid"), "");  // names are case-sensitive
}

}  // namespace
