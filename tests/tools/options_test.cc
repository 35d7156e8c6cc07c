// The shared command-line parser: checked values, errors naming the option as
// written, --help and --version from the one description.
#include "options.h"

#include <stdio.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace quvaidx_tools {
namespace {

struct Parsed {
  int status;
  int first_operand;
  std::string out;
  std::string err;
};

struct Targets {
  bool flag = false;
  std::string text = "unset";
  int number = -1;
  double seconds = -1;
};

CommandLine MakeLine(Targets* t) {
  CommandLine line;
  line.program = "prog sub";
  line.usage = {"[OPTIONS] FILE...", "--other"};
  line.description = "Does things.";
  line.epilog = "Exit status: 0.";
  line.version = "prog 1.2.3";
  line.options = {
      Flag("flag", 'f', &t->flag, "a flag"),
      Text("text", 't', "TEXT", &t->text, "a text\nsecond line"),
      Number("number", 'n', "N", 1, 9, &t->number, "a number"),
      Seconds("timeout", 0, 60, &t->seconds, "a time limit"),
  };
  return line;
}

// Runs the parser on `args` with stdout and stderr captured.
Parsed Parse(const CommandLine& line, std::vector<std::string> args) {
  args.insert(args.begin(), "sub");
  std::vector<char*> argv;
  for (std::string& arg : args) argv.push_back(arg.data());
  argv.push_back(nullptr);
  Parsed parsed{};
  testing::internal::CaptureStdout();
  testing::internal::CaptureStderr();
  parsed.status = ParseCommandLine(line, static_cast<int>(args.size()),
                                   argv.data(), &parsed.first_operand);
  parsed.out = testing::internal::GetCapturedStdout();
  parsed.err = testing::internal::GetCapturedStderr();
  return parsed;
}

TEST(OptionsTest, ValuesReachTheirTargetsInAnySpellingAndOrder) {
  Targets t;
  CommandLine line = MakeLine(&t);
  Parsed p = Parse(line, {"a", "-f", "--text=x y", "-n", "9", "b", "--timeout",
                          "0.5", "--", "-c"});
  ASSERT_EQ(p.status, kContinue) << p.err;
  EXPECT_TRUE(t.flag);
  EXPECT_EQ(t.text, "x y");
  EXPECT_EQ(t.number, 9);
  EXPECT_DOUBLE_EQ(t.seconds, 0.5);
  // getopt moves the operands a, b and (after "--") -c behind the options.
  EXPECT_EQ(p.first_operand, 8);
  EXPECT_EQ(p.err, "");
  // A dispatcher stops at its first operand: the rest is its command's.
  line.stop_at_first_operand = true;
  t.flag = false;
  p = Parse(line, {"-f", "send", "--bogus"});
  ASSERT_EQ(p.status, kContinue);
  EXPECT_EQ(p.first_operand, 2);
  EXPECT_TRUE(t.flag);
}

TEST(OptionsTest, RefusedValuesNameTheOptionAndLeaveTheTarget) {
  const std::string number = "': a whole number from 1 to 9",
                    seconds = "': a number of seconds above 0, at most 60";
  const std::pair<std::vector<std::string>, std::string> cases[] = {
      {{"--bogus"}, "unrecognised option '--bogus'"},
      {{"--bogus=1"}, "unrecognised option '--bogus'"},
      {{"-x"}, "unrecognised option '-x'"},
      {{"--text"}, "option '--text' needs a value"},
      {{"-n"}, "option '-n' needs a value"},
      {{"-n", "10"}, "invalid value '10' for '--number" + number},
      {{"--number=1x"}, "invalid value '1x' for '--number" + number},
      {{"--text="}, "invalid value '' for '--text': empty"},
      {{"--timeout", "0"}, "invalid value '0' for '--timeout" + seconds},
      {{"--timeout", "nan"}, "invalid value 'nan' for '--timeout" + seconds}};
  for (const auto& [args, error] : cases) {
    Targets t;
    Parsed p = Parse(MakeLine(&t), args);
    EXPECT_EQ(p.status, kExitError) << args[0];
    EXPECT_EQ(p.err, "prog sub: " + error + "\nTry 'prog sub --help'.\n");
    EXPECT_EQ(t.text, "unset");
    EXPECT_EQ(t.number, -1);
  }
}

TEST(OptionsTest, HelpAndVersionComeFromTheDescription) {
  Targets t;
  CommandLine line = MakeLine(&t);
  Parsed help = Parse(line, {"-n", "2", "--help", "--bogus"});
  EXPECT_EQ(help.status, kExitOk);
  EXPECT_EQ(help.out,
            "Usage: prog sub [OPTIONS] FILE...\n"
            "  or:  prog sub --other\n"
            "\n"
            "Does things.\n"
            "\n"
            "Options:\n"
            "  -f, --flag            a flag\n"
            "  -t, --text TEXT       a text\n"
            "                        second line\n"
            "  -n, --number N        a number\n"
            "      --timeout SECONDS\n"
            "                        a time limit\n"
            "  -h, --help            show this help and exit\n"
            "  -V, --version         show the version and exit\n"
            "\n"
            "Exit status: 0.\n");
  Parsed version = Parse(line, {"-V"});
  EXPECT_EQ(version.status, kExitOk);
  EXPECT_EQ(version.out, "prog 1.2.3\n");
  // Without a version text there is no --version.
  line.version.clear();
  EXPECT_EQ(Parse(line, {"--version"}).status, kExitError);
}

}  // namespace
}  // namespace quvaidx_tools
