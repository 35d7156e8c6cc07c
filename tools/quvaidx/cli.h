// Helpers shared by the subcommands of the quvaidx tool: the command table
// entry, exit statuses, error reporting, option checks and logging set-up.
#ifndef QUVAIDX_TOOLS_CLI_H_
#define QUVAIDX_TOOLS_CLI_H_

#include <initializer_list>
#include <string>
#include <vector>

#include <json/json.h>

namespace quvaidx_cli {

// Exit statuses shared by every subcommand.
constexpr int kExitOk = 0;     // the work was done; a reply said success
constexpr int kExitFalse = 1;  // a daemon answered without success
constexpr int kExitError = 2;  // usage error, bad input or failed exchange

// One subcommand. `run` receives the arguments that follow the tool's own
// options, argv[0] being the subcommand's name, and returns the exit status.
struct Command {
  const char* name;
  const char* summary;
  int (*run)(int argc, char** argv);
};

// Prints "quvaidx COMMAND: MESSAGE" as one line on stderr.
void PrintError(const char* command, const std::string& message);

// Prints the error line followed by a hint to run COMMAND --help, and
// returns kExitError.
int UsageError(const char* command, const std::string& message);

// Reports the getopt_long result `result` ('?' or ':') for the option just
// read from argv as a usage error; returns kExitError. Call with opterr 0
// and an option string that starts with ':'.
int OptionError(const char* command, int result, char** argv);

// A boolean flag of a subcommand: --name or -letter sets *value.
struct Flag {
  const char* name;
  char letter;
  bool* value;
};

// ParseFlags's result when the command goes on with its operands.
constexpr int kContinue = -1;

// Parses `flags` plus --verbose/-v and --help/-h (getopt rules; optind is
// left at the first operand). Returns kContinue, or the exit status to
// return at once: kExitOk after printing the help, kExitError on an unknown
// option.
int ParseFlags(int argc, char** argv, const char* command,
               std::initializer_list<Flag> flags, void (*print_help)());

// Parses a whole decimal number within [min, max]; false for anything else
// (empty text, signs outside the range, trailing characters, overflow).
bool ParseInt(const char* text, int min, int max, int* out);

// Checks that `path` can name a Unix-domain socket: not empty and at most
// the library's limit in bytes. Prints one error line and returns false
// otherwise.
bool CheckSocketPath(const char* command, const std::string& path);

// True when `name` is the short name of an index daemon (kIndexDaemons of
// quvaidx/paths.h).
bool IsDaemonName(const std::string& name);

// "controld, scand, workerd, plugind, mediad", for error messages.
std::string DaemonNameList();

// Parses `text` as standard JSON (no comments, trailing commas, duplicate
// keys or trailing text) holding an object. On failure prints one line,
// "invalid JSON WHAT: <first error>" or "the WHAT must be a JSON object,
// such as EXAMPLE", and returns false. Deep nesting counts as a syntax
// error, never as a crash.
bool ParseJsonObject(const char* command, const std::string& text,
                     const char* what, const char* example, Json::Value* out);

// Writes `value` and a line feed to stdout, indented by two spaces or, with
// `compact`, on one line; flushes.
void PrintJson(const Json::Value& value, bool compact);

// Opens the system log under the tool's name. Library log lines go there
// only, never to the terminal, until EnableVerboseLogging is called.
void InitLogging();

// Copies every library log line to stderr as well, and lets progress and
// debug lines through (threshold 7). Safe to call more than once.
void EnableVerboseLogging();

}  // namespace quvaidx_cli

#endif  // QUVAIDX_TOOLS_CLI_H_
