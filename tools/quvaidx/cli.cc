#include "cli.h"

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <syslog.h>

#include <exception>
#include <memory>
#include <sstream>

#include "json_text.h"
#include "quvaidx/ipc.h"
#include "quvaidx/log.h"
#include "quvaidx/paths.h"

namespace quvaidx_cli {

namespace {

// openlog keeps the pointer, so the ident must live as long as the process.
constexpr char kLogIdent[] = "quvaidx";

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

bool ParseJsonObject(const char* command, const std::string& text,
                     const char* what, const char* example, Json::Value* out) {
  // Any value is read, so that one that is not an object gets its own
  // message below.
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder["strictRoot"] = false;
  std::string errors;
  bool ok = false;
  try {
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    ok = reader->parse(text.data(), text.data() + text.size(), out, &errors);
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
                            " must be a JSON object, such as '" + example +
                            "'");
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
  return line;
}

int ParseArguments(const quvaidx_tools::CommandLine& line, int argc,
                   char** argv, int* first_operand) {
  return quvaidx_tools::ParseCommandLine(line, argc, argv, first_operand);
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
