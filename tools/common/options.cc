#include "options.h"

#include <errno.h>
#include <getopt.h>
#include <math.h>
#include <stdlib.h>
#include <string.h>

#include <utility>

namespace quvaidx_tools {
namespace {

// The column at which option help starts in --help.
constexpr size_t kHelpColumn = 24;

std::string Spelling(const Option& option) {
  std::string text = option.letter != 0
                         ? std::string("-") + option.letter + ", "
                         : std::string("    ");
  text += "--";
  text += option.name;
  if (option.value_name != nullptr) {
    text += ' ';
    text += option.value_name;
  }
  return text;
}

// Writes one option of the help: its spelling, then its help lines indented
// to kHelpColumn (on the next line when the spelling is too long).
void PrintOption(const Option& option, FILE* out) {
  std::string head = "  " + Spelling(option);
  size_t start = 0;
  bool first = true;
  do {
    size_t end = option.help.find('\n', start);
    std::string line = option.help.substr(
        start, end == std::string::npos ? std::string::npos : end - start);
    if (first && head.size() + 2 <= kHelpColumn) {
      fprintf(out, "%-*s%s\n", static_cast<int>(kHelpColumn), head.c_str(),
              line.c_str());
    } else {
      if (first) fprintf(out, "%s\n", head.c_str());
      fprintf(out, "%*s%s\n", static_cast<int>(kHelpColumn), "", line.c_str());
    }
    first = false;
    start = end == std::string::npos ? end : end + 1;
  } while (start != std::string::npos);
}

std::vector<Option> WithStandardOptions(const CommandLine& line) {
  std::vector<Option> all = line.options;
  all.push_back({"help", 'h', nullptr, "show this help and exit", nullptr});
  if (!line.version.empty()) {
    all.push_back(
        {"version", 'V', nullptr, "show the version and exit", nullptr});
  }
  return all;
}

// The text of the option that getopt_long just refused, as the user wrote
// it ("--bogus", "-x").
std::string RefusedOption(char** argv) {
  std::string text = optind > 0 ? argv[optind - 1] : "";
  bool is_long = text.compare(0, 2, "--") == 0;
  if (is_long) {
    size_t equals = text.find('=');
    if (equals != std::string::npos) text.resize(equals);
  } else if (optopt > 0 && optopt < 128) {
    text = std::string("-") + static_cast<char>(optopt);
  }
  return text;
}

}  // namespace

Option Flag(const char* name, char letter, bool* out, std::string help) {
  return {name, letter, nullptr, std::move(help), [out](const char*) {
            *out = true;
            return std::string();
          }};
}

Option Text(const char* name, char letter, const char* value_name,
            std::string* out, std::string help, bool allow_empty) {
  return {name, letter, value_name, std::move(help),
          [out, allow_empty](const char* value) {
            if (!allow_empty && *value == '\0') return std::string("empty");
            *out = value;
            return std::string();
          }};
}

Option Number(const char* name, char letter, const char* value_name, int min,
              int max, int* out, std::string help) {
  return {name, letter, value_name, std::move(help),
          [out, min, max](const char* value) {
            if (ParseInt(value, min, max, out)) return std::string();
            return "a whole number from " + std::to_string(min) + " to " +
                   std::to_string(max);
          }};
}

Option Seconds(const char* name, char letter, double max, double* out,
               std::string help) {
  return {name, letter, "SECONDS", std::move(help),
          [out, max](const char* value) {
            char* end = nullptr;
            errno = 0;
            double seconds = strtod(value, &end);
            if (*value == '\0' || *end != '\0' || errno != 0 ||
                !isfinite(seconds) || seconds <= 0 || seconds > max) {
              char range[64];
              snprintf(range, sizeof(range),
                       "a number of seconds above 0, at most %g", max);
              return std::string(range);
            }
            *out = seconds;
            return std::string();
          }};
}

Option Custom(const char* name, char letter, const char* value_name,
              std::function<std::string(const char*)> apply, std::string help) {
  return {name, letter, value_name, std::move(help), std::move(apply)};
}

Option Noted(Option option, bool* given) {
  auto apply = std::move(option.apply);
  option.apply = [apply, given](const char* value) {
    std::string refused = apply(value);
    if (refused.empty()) *given = true;
    return refused;
  };
  return option;
}

void PrintError(const std::string& program, const std::string& message) {
  fprintf(stderr, "%s: %s\n", program.c_str(), message.c_str());
}

int UsageError(const std::string& program, const std::string& message) {
  PrintError(program, message);
  fprintf(stderr, "Try '%s --help'.\n", program.c_str());
  return kExitError;
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

void PrintHelp(const CommandLine& line, FILE* out) {
  for (size_t i = 0; i < line.usage.size(); ++i) {
    // Later forms start with "or:", as help2man reads them.
    fprintf(out, "%s %s %s\n",
            i == 0 ? "Usage:" : "  or: ", line.program.c_str(),
            line.usage[i].c_str());
  }
  if (!line.description.empty()) {
    fprintf(out, "\n%s", line.description.c_str());
    if (line.description.back() != '\n') fputc('\n', out);
  }
  fprintf(out, "\nOptions:\n");
  for (const Option& option : WithStandardOptions(line)) {
    PrintOption(option, out);
  }
  if (!line.epilog.empty()) {
    fprintf(out, "\n%s", line.epilog.c_str());
    if (line.epilog.back() != '\n') fputc('\n', out);
  }
}

int ParseCommandLine(const CommandLine& line, int argc, char** argv,
                     int* first_operand) {
  std::vector<Option> all = WithStandardOptions(line);
  std::vector<struct option> longs;
  // ':' first: a missing value is reported as ':' and getopt stays quiet.
  std::string letters = line.stop_at_first_operand ? "+:" : ":";
  for (size_t i = 0; i < all.size(); ++i) {
    int has_arg =
        all[i].value_name != nullptr ? required_argument : no_argument;
    // Long options report 256 + their index, so that letterless ones work.
    longs.push_back({all[i].name, has_arg, nullptr, 256 + static_cast<int>(i)});
    if (all[i].letter != 0) {
      letters += all[i].letter;
      if (has_arg == required_argument) letters += ':';
    }
  }
  longs.push_back({nullptr, 0, nullptr, 0});
  optind = 0;  // also resets getopt's state from an earlier parse
  opterr = 0;
  int c;
  while ((c = getopt_long(argc, argv, letters.c_str(), longs.data(),
                          nullptr)) != -1) {
    if (c == '?') {
      return UsageError(line.program,
                        "unrecognised option '" + RefusedOption(argv) + "'");
    }
    if (c == ':') {
      return UsageError(line.program,
                        "option '" + RefusedOption(argv) + "' needs a value");
    }
    const Option* option = nullptr;
    if (c >= 256) {
      option = &all[static_cast<size_t>(c - 256)];
    } else {
      for (const Option& candidate : all) {
        if (candidate.letter == c) option = &candidate;
      }
    }
    if (option == nullptr) {
      return UsageError(line.program, "unrecognised option");
    }
    if (strcmp(option->name, "help") == 0) {
      PrintHelp(line, stdout);
      fflush(stdout);
      return kExitOk;
    }
    if (strcmp(option->name, "version") == 0) {
      printf("%s\n", line.version.c_str());
      fflush(stdout);
      return kExitOk;
    }
    std::string refused = option->apply(optarg != nullptr ? optarg : "");
    if (!refused.empty()) {
      return UsageError(line.program, std::string("invalid value '") +
                                          (optarg != nullptr ? optarg : "") +
                                          "' for '--" + option->name +
                                          "': " + refused);
    }
  }
  *first_operand = optind;
  return kContinue;
}

}  // namespace quvaidx_tools
