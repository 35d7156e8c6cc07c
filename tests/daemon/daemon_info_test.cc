#include "quvaidx/daemon_info.h"

#include <gtest/gtest.h>

namespace {

TEST(DaemonInfoTest, TableEntries) {
  DaemonInfo info;
  EXPECT_EQ(info.get("plugind", "sock"), "/tmp/quvaindexplugind_sock");
  EXPECT_EQ(info.get("mediad", "pid"), "/var/run/quvamediaparserd.pid");
  EXPECT_EQ(info.get("controld", "bin"), "/usr/quva/sbin/quvaindexd");
  EXPECT_EQ(info.get("scand", "sock"), "/tmp/quvaindexscand_sock");
  EXPECT_EQ(info.get("workerd", "pid"), "/var/run/quvaindexworkerd.pid");
}

TEST(DaemonInfoTest, UnknownNamesAndFieldsAreEmpty) {
  DaemonInfo info;
  for (const char* field : {"pid", "bin", "sock"}) {
    EXPECT_EQ(info.get("indexd", field), "");
    EXPECT_EQ(info.get("indexd", field), "");  // still empty the second time
    EXPECT_EQ(info.get("Mediad", field), "");  // names are case-sensitive
  }
  for (const char* field : {"PID", "socket", "exe", "", "sock "}) {
    EXPECT_EQ(info.get("mediad", field), "") << field;
  }
}

TEST(DaemonInfoTest, BothOverloadsAgree) {
  DaemonInfo info;
  for (const char* name :
       {"controld", "scand", "workerd", "plugind", "mediad", "nobody"}) {
    for (const char* field : {"pid", "bin", "sock", "x"}) {
      EXPECT_EQ(info.get(std::string(name), field), info.get(name, field));
    }
  }
}

}  // namespace
