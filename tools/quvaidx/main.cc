// quvaidx: command-line access to the index daemons' sockets and task
// queues, and the index's folder walk. The dispatcher
// reads the tool's own options, then hands the remaining arguments to the
// subcommand named first.
#include <getopt.h>
#include <stdio.h>
#include <string.h>

#include "cli.h"
#include "commands.h"

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

void PrintUsage(FILE* out) {
  fprintf(out,
          "Usage: quvaidx [--verbose] COMMAND [OPTIONS] [ARGUMENTS]\n"
          "\n"
          "Talks to the index daemons over their Unix-domain sockets, works\n"
          "on their task queues and walks folder trees with the index's\n"
          "rules.\n"
          "\n"
          "Commands:\n");
  for (const Command& command : kCommands) {
    fprintf(out, "  %-10s %s\n", command.name, command.summary);
  }
  fprintf(out,
          "\n"
          "Options:\n"
          "  -v, --verbose  also show the library's log lines on stderr\n"
          "  -h, --help     show this help\n"
          "\n"
          "Run 'quvaidx COMMAND --help' for the options of a command.\n");
}

// "quvaidx help [COMMAND]": the tool's usage, or COMMAND --help.
int RunHelp(int argc, char** argv) {
  if (argc < 2 || strcmp(argv[1], "--help") == 0 ||
      strcmp(argv[1], "-h") == 0) {
    PrintUsage(stdout);
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
  static const struct option kOptions[] = {
      {"verbose", no_argument, nullptr, 'v'},
      {"help", no_argument, nullptr, 'h'},
      {nullptr, 0, nullptr, 0},
  };
  opterr = 0;
  int c;
  // '+' stops at the subcommand's name: what follows belongs to it.
  while ((c = getopt_long(argc, argv, "+:vh", kOptions, nullptr)) != -1) {
    switch (c) {
      case 'v':
        EnableVerboseLogging();
        break;
      case 'h':
        PrintUsage(stdout);
        return kExitOk;
      default: {
        std::string text = argv[optind - 1];
        fprintf(stderr, "quvaidx: unrecognised option '%s'\n", text.c_str());
        fprintf(stderr, "Try 'quvaidx --help'.\n");
        return kExitError;
      }
    }
  }
  if (optind >= argc) {
    fprintf(stderr, "quvaidx: no command given\n");
    fprintf(stderr, "Try 'quvaidx --help'.\n");
    return kExitError;
  }
  const Command* command = FindCommand(argv[optind]);
  if (command == nullptr) {
    fprintf(stderr, "quvaidx: unknown command '%s'\n", argv[optind]);
    fprintf(stderr, "Try 'quvaidx --help'.\n");
    return kExitError;
  }
  // The subcommand parses its own options afresh (optind 0 resets getopt).
  int sub_argc = argc - optind;
  char** sub_argv = argv + optind;
  optind = 0;
  return command->run(sub_argc, sub_argv);
}

}  // namespace
}  // namespace quvaidx_cli

int main(int argc, char** argv) { return quvaidx_cli::Main(argc, argv); }
