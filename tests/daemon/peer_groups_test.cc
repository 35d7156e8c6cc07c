// The peer's groups from its status text, where the connection records none.
#include "daemon/peer_groups.h"

#include <unistd.h>

#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "support/fd_check.h"
#include "support/log_capture.h"

namespace quvaidx::test {
namespace {

const std::string kIds =
    "Name:\tsh\nUid:\t1000\t1001\t1002\t1003\nGid:\t100\t101\t102\t103\n";

// Texts whose groups are read, and texts that must be refused rather than
// read in part.
TEST(PeerGroupsTest, StatusTextsGiveTheirGroupsOrNone) {
  const std::vector<gid_t> none;
  const std::tuple<std::string, bool, std::vector<gid_t>> cases[] = {
      {kIds + "FDSize:\t64\nGroups:\t4 27 4294967294 \nNSpid:\t9\n",
       true,
       {4, 27, 4294967294u}},
      {kIds + "Groups:\t\n", true, none},
      {"Groups:\t5\n" + kIds, true, {5}},     // any order
      {kIds + "Groups:\t5 6", true, {5, 6}},  // the text's end ends the line
      {kIds + "Groups:\t5\nGroups:\t6\n", true, {5}},  // the first counts
      {kIds, false, none},                             // no groups line
      {kIds + "Groups:\t4294967295\n", false, none},   // (gid_t)-1 is none
      {kIds + "Groups:\t99999999999\n", false, none},  // overflows
      {kIds + "Groups:\t5 6x\n", false, none},
      {kIds + "Groups:\t-5\n", false, none},
      {kIds + " Groups:\t5\n", false, none},  // not at a line's start
      {"Uid:\t1 2 3\nGid:\t1 2 3 4\nGroups:\t\n", false, none},
      {"Uid:\t1 2 3 4 5\nGid:\t1 2 3 4\nGroups:\t\n", false, none},
      {std::string("Uid:\t1 2 3 4\0\nGid:\t1 2 3 4\nGroups:\t\n", 36), false,
       none},  // a zero byte in a line
      {"", false, none},
  };
  for (const auto& [text, parsed, groups] : cases) {
    StatusIds ids;
    EXPECT_EQ(ParseStatusIds(text.data(), text.size(), &ids), parsed) << text;
    if (!parsed) continue;
    EXPECT_EQ(ids.groups, groups) << text;
    EXPECT_EQ(ids.uid[1], 1001u);
    EXPECT_EQ(ids.gid[1], 101u);
  }
  // Nothing past the length is read: the groups line is cut at "5".
  const std::string cut = kIds + "Groups:\t5 6\n";
  StatusIds ids;
  ASSERT_TRUE(ParseStatusIds(cut.data(), cut.size() - 3, &ids));
  EXPECT_EQ(ids.groups, std::vector<gid_t>{5});
}

// The text counts only while its process has the peer's effective ids (a
// reused pid is logged); a missing or oversized text gives nothing either.
TEST(PeerGroupsTest, StatusOfAnotherIdentityIsRefused) {
  TempDir dir;
  const std::string status = dir.File("status");
  WriteFile(status, kIds + "Groups:\t7 8\n");
  std::vector<gid_t> groups = {99};
  LogCapture log;
  struct ucred same = {42, 1001, 101};
  EXPECT_TRUE(StatusFileGroups(status.c_str(), same, &groups));
  EXPECT_EQ(groups, (std::vector<gid_t>{7, 8}));
  groups = {99};
  for (const struct ucred& other :
       {ucred{42, 1000, 101}, ucred{42, 1001, 100}}) {
    EXPECT_FALSE(StatusFileGroups(status.c_str(), other, &groups));
  }
  EXPECT_FALSE(StatusFileGroups(dir.File("gone").c_str(), same, &groups));
  WriteFile(status,
            kIds + "Groups:\t7 8\n" + std::string(kMaxStatusBytes, ' '));
  EXPECT_FALSE(StatusFileGroups(status.c_str(), same, &groups));
  EXPECT_EQ(groups, std::vector<gid_t>{99});
  EXPECT_EQ(log.lines().size(), 4u);
  // This process's own status, as the fallback reads it.
  std::vector<gid_t> mine(static_cast<size_t>(getgroups(0, nullptr)));
  getgroups(static_cast<int>(mine.size()), mine.data());
  struct ucred self = {getpid(), geteuid(), getegid()};
  EXPECT_TRUE(StatusFileGroups("/proc/self/status", self, &groups));
  EXPECT_EQ(groups, mine);
}

}  // namespace
}  // namespace quvaidx::test
