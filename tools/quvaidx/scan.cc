// quvaidx scan: walks folder trees as a scan daemon does, with the
// library's rules, and reports what the index would hold.
//
// The walk itself is in scan_tree.cc; this file reads the command line,
// shows progress, writes the file list and the summary, and queues folders
// for thumbnails on request. Nothing is kept per file: the list is written
// as the walk finds the files, also in JSON.
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "preview_queue.h"
#include "scan_tree.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "scan";
constexpr double kProgressDelay = 1.0;    // seconds before progress shows
constexpr double kProgressRefresh = 0.2;  // seconds between redraws
constexpr int kDefaultColumns = 80;       // when the terminal does not say

struct Options {
  bool list = false;
  bool json = false;
  bool queue_thumbs = false;
  bool null_list = false;          // DIR "-": NUL-separated names on stdin
  PreviewTarget thumbs;            // where --queue-thumbs queues
  std::vector<std::string> roots;  // absolute, resolved
};

quvaidx_tools::CommandLine MakeLine(Options* o) {
  using quvaidx_tools::Flag;
  std::vector<quvaidx_tools::Option> options = {
      Flag("list", 'l', &o->list,
           "print each file that passed the rules with its\ntable, "
           "\"TABLE<tab>PATH\", on stdout; the\nsummary then goes to "
           "stderr. Control characters\nand '\\' in paths are written "
           "as C escapes"),
      JsonOption(&o->json,
                 "print one JSON object: the summary and, with\n--list, "
                 "\"files\": [{\"table\", \"path\"}...]\n(names that are "
                 "not UTF-8 are not exact there)"),
      Flag("queue-thumbs", 0, &o->queue_thumbs,
           "queue every folder holding photos that need\nthumbnails for "
           "the thumbnail daemon, which must\nbe running; a folder outside "
           "every share, or\nwhose name holds a line feed, is refused "
           "with\none line and the others are queued"),
      NullOption(&o->null_list),
  };
  for (quvaidx_tools::Option& option :
       PreviewTargetOptions(&o->thumbs, " (with --queue-thumbs)")) {
    options.push_back(std::move(option));
  }
  return Subcommand(
      kName, {"[--list] [--json] [--queue-thumbs] DIR...|-"},
      "Walks each folder tree DIR with the index's rules and reports what\n"
      "the index would hold: files per media table (music, video, photo,\n"
      "playlist, other), videos playable on the web, photos that need\n"
      "thumbnails and the folders holding them, photos converted for the\n"
      "web, what was skipped and why, and folders that could not be read.\n"
      "\n"
      "Skipped: names the index refuses (\"._\" files, \"#recycle\",\n"
      "\"#snapshot\", the metadata folder \".quvameta\", \".app\" bundles),\n"
      "folders inside a share's recycle bin, network and image mounts,\n"
      "symbolic links (never followed), folder loops, and devices, sockets\n"
      "and pipes. Each DIR is resolved to its absolute path first (a DIR\n"
      "that is a symbolic link is followed); paths are shown that way.\n"
      "With -, the DIRs are read from standard input, one per line.\n",
      options,
      "On a terminal, a scan that takes over a second shows its progress\n"
      "on stderr. Unreadable folders, and folders not queued, get one line\n"
      "each on stderr.\n"
      "\n"
      "Exit status: 0; 1 when a folder could not be read or a folder could\n"
      "not be queued; 2 on a usage error, a DIR that is missing or not a\n"
      "folder, or --queue-thumbs while the thumbnail daemon is not running.\n"
      "\n"
      "Examples:\n"
      "  $ quvaidx scan /share/Multimedia\n"
      "  $ quvaidx scan --list /share/Photos | grep '^photo'\n");
}

double Now() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

// Appends `path` to `out` with C escapes for control characters and '\',
// so that one file is always one line.
void AppendEscaped(const std::string& path, std::string* out) {
  for (unsigned char c : path) {
    if (c == '\\') {
      out->append("\\\\");
    } else if (c == '\t') {
      out->append("\\t");
    } else if (c == '\n') {
      out->append("\\n");
    } else if (c < 0x20 || c == 0x7f) {
      char octal[8];
      snprintf(octal, sizeof(octal), "\\%03o", c);
      out->append(octal);
    } else {
      out->push_back(static_cast<char>(c));
    }
  }
}

// Reports the walk: the file list, progress on a terminal, unreadable
// folders and, on request, thumbnail queueing.
class Reporter : public ScanObserver {
 public:
  // `queuer` is null without --queue-thumbs.
  Reporter(const Options& options, bool show_progress, PreviewQueuer* queuer)
      : options_(options),
        show_progress_(show_progress),
        start_(Now()),
        queuer_(queuer) {}

  void OnFile(const std::string& path, TableIndex table) override {
    line_.clear();
    if (options_.json) {
      line_.append(first_file_ ? "    {\"table\" : \""
                               : ",\n    {\"table\" : \"");
      line_.append(TableName(table));
      line_.append("\", \"path\" : ");
      line_.append(Json::valueToQuotedString(path.c_str()));
      line_.push_back('}');
    } else {
      line_.append(TableName(table));
      line_.push_back('\t');
      AppendEscaped(path, &line_);
      line_.push_back('\n');
    }
    first_file_ = false;
    fwrite(line_.data(), 1, line_.size(), stdout);
  }

  void OnThumbFolder(const std::string& path) override {
    if (queuer_ == nullptr) return;
    if (queue_failed_) {
      ++not_queued_;
      return;
    }
    std::string report;
    PreviewQueuer::Outcome outcome = queuer_->Queue(path, &report);
    if (outcome == PreviewQueuer::kQueued) {
      ++queued_;
      return;
    }
    // A refused folder is reported and the walk goes on; a queue that
    // cannot be written would fail every later folder the same way, so
    // one line says it and the rest are only counted.
    ++not_queued_;
    queue_failed_ = outcome == PreviewQueuer::kFailed;
    ClearProgress();
    std::string line = "not queued: ";
    AppendEscaped(path, &line);
    PrintError(kName,
               line + ": " + report +
                   (queue_failed_ ? "; no more folders are queued" : ""));
  }

  void OnUnreadable(const std::string& path, const char* reason) override {
    ClearProgress();
    PrintError(kName, "cannot read " + path + ": " + reason);
  }

  void OnProgress(uint64_t entries, const std::string& path) override {
    if (!show_progress_) return;
    double now = Now();
    if (now - start_ < kProgressDelay || now - last_draw_ < kProgressRefresh) {
      return;
    }
    last_draw_ = now;
    char counts[96];
    snprintf(counts, sizeof(counts), "%llu entries, %.0f/s  ",
             static_cast<unsigned long long>(entries),
             static_cast<double>(entries) / (now - start_));
    // The line must not wrap, or clearing it would leave a piece behind:
    // the folder loses its beginning when it does not fit.
    size_t room = static_cast<size_t>(Columns()) - 1;
    std::string text = counts;
    if (text.size() < room) {
      std::string folder;
      for (unsigned char c : path) {
        folder.push_back(c < 0x20 || c == 0x7f ? '?' : static_cast<char>(c));
      }
      size_t left = room - text.size();
      if (folder.size() > left) {
        folder = left > 3 ? "..." + folder.substr(folder.size() - (left - 3))
                          : std::string();
      }
      text += folder;
    } else {
      text.resize(room);
    }
    fprintf(stderr, "\r%s\033[K", text.c_str());
    fflush(stderr);
    progress_shown_ = true;
  }

  // Erases the progress line, if one is shown.
  void ClearProgress() {
    if (!progress_shown_) return;
    fputs("\r\033[K", stderr);
    fflush(stderr);
    progress_shown_ = false;
  }

  bool any_file() const { return !first_file_; }
  uint64_t queued() const { return queued_; }
  uint64_t not_queued() const { return not_queued_; }

 private:
  static int Columns() {
    struct winsize size;
    if (ioctl(STDERR_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 20) {
      return size.ws_col;
    }
    return kDefaultColumns;
  }

  const Options& options_;
  bool show_progress_;
  double start_;                 // when the scan began
  double last_draw_ = 0;         // when progress was last drawn
  bool progress_shown_ = false;  // a progress line is on the terminal
  bool first_file_ = true;       // no file listed yet
  std::string line_;             // one list line, reused
  PreviewQueuer* queuer_;        // null without --queue-thumbs
  bool queue_failed_ = false;    // the queue could not be written
  uint64_t queued_ = 0;          // folders queued for thumbnails
  uint64_t not_queued_ = 0;      // folders that could not be queued
};

uint64_t SkippedTotal(const ScanCounts& counts) {
  uint64_t total = 0;
  for (uint64_t n : counts.skipped) total += n;
  return total;
}

Json::Value SummaryJson(const Options& options, const ScanCounts& counts,
                        const Reporter& reporter, double elapsed) {
  auto number = [](uint64_t n) { return Json::Value(Json::UInt64(n)); };
  Json::Value summary(Json::objectValue);
  Json::Value& roots = summary["roots"] = Json::Value(Json::arrayValue);
  for (const std::string& root : options.roots) roots.append(root);
  summary["folders"] = number(counts.folders);
  summary["total_files"] = number(counts.files);
  Json::Value& tables = summary["tables"] = Json::Value(Json::objectValue);
  for (int t = 0; t < kTableCount; ++t) {
    tables[TableName(static_cast<TableIndex>(t))] = number(counts.tables[t]);
  }
  summary["web_video"] = number(counts.web_video);
  Json::Value& thumbs = summary["thumbnails"] = Json::Value(Json::objectValue);
  thumbs["photos"] = number(counts.thumb_photos);
  thumbs["folders"] = number(counts.thumb_folders);
  if (options.queue_thumbs) {
    thumbs["queued"] = number(reporter.queued());
    thumbs["not_queued"] = number(reporter.not_queued());
  }
  summary["web_conversion_photos"] = number(counts.web_convert_photos);
  Json::Value& skipped = summary["skipped"] = Json::Value(Json::objectValue);
  for (int r = 0; r < kSkipReasonCount; ++r) {
    skipped[SkipKey(static_cast<SkipReason>(r))] = number(counts.skipped[r]);
  }
  summary["skipped_total"] = number(SkippedTotal(counts));
  summary["unreadable_folders"] = number(counts.unreadable);
  summary["elapsed_seconds"] = elapsed;
  return summary;
}

void PrintSummary(FILE* out, const Options& options, const ScanCounts& counts,
                  const Reporter& reporter, double elapsed) {
  auto n = [](uint64_t value) {
    return static_cast<unsigned long long>(value);
  };
  fprintf(out, "Scanned %llu %s and %llu %s in %.3f s\n", n(counts.folders),
          counts.folders == 1 ? "folder" : "folders", n(counts.files),
          counts.files == 1 ? "file" : "files", elapsed);
  fprintf(out, "  music     %8llu\n", n(counts.tables[kTableMusic]));
  fprintf(out, "  video     %8llu   %llu playable on the web\n",
          n(counts.tables[kTableVideo]), n(counts.web_video));
  fprintf(out,
          "  photo     %8llu   %llu need thumbnails, in %llu %s; %llu "
          "converted for the web\n",
          n(counts.tables[kTablePhoto]), n(counts.thumb_photos),
          n(counts.thumb_folders),
          counts.thumb_folders == 1 ? "folder" : "folders",
          n(counts.web_convert_photos));
  fprintf(out, "  playlist  %8llu\n", n(counts.tables[kTablePlaylist]));
  fprintf(out, "  other     %8llu\n", n(counts.tables[kTableOther]));
  uint64_t skipped = SkippedTotal(counts);
  if (skipped == 0) {
    fprintf(out, "Skipped nothing\n");
  } else {
    fprintf(out, "Skipped %llu %s:\n", n(skipped),
            skipped == 1 ? "entry" : "entries");
    for (int r = 0; r < kSkipReasonCount; ++r) {
      if (counts.skipped[r] == 0) continue;
      fprintf(out, "  %-40s %8llu\n",
              SkipDescription(static_cast<SkipReason>(r)),
              n(counts.skipped[r]));
    }
  }
  if (options.queue_thumbs) {
    fprintf(out, "Queued for thumbnails: %llu %s", n(reporter.queued()),
            reporter.queued() == 1 ? "folder" : "folders");
    if (reporter.not_queued() > 0) {
      fprintf(out, " (%llu not queued)", n(reporter.not_queued()));
    }
    fprintf(out, "\n");
  }
  if (counts.unreadable > 0) {
    fprintf(out, "Unreadable folders: %llu\n", n(counts.unreadable));
  }
}

// Resolves every DIR to an absolute path naming a folder. Prints one line
// per DIR that fails and returns false if any did.
bool ResolveRoots(const std::vector<std::string>& dirs, Options* options) {
  bool ok = true;
  for (const std::string& dir : dirs) {
    std::string resolved;
    struct stat st;
    if (!ResolvePath(kName, dir, &resolved)) {
      ok = false;
    } else if (stat(resolved.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
      PrintError(kName, dir + ": not a folder");
      ok = false;
    } else {
      options->roots.push_back(resolved);
    }
  }
  return ok;
}

}  // namespace

int RunScan(int argc, char** argv) {
  Options options;
  std::vector<std::string> dirs;
  if (int status = ParseCommand(MakeLine(&options),
                                {"the folder DIR", 1, -1, &options.null_list},
                                argc, argv, &dirs);
      status != kContinue) {
    return status;
  }
  if (!ResolveRoots(dirs, &options)) return kExitError;
  PreviewQueuer queuer(kName, options.thumbs);
  if (options.queue_thumbs && !queuer.Ready()) return kExitError;

  // Progress shares the terminal with nothing but the final summary: not
  // with a list written to the same terminal.
  bool show_progress =
      isatty(STDERR_FILENO) && !(options.list && isatty(STDOUT_FILENO));
  Reporter reporter(options, show_progress,
                    options.queue_thumbs ? &queuer : nullptr);
  TreeScanner scanner(&reporter, options.list);
  if (options.json && options.list) fputs("{\n  \"files\" : [\n", stdout);
  double start = Now();
  for (const std::string& root : options.roots) scanner.Scan(root);
  double elapsed = Now() - start;
  reporter.ClearProgress();
  queuer.Wake();

  const ScanCounts& counts = scanner.counts();
  if (options.json) {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "  ";
    builder["precision"] = 6;  // microseconds for the elapsed time
    builder["precisionType"] = "decimal";
    std::string text = Json::writeString(
        builder, SummaryJson(options, counts, reporter, elapsed));
    if (options.list) {
      // The summary's members follow the streamed list in the same object.
      fputs(reporter.any_file() ? "\n  ],\n" : "  ],\n", stdout);
      text.erase(0, text.find('\n') + 1);  // its opening "{\n"
    }
    fprintf(stdout, "%s\n", text.c_str());
  } else {
    PrintSummary(options.list ? stderr : stdout, options, counts, reporter,
                 elapsed);
  }
  fflush(stdout);
  bool failed = counts.unreadable > 0 || reporter.not_queued() > 0;
  return failed ? kExitFalse : kExitOk;
}

}  // namespace quvaidx_cli
