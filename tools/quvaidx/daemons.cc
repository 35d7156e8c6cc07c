// quvaidx daemons: the directory of the index daemons and which of them run.
//
// Paths come from the library's daemon directory (DaemonInfo); whether a
// daemon is alive is the host's decision (QLIBCProcAliveByPidFile), the same
// check that keeps a second instance from starting. Nothing is written and
// no daemon is contacted. Asked for NAMEs, it exits as `systemctl
// is-active` does: 0 only when every one is alive.
#include <stdio.h>

#include <string>
#include <vector>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "quvahost/quvahost.h"
#include "quvaidx/daemon_info.h"
#include "quvaidx/paths.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "daemons";
// Exit status when a daemon asked for is not alive, as systemctl is-active
// reports a unit that is not running.
constexpr int kExitNotRunning = 3;

struct Row {
  std::string name, pid_file, executable, socket;
  int pid;  // from the pid file; 0 when it has none
  bool alive;
};

quvaidx_tools::CommandLine MakeLine(bool* json) {
  return Subcommand(
      kName, {"[--json] [NAME...]"},
      "Lists the index daemons with their pid file, executable and socket,\n"
      "and whether each is alive: its pid file names a running process that\n"
      "started before the file was written. Without NAMEs all are listed:\n" +
          DaemonNameList() + ".\n",
      {JsonOption(json,
                  "print a JSON array of objects with the members\nname, "
                  "pid_file, executable, socket, pid (null\nwhen the pid file "
                  "is missing or bad) and alive")},
      "Exit status:\n"
      "  0  every NAME is alive (without NAMEs: the list was printed)\n"
      "  2  usage error or an unknown NAME\n"
      "  3  a NAME is not alive\n"
      "\n"
      "Examples:\n"
      "  $ quvaidx daemons mediad >/dev/null && echo the media parser runs\n");
}

Row Describe(DaemonInfo& info, const std::string& name) {
  Row row;
  row.name = name;
  row.pid_file = info.get(name, "pid");
  row.executable = info.get(name, "bin");
  row.socket = info.get(name, "sock");
  int pid = QLIBCReadPidFile(row.pid_file.c_str());
  row.pid = pid > 0 ? pid : 0;
  row.alive = QLIBCProcAliveByPidFile(row.pid_file.c_str()) == 1;
  return row;
}

void PrintJsonRows(const std::vector<Row>& rows) {
  Json::Value list(Json::arrayValue);
  for (const Row& row : rows) {
    Json::Value item(Json::objectValue);
    item["name"] = row.name;
    item["pid_file"] = row.pid_file;
    item["executable"] = row.executable;
    item["socket"] = row.socket;
    item["pid"] = row.pid > 0 ? Json::Value(row.pid) : Json::Value();
    item["alive"] = row.alive;
    list.append(item);
  }
  PrintJson(list, false);
}

// Columns as wide as their longest cell, two spaces apart; the last one is
// not padded, so no line ends in blanks.
void PrintTable(const std::vector<Row>& rows) {
  std::vector<std::vector<std::string>> cells = {
      {"NAME", "ALIVE", "PID", "PID FILE", "EXECUTABLE", "SOCKET"}};
  for (const Row& row : rows) {
    cells.push_back({row.name, row.alive ? "yes" : "no",
                     row.pid > 0 ? std::to_string(row.pid) : "-", row.pid_file,
                     row.executable, row.socket});
  }
  std::vector<size_t> width(cells[0].size(), 0);
  for (const auto& line : cells) {
    for (size_t i = 0; i < line.size(); ++i) {
      if (line[i].size() > width[i]) width[i] = line[i].size();
    }
  }
  for (const auto& line : cells) {
    std::string text;
    for (size_t i = 0; i < line.size(); ++i) {
      text += line[i];
      if (i + 1 < line.size()) text.append(width[i] - line[i].size() + 2, ' ');
    }
    printf("%s\n", text.c_str());
  }
  fflush(stdout);
}

}  // namespace

int RunDaemons(int argc, char** argv) {
  bool json = false;
  std::vector<std::string> names;
  if (int status = ParseCommand(MakeLine(&json), {"NAME", 0, -1, nullptr}, argc,
                                argv, &names);
      status != kContinue) {
    return status;
  }
  for (const std::string& name : names) {
    if (!IsDaemonName(name)) {
      PrintError(kName, "unknown daemon '" + name +
                            "'; known daemons: " + DaemonNameList());
      return kExitError;
    }
  }
  const bool all = names.empty();
  if (all) {
    for (const quvaidx::IndexDaemonPaths& daemon : quvaidx::kIndexDaemons)
      names.push_back(daemon.name);
  }
  DaemonInfo info;
  std::vector<Row> rows;
  bool every_one_alive = true;
  for (const std::string& name : names) {
    rows.push_back(Describe(info, name));
    every_one_alive = every_one_alive && rows.back().alive;
  }
  if (json) {
    PrintJsonRows(rows);
  } else {
    PrintTable(rows);
  }
  return all || every_one_alive ? kExitOk : kExitNotRunning;
}

}  // namespace quvaidx_cli
