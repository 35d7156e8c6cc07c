// Helpers of the media parser's tests: the fixtures, the host's code page,
// the oracles' output, UTF-8 checks.
#ifndef QUVAIDX_TESTS_MEDIAPARSERD_MEDIA_TEST_UTIL_H_
#define QUVAIDX_TESTS_MEDIAPARSERD_MEDIA_TEST_UTIL_H_

#include <stdio.h>
#include <stdlib.h>

#include <string>

#include <json/json.h>
#include <unicode/utf8.h>

#include "support/fd_check.h"

namespace mediaparserd::test {

// The fixture `name` made by make_fixtures.sh; the directory comes from
// $MEDIA_FIXTURES, which CTest sets.
inline std::string Fixture(const std::string& name) {
  const char* dir = getenv("MEDIA_FIXTURES");
  return std::string(dir != nullptr ? dir : "MEDIA_FIXTURES-unset") + "/" +
         name;
}

// A private host settings directory with `code_page` in host.conf, in force
// ($QUVA_HOST_ETC) while the object lives. An empty code page writes no
// host.conf (the host then reports none).
class HostCodePage {
 public:
  explicit HostCodePage(const std::string& code_page) {
    if (!code_page.empty()) {
      quvaidx::test::WriteFile(dir_.File("host.conf"),
                               "[system]\ncode_page = " + code_page + "\n");
    }
    setenv("QUVA_HOST_ETC", dir_.path().c_str(), 1);
  }
  ~HostCodePage() { unsetenv("QUVA_HOST_ETC"); }

 private:
  quvaidx::test::TempDir dir_;
};

// What a shell command prints on stdout ("" when it cannot run).
inline std::string CommandOutput(const std::string& command) {
  std::string out;
  FILE* pipe = popen(command.c_str(), "r");
  if (pipe == nullptr) return out;
  char buffer[4096];
  size_t n;
  while ((n = fread(buffer, 1, sizeof(buffer), pipe)) > 0)
    out.append(buffer, n);
  pclose(pipe);
  return out;
}

inline std::string Quoted(const std::string& text) {
  std::string quoted = "'";
  for (char c : text)
    quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return quoted + "'";
}

// The JSON a command prints (null when it prints none).
inline Json::Value CommandJson(const std::string& command) {
  Json::Value value;
  Json::Reader().parse(CommandOutput(command), value, false);
  return value;
}

// Strict UTF-8 (no overlong forms, surrogates or values above U+10FFFF),
// judged by ICU's decoder rather than the daemon's own check.
inline bool IsValidUTF8(const std::string& text) {
  const int32_t length = static_cast<int32_t>(text.size());
  int32_t i = 0;
  while (i < length) {
    UChar32 c;
    U8_NEXT(text.data(), i, length, c);
    if (c < 0) return false;
  }
  return true;
}

}  // namespace mediaparserd::test

#endif  // QUVAIDX_TESTS_MEDIAPARSERD_MEDIA_TEST_UTIL_H_
