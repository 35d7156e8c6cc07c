#include "cli.h"

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>

#include <exception>
#include <memory>
#include <sstream>

#include "json_text.h"
#include "quvaidx/ipc.h"
#include "quvaidx/log.h"
#include "quvaidx/paths.h"
#include "quvaidx/version.h"

namespace quvaidx_cli {

namespace {

// openlog keeps the pointer, so the ident must live as long as the process.
constexpr char kLogIdent[] = "quvaidx";
// Longest JSON value read from standard input; a packet carries far less.
constexpr size_t kMaxJsonInput = 1 << 20;
// Longest list of operands read from standard input.
constexpr size_t kMaxListInput = 64 << 20;

// Turns the reader's report ("* Line 1, Column 2\n  Message\n", possibly
// followed by more errors) into one line about the first error
// ("Line 1, Column 2: Message").
std::string FirstError(const std::string& report) {
  std::istringstream lines(report);
  std::string line, result;
  while (std::getline(lines, line)) {
    size_t start = line.find_first_not_of(" \t");
    if (start == std::string::npos) continue;
    line = line.substr(start);
    if (line.compare(0, 2, "* ") == 0) {
      if (!result.empty()) break;  // the next error starts
      line = line.substr(2);
    }
    if (!result.empty()) result += ": ";
    result += line;
  }
  return result.empty() ? "unknown error" : result;
}

// Reads all of standard input into *text, at most `limit` bytes. On failure
// prints one line naming `what` and returns false.
bool ReadStandardInput(const char* command, const char* what, size_t limit,
                       std::string* text) {
  char buffer[65536];
  for (;;) {
    size_t n = fread(buffer, 1, sizeof(buffer), stdin);
    text->append(buffer, n);
    if (text->size() > limit) {
      PrintError(command, std::string("the ") + what +
                              " on standard input is longer than " +
                              std::to_string(limit) + " bytes");
      return false;
    }
    if (n < sizeof(buffer)) break;
  }
  if (ferror(stdin)) {
    PrintError(command,
               std::string("cannot read standard input: ") + strerror(errno));
    return false;
  }
  return true;
}

// Appends the pieces of `text` separated by `separator`, empty ones left
// out, to *out.
void SplitInto(const std::string& text, char separator,
               std::vector<std::string>* out) {
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find(separator, start);
    if (end == std::string::npos) end = text.size();
    if (end > start) out->push_back(text.substr(start, end - start));
    start = end + 1;
  }
}

}  // namespace

bool IsDaemonName(const std::string& name) {
  for (const quvaidx::IndexDaemonPaths& known : quvaidx::kIndexDaemons) {
    if (name == known.name) return true;
  }
  return false;
}

std::string DaemonNameList() {
  std::string list;
  for (const quvaidx::IndexDaemonPaths& known : quvaidx::kIndexDaemons) {
    if (!list.empty()) list += ", ";
    list += known.name;
  }
  return list;
}

bool ReadJsonObject(const char* command, const std::string& text,
                    const JsonInput& input, Json::Value* out) {
  const char* what = input.what;
  std::string read;
  if (text == "-" && !ReadStandardInput(command, what, kMaxJsonInput, &read)) {
    return false;
  }
  const std::string& json = text == "-" ? read : text;
  // Any value is read, so that one that is not an object gets its own
  // message below.
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder["strictRoot"] = false;
  std::string errors;
  bool ok = false;
  try {
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    ok = reader->parse(json.data(), json.data() + json.size(), out, &errors);
  } catch (const std::exception& e) {
    errors = e.what();
  }
  if (!ok) {
    PrintError(command,
               std::string("invalid JSON ") + what + ": " + FirstError(errors));
    return false;
  }
  if (!out->isObject()) {
    PrintError(command, std::string("the ") + what +
                            " must be a JSON object, such as '" +
                            input.example + "'");
    return false;
  }
  size_t size = Json::FastWriter().write(*out).size();
  if (size > input.max_size) {
    PrintError(command, std::string("the ") + what + " is " +
                            std::to_string(size) + " bytes long; " +
                            input.carrier + " carries at most " +
                            std::to_string(input.max_size));
    return false;
  }
  return true;
}

void PrintJson(const Json::Value& value, bool compact) {
  fprintf(stdout, "%s\n", FormatJson(value, compact).c_str());
  fflush(stdout);
}

void PrintError(const char* command, const std::string& message) {
  quvaidx_tools::PrintError(std::string("quvaidx ") + command, message);
}

int UsageError(const char* command, const std::string& message) {
  return quvaidx_tools::UsageError(std::string("quvaidx ") + command, message);
}

quvaidx_tools::CommandLine Subcommand(
    const char* name, std::vector<std::string> usage, std::string description,
    std::vector<quvaidx_tools::Option> options, std::string epilog) {
  quvaidx_tools::CommandLine line;
  line.program = std::string("quvaidx ") + name;
  line.usage = std::move(usage);
  line.description = std::move(description);
  line.options = std::move(options);
  line.options.push_back({"verbose", 'v', nullptr,
                          "also show the library's log lines on stderr",
                          [](const char*) {
                            EnableVerboseLogging();
                            return std::string();
                          }});
  line.epilog = std::move(epilog);
  line.version = std::string("quvaidx ") + QuvaidxVersion();
  return line;
}

int ParseCommand(const quvaidx_tools::CommandLine& line,
                 const OperandRule& rule, int argc, char** argv,
                 std::vector<std::string>* operands) {
  int first = 0;
  int status = quvaidx_tools::ParseCommandLine(line, argc, argv, &first);
  if (status != kContinue) return status;
  const char* command = line.program.c_str() + strlen("quvaidx ");
  operands->clear();
  bool read_input = false;
  for (int i = first; i < argc; ++i) {
    if (rule.null_list == nullptr || strcmp(argv[i], "-") != 0) {
      operands->push_back(argv[i]);
      continue;
    }
    if (read_input) {
      return UsageError(command, "standard input is read once: give '-' once");
    }
    read_input = true;
    std::string text;
    if (!ReadStandardInput(command, "list", kMaxListInput, &text)) {
      return kExitError;
    }
    SplitInto(text, *rule.null_list ? '\0' : '\n', operands);
  }
  const int count = static_cast<int>(operands->size());
  if (count < rule.min) {
    return UsageError(command, std::string("missing ") + rule.name);
  }
  if (rule.max >= 0 && count > rule.max) {
    return UsageError(command, "unexpected argument '" +
                                   (*operands)[static_cast<size_t>(rule.max)] +
                                   "'");
  }
  return kContinue;
}

quvaidx_tools::Option NullOption(bool* null_list) {
  return quvaidx_tools::Flag(
      "null", '0', null_list,
      "with '-': the names on standard input end with\na NUL byte instead "
      "of a line feed (find -print0),\nfor names holding a line feed");
}

quvaidx_tools::Option JsonOption(bool* json, std::string help) {
  return quvaidx_tools::Flag("json", 'j', json, std::move(help));
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

bool ResolvePath(const char* command, const std::string& path,
                 std::string* resolved) {
  char* real = realpath(path.c_str(), nullptr);
  if (real == nullptr) {
    PrintError(command, path + ": " + strerror(errno));
    return false;
  }
  *resolved = real;
  free(real);
  return true;
}

void InitLogging() { openlog(kLogIdent, 0, LOG_USER); }

void EnableVerboseLogging() {
  openlog(kLogIdent, LOG_PERROR, LOG_USER);
  ChageLogLevel(7);
}

}  // namespace quvaidx_cli
