// quvaidx: command-line access to the index daemons' sockets and task
// queues, and the index's folder walk. The dispatcher
// reads the tool's own options, then hands the remaining arguments to the
// subcommand named first.
#include <stdio.h>
#include <string.h>

#include "cli.h"
#include "commands.h"
#include "quvaidx/version.h"

namespace quvaidx_cli {
namespace {

int RunHelp(int argc, char** argv);

// Subcommands, in the order the usage text lists them. A new subcommand
// adds one line here and one source file.
constexpr Command kCommands[] = {
    {"daemons", "list the index daemons and whether they are alive",
     RunDaemons},
    {"send", "send one JSON request to a daemon and print its reply", RunSend},
    {"scan", "walk folder trees with the index's rules and count media",
     RunScan},
    {"serve", "run a sample daemon", RunServe},
    {"spool", "add entries to a spool queue or trim its head", RunSpool},
    {"stats", "show a process's descriptors and memory", RunStats},
    {"taskq", "create, fill, drain, count or delete a task queue", RunTaskq},
    {"thumb", "queue thumbnail or web-video work for paths", RunThumb},
    {"mediainfo", "ask the media parser for files' media records",
     RunMediaInfo},
    {"resolution", "ask the media parser for a file's pixel size",
     RunResolution},
    {"sizemap", "ask the plug-in daemon which thumbnails paths have",
     RunSizeMap},
    {"plugins", "ask the plug-in daemon which preview plug-ins run",
     RunPlugins},
    {"help", "show the help of a command", RunHelp},
};

const Command* FindCommand(const char* name) {
  for (const Command& command : kCommands) {
    if (strcmp(command.name, name) == 0) return &command;
  }
  return nullptr;
}

quvaidx_tools::CommandLine ToolLine() {
  std::string commands = "Commands:\n";
  for (const Command& command : kCommands) {
    // Two blanks at least after the name: help2man makes each command a
    // paragraph of its own.
    char line[128];
    snprintf(line, sizeof(line), "  %-12s%s\n", command.name, command.summary);
    commands += line;
  }
  quvaidx_tools::CommandLine line;
  line.program = "quvaidx";
  line.usage = {"[--verbose] COMMAND [OPTIONS] [ARGUMENTS]"};
  line.description =
      "Talks to the index daemons over their Unix-domain sockets, works\n"
      "on their task queues and spool queues, and walks folder trees with\n"
      "the index's rules.\n\n" +
      commands;
  line.options = {{"verbose", 'v', nullptr,
                   "also show the library's log lines on stderr",
                   [](const char*) {
                     EnableVerboseLogging();
                     return std::string();
                   }}};
  line.epilog = "Run 'quvaidx COMMAND --help' for the options of a command.\n";
  line.version = std::string("quvaidx ") + QuvaidxVersion();
  line.stop_at_first_operand = true;
  return line;
}

// "quvaidx help [COMMAND]": the tool's usage, or COMMAND --help.
int RunHelp(int argc, char** argv) {
  if (argc < 2 || strcmp(argv[1], "--help") == 0 ||
      strcmp(argv[1], "-h") == 0) {
    quvaidx_tools::PrintHelp(ToolLine(), stdout);
    return kExitOk;
  }
  if (argc > 2) return UsageError("help", "expects at most one command name");
  const Command* command = FindCommand(argv[1]);
  if (command == nullptr) {
    return UsageError("help", std::string("unknown command '") + argv[1] + "'");
  }
  char help_flag[] = "--help";
  char* help_argv[] = {argv[1], help_flag, nullptr};
  return command->run(2, help_argv);
}

int Main(int argc, char** argv) {
  InitLogging();
  int first = 0;
  int status = quvaidx_tools::ParseCommandLine(ToolLine(), argc, argv, &first);
  if (status != kContinue) return status;
  if (first >= argc) {
    return quvaidx_tools::UsageError("quvaidx", "no command given");
  }
  const Command* command = FindCommand(argv[first]);
  if (command == nullptr) {
    fprintf(stderr, "quvaidx: unknown command '%s'\n", argv[first]);
    fprintf(stderr, "Try 'quvaidx --help'.\n");
    return kExitError;
  }
  // The subcommand parses its own options afresh.
  return command->run(argc - first, argv + first);
}

}  // namespace
}  // namespace quvaidx_cli

int main(int argc, char** argv) { return quvaidx_cli::Main(argc, argv); }
