// Feeds quvaidx::ParseStatusIds (the "Uid:", "Gid:" and "Groups:" lines of
// /proc/PID/status, read for a peer's groups where its connection records
// none) arbitrary text.
//
// Input: the first byte chooses how the rest is read. Even: the rest is the
// text, byte for byte. Odd: the bytes 0x01, 0x02 and 0x03 of the rest stand
// for "Uid:", "Gid:" and "Groups:", so that the fuzzer reaches the labels
// without a dictionary. The parser gets a heap copy of exactly the text's
// length, so a read past the end is caught by AddressSanitizer.
//
// Checked against a model written from the parser's contract: lines end at
// '\n'; the first line starting with each label counts; after the label
// come ids separated by blanks (space, tab), each all digits and at most
// 4294967294; "Uid:" and "Gid:" have exactly four, "Groups:" at most
// kMaxPeerGroups. The result is true exactly when all three lines are there
// and well formed, and then the ids must be the model's. A mismatch aborts
// with a message.
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <string.h>

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "daemon/peer_groups.h"
#include "fuzz_report.h"

namespace {

[[noreturn]] void Fail(const char* what, std::string_view input) {
  FuzzFail("fuzz_peer_groups", what, input);
}

std::string Decode(const uint8_t* data, size_t size) {
  if (size == 0) return "";
  std::string text;
  const bool expand = (data[0] & 1) != 0;
  for (size_t i = 1; i < size; ++i) {
    char c = static_cast<char>(data[i]);
    if (expand && c == 0x01) {
      text += "Uid:";
    } else if (expand && c == 0x02) {
      text += "Gid:";
    } else if (expand && c == 0x03) {
      text += "Groups:";
    } else {
      text += c;
    }
  }
  return text;
}

// The ids after `label` on the first line that starts with it: absent,
// malformed, or read.
enum class Line { kAbsent, kBad, kRead };

Line ModelIds(const std::string& text, const std::string& label,
              std::vector<unsigned long long>* ids) {
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) end = text.size();
    const std::string line = text.substr(start, end - start);
    start = end + 1;
    if (line.compare(0, label.size(), label) != 0) continue;
    std::string token;
    const std::string rest = line.substr(label.size()) + " ";
    for (char c : rest) {
      if (c != ' ' && c != '\t') {
        token += c;
        continue;
      }
      if (token.empty()) continue;
      if (token.find_first_not_of("0123456789") != std::string::npos) {
        return Line::kBad;
      }
      const size_t digits = token.find_first_not_of('0');
      if (digits != std::string::npos && token.size() - digits > 10) {
        return Line::kBad;  // leading zeros aside, too long for an id
      }
      const unsigned long long value =
          digits == std::string::npos ? 0 : std::stoull(token.substr(digits));
      if (value > 4294967294ull) return Line::kBad;
      ids->push_back(value);
      token.clear();
    }
    return Line::kRead;
  }
  return Line::kAbsent;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > 256 * 1024) return 0;
  const std::string text = Decode(data, size);
  std::unique_ptr<char[]> copy(new char[text.size() + 1]);
  memcpy(copy.get(), text.data(), text.size());

  std::vector<unsigned long long> uid, gid, groups;
  const Line uid_line = ModelIds(text, "Uid:", &uid);
  const Line gid_line = ModelIds(text, "Gid:", &gid);
  const Line groups_line = ModelIds(text, "Groups:", &groups);
  const bool want = uid_line == Line::kRead && uid.size() == 4 &&
                    gid_line == Line::kRead && gid.size() == 4 &&
                    groups_line == Line::kRead &&
                    groups.size() <= quvaidx::kMaxPeerGroups;

  quvaidx::StatusIds ids;
  const bool parsed = quvaidx::ParseStatusIds(copy.get(), text.size(), &ids);
  if (parsed != want) {
    fprintf(stderr, "ParseStatusIds %d, model %d\n", parsed, want);
    Fail("wrong result", text);
  }
  if (!parsed) return 0;
  for (int i = 0; i < 4; ++i) {
    if (ids.uid[i] != uid[i] || ids.gid[i] != gid[i]) {
      Fail("wrong user or group ids", text);
    }
  }
  if (ids.groups.size() != groups.size()) Fail("wrong number of groups", text);
  for (size_t i = 0; i < groups.size(); ++i) {
    if (ids.groups[i] != groups[i]) Fail("wrong group", text);
  }
  return 0;
}
