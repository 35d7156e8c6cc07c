// The one command-line parser of the quvaidx tool's subcommands and the
// reference daemons.
//
// A program describes itself once, as a CommandLine: its name, usage lines,
// description, options and closing text. From that one description come the
// parsing (getopt_long rules: short letters, --long and --long=VALUE,
// options and operands in any order, "--" ends the options), the --help text
// (laid out as help2man reads it, so the man pages are generated from it),
// --version, and the error lines:
//
//   PROGRAM: unrecognised option '--bogus'
//   PROGRAM: option '--socket' needs a value
//   PROGRAM: invalid value 'x' for '--attempts': a whole number from 1 to 9
//   Try 'PROGRAM --help'.
//
// Values are checked while parsing: an option's target is written only with
// a value that passed its check. Nothing here touches the library.
#ifndef QUVAIDX_TOOLS_COMMON_OPTIONS_H_
#define QUVAIDX_TOOLS_COMMON_OPTIONS_H_

#include <stdio.h>

#include <functional>
#include <string>
#include <vector>

namespace quvaidx_tools {

// Exit statuses shared by the tool and the daemons.
constexpr int kExitOk = 0;     // the work was done
constexpr int kExitFalse = 1;  // a daemon answered without success
constexpr int kExitError = 2;  // usage error, bad input or failed exchange

// ParseCommandLine's result when the program goes on with its operands.
constexpr int kContinue = -1;

// One option. Make them with the functions below; `apply` checks a value
// (or, for a flag, just records it) and returns an empty text, or the
// reason the value is refused ("a whole number from 1 to 9").
struct Option {
  const char* name;        // long name, without "--"
  char letter;             // short letter, or 0 for none
  const char* value_name;  // "PATH" for an option with a value; null for a flag
  std::string help;        // one or more lines, without the option itself
  std::function<std::string(const char* value)> apply;
};

// --name / -letter sets *out to true.
Option Flag(const char* name, char letter, bool* out, std::string help);
// --name VALUE stores VALUE in *out (any text, the empty one included
// unless `allow_empty` is false).
Option Text(const char* name, char letter, const char* value_name,
            std::string* out, std::string help, bool allow_empty = false);
// --name N: a whole decimal number within [min, max].
Option Number(const char* name, char letter, const char* value_name, int min,
              int max, int* out, std::string help);
// --name SECONDS: a decimal number of seconds (fractions allowed) within
// (0, max].
Option Seconds(const char* name, char letter, double max, double* out,
               std::string help);
// --name VALUE calls `apply` with the value; its result as above.
Option Custom(const char* name, char letter, const char* value_name,
              std::function<std::string(const char*)> apply, std::string help);

// `option`, which also sets *given to true when its value is accepted: for
// options whose absence means something other than their default.
Option Noted(Option option, bool* given);

// A program's (or subcommand's) description.
struct CommandLine {
  // How error lines and the help name the program: "quvaidx send",
  // "quvamediaparserd".
  std::string program;
  // What follows the program in each usage line, e.g. "[OPTIONS] JSON".
  std::vector<std::string> usage;
  // Paragraphs shown after the usage lines.
  std::string description;
  std::vector<Option> options;
  // Text after the options: exit statuses, notes, examples.
  std::string epilog;
  // Printed by --version when not empty (e.g. "quvaidx 0.2.0"); without it
  // the program takes no --version.
  std::string version;
  // Stop at the first operand (what follows belongs to it), as a command
  // dispatcher does; otherwise options and operands may mix.
  bool stop_at_first_operand = false;
};

// Parses argv[1..argc) by `line`, adding --help/-h (and --version/-V when
// `line.version` is set). On success returns kContinue with the operands in
// argv[*first_operand, argc). Otherwise returns the status to exit with at
// once: kExitOk after printing the help or version to stdout, kExitError
// after printing an error line and the hint to stderr.
int ParseCommandLine(const CommandLine& line, int argc, char** argv,
                     int* first_operand);

// Writes the help text of `line` to `out`.
void PrintHelp(const CommandLine& line, FILE* out);

// Prints "PROGRAM: MESSAGE" on stderr.
void PrintError(const std::string& program, const std::string& message);

// Prints the error line and the hint to run PROGRAM --help; returns
// kExitError.
int UsageError(const std::string& program, const std::string& message);

// Parses a whole decimal number within [min, max]; false for anything else
// (empty text, signs outside the range, trailing characters, overflow).
bool ParseInt(const char* text, int min, int max, int* out);

}  // namespace quvaidx_tools

#endif  // QUVAIDX_TOOLS_COMMON_OPTIONS_H_
