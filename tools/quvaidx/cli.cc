#include "cli.h"

#include <errno.h>
#include <getopt.h>
#include <stdio.h>
#include <stdlib.h>
#include <syslog.h>

#include "quvaidx/ipc.h"
#include "quvaidx/log.h"

namespace quvaidx_cli {

namespace {

// openlog keeps the pointer, so the ident must live as long as the process.
constexpr char kLogIdent[] = "quvaidx";

}  // namespace

void PrintError(const char* command, const std::string& message) {
  fprintf(stderr, "quvaidx %s: %s\n", command, message.c_str());
}

int UsageError(const char* command, const std::string& message) {
  PrintError(command, message);
  fprintf(stderr, "Try 'quvaidx %s --help'.\n", command);
  return kExitError;
}

int OptionError(const char* command, int result, char** argv) {
  // getopt_long has already advanced optind past the offending argument.
  std::string text = optind > 0 ? argv[optind - 1] : "";
  bool is_long = text.compare(0, 2, "--") == 0;
  if (!is_long && optopt > 0 && optopt < 128)
    text = std::string("-") + static_cast<char>(optopt);
  if (result == ':') {
    return UsageError(command, "option '" + text + "' needs a value");
  }
  return UsageError(command, "unrecognised option '" + text + "'");
}

bool ParseInt(const char* text, int min, int max, int* out) {
  if (text == nullptr || *text == '\0') return false;
  errno = 0;
  char* end = nullptr;
  long value = strtol(text, &end, 10);
  if (errno != 0 || *end != '\0' || value < min || value > max) return false;
  *out = static_cast<int>(value);
  return true;
}

bool CheckSocketPath(const char* command, const std::string& path) {
  if (path.empty()) {
    UsageError(command, "--socket PATH is required");
    return false;
  }
  if (path.size() > kMaxSocketPath) {
    PrintError(command, "socket path is " + std::to_string(path.size()) +
                            " bytes long; a Unix-domain socket path holds at "
                            "most " +
                            std::to_string(kMaxSocketPath));
    return false;
  }
  return true;
}

void InitLogging() { openlog(kLogIdent, 0, LOG_USER); }

void EnableVerboseLogging() {
  openlog(kLogIdent, LOG_PERROR, LOG_USER);
  ChageLogLevel(7);
}

}  // namespace quvaidx_cli
