// Helpers shared by the subcommands of the quvaidx tool: the command table
// entry, exit statuses, parsing a command line with its operands, error
// reporting, JSON input and output, and logging set-up.
//
// Short options mean one thing across the tool: -v verbose, -h help,
// -V version, -j JSON output, -s socket, -d daemon name, -a attempts,
// -t timeout, -c compact, -p pid file, -q queue, -n no wait, -l list,
// -r raw, -0 NUL-separated input. An option without one of these meanings
// has no letter.
#ifndef QUVAIDX_TOOLS_CLI_H_
#define QUVAIDX_TOOLS_CLI_H_

#include <string>
#include <vector>

#include <json/json.h>

#include "options.h"

namespace quvaidx_cli {

using quvaidx_tools::kContinue;
using quvaidx_tools::kExitError;  // usage error, bad input or failed exchange
using quvaidx_tools::kExitFalse;  // a daemon answered without success
using quvaidx_tools::kExitOk;     // the work was done; a reply said success
using quvaidx_tools::ParseInt;

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

// The command line of subcommand `name`: its program name is "quvaidx
// NAME", it takes -V/--version, and -v/--verbose (the library's log lines
// on stderr) is added after `options`.
quvaidx_tools::CommandLine Subcommand(
    const char* name, std::vector<std::string> usage, std::string description,
    std::vector<quvaidx_tools::Option> options, std::string epilog);

// The operands a command takes.
struct OperandRule {
  const char* name;  // as usage errors name it: "missing FILE"
  int min;           // at least this many
  int max;           // at most this many; -1 for any number
  // Not null: an operand "-" stands for a list read from standard input,
  // one operand per line, or per NUL-terminated piece when *null_list is
  // true (for names holding a line feed); empty pieces are dropped.
  const bool* null_list;
};

// Parses argv by `line` (see quvaidx_tools::ParseCommandLine) and checks
// the operands against `rule`, reading the standard-input list where
// allowed. Returns kContinue with the operands in *operands, or the status
// to exit with (after printing the help, the version or one error).
int ParseCommand(const quvaidx_tools::CommandLine& line,
                 const OperandRule& rule, int argc, char** argv,
                 std::vector<std::string>* operands);

// -0/--null, for commands whose operand "-" reads a list.
quvaidx_tools::Option NullOption(bool* null_list);

// -j/--json with the given help.
quvaidx_tools::Option JsonOption(bool* json, std::string help);

// Checks that `path` can name a Unix-domain socket: not empty and at most
// the library's limit in bytes. Prints one error line and returns false
// otherwise.
bool CheckSocketPath(const char* command, const std::string& path);

// True when `name` is the short name of an index daemon (kIndexDaemons of
// quvaidx/paths.h).
bool IsDaemonName(const std::string& name);

// "controld, scand, workerd, plugind, mediad", for error messages.
std::string DaemonNameList();

// What a JSON value read by ReadJsonObject is and where it goes.
struct JsonInput {
  const char* what;     // "request", for messages
  const char* example;  // a valid value, shown when another kind is given
  size_t max_size;      // longest compact text (line end included) taken
  const char* carrier;  // what holds it: "a packet"
};

// The JSON object given as `text`, or read from standard input when `text`
// is "-": standard JSON (no comments, trailing commas, duplicate keys or
// trailing text) whose compact text fits `input.max_size`. On failure
// prints one line ("invalid JSON WHAT: <first error>", "the WHAT must be a
// JSON object, such as EXAMPLE", "the WHAT is N bytes long; CARRIER carries
// at most M", or why standard input could not be read) and returns false.
// Deep nesting counts as a syntax error, never as a crash.
bool ReadJsonObject(const char* command, const std::string& text,
                    const JsonInput& input, Json::Value* out);

// Writes `value` and a line feed to stdout, indented by two spaces or, with
// `compact`, on one line (see json_text.h: raw UTF-8, shortest numbers);
// flushes.
void PrintJson(const Json::Value& value, bool compact);

// The canonical absolute path of `path`, which must exist. Prints "PATH:
// <system error>" and returns false otherwise.
bool ResolvePath(const char* command, const std::string& path,
                 std::string* resolved);

// Opens the system log under the tool's name. Library log lines go there
// only, never to the terminal, until EnableVerboseLogging is called.
void InitLogging();

// Copies every library log line to stderr as well, and lets progress and
// debug lines through (threshold 7). Safe to call more than once.
void EnableVerboseLogging();

}  // namespace quvaidx_cli

#endif  // QUVAIDX_TOOLS_CLI_H_
