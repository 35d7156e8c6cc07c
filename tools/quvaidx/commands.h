// Entry points of the quvaidx subcommands, one source file each. Every one
// takes the arguments from its own name on (argv[0] is the subcommand) and
// returns the process exit status.
#ifndef QUVAIDX_TOOLS_COMMANDS_H_
#define QUVAIDX_TOOLS_COMMANDS_H_

namespace quvaidx_cli {

int RunDaemons(int argc, char** argv);
int RunMediaInfo(int argc, char** argv);
int RunResolution(int argc, char** argv);
int RunSend(int argc, char** argv);
int RunSizeMap(int argc, char** argv);
int RunPlugins(int argc, char** argv);
int RunScan(int argc, char** argv);
int RunServe(int argc, char** argv);
int RunSpool(int argc, char** argv);
int RunStats(int argc, char** argv);
int RunTaskq(int argc, char** argv);
int RunThumb(int argc, char** argv);

}  // namespace quvaidx_cli

#endif  // QUVAIDX_TOOLS_COMMANDS_H_
