// The thumbnail daemon's walk through its queue, with a stand-in for the
// thumbnail making: which photos of an entry are made, when an entry leaves
// the queue, and when it goes to the back instead.
#include <fcntl.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "thumb_worker.h"

namespace {

using mkthumbd::PhotoOutcome;
using mkthumbd::PhotoResult;
using mkthumbd::ThumbWorker;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;
using Did = ThumbWorker::Did;

class ThumbWorkerTest : public ::testing::Test {
 protected:
  // Runs the worker until it has nothing to do (at most 1000 steps).
  void RunToIdle(ThumbWorker& worker) {
    for (int i = 0; i < 1000; ++i) {
      if (worker.Step() == Did::kNothing) return;
    }
    FAIL() << "the worker never ran out of work";
  }

  // A worker whose "thumbnail making" records the photo and then runs
  // `also` (which may change the folder under the work).
  ThumbWorker Worker(std::function<void(const std::string&)> also = nullptr) {
    return ThumbWorker(queue_, [this, also](const std::string& photo) {
      made_.push_back(photo);
      if (also) also(photo);
      PhotoResult result;
      result.outcome = PhotoOutcome::kMade;
      result.made = 0xF;
      return result;
    });
  }

  std::string Folder(const std::string& name) {
    std::string path = dir_.File(name);
    mkdir(path.c_str(), 0755);
    return path;
  }

  TempDir dir_;
  std::string queue_ = dir_.File("thumb.queue");
  std::vector<std::string> made_;
};

// Only the web photos directly in the folder, in name order: no subfolder,
// no link, no AppleDouble file, no other media.
TEST_F(ThumbWorkerTest, MakesTheFoldersOwnPhotosInNameOrder) {
  std::string a = Folder("a");
  for (const char* name : {"b.JPG", "a.png", "c.gif", "notes.txt", "clip.mp4",
                           "._a.png", "raw.nef"}) {
    WriteFile(a + "/" + name, "x");
  }
  Folder("a/sub");
  WriteFile(a + "/sub/deeper.jpg", "x");
  symlink("a.png", (a + "/link.jpg").c_str());
  ASSERT_EQ(WriteIndexQueue(a.c_str(), queue_.c_str()), 0);
  ASSERT_EQ(WriteIndexQueue((a + "/").c_str(), queue_.c_str()), 0);
  ThumbWorker worker = Worker();
  RunToIdle(worker);
  const std::vector<std::string> once = {a + "/a.png", a + "/b.JPG",
                                         a + "/c.gif", a + "/raw.nef"};
  std::vector<std::string> twice = once;
  twice.insert(twice.end(), once.begin(), once.end());
  EXPECT_EQ(made_, twice);
  EXPECT_EQ(ReadFile(queue_), "");
  EXPECT_EQ(worker.counts().entries_done, 2);
  EXPECT_EQ(worker.counts().photos_made, 8);
}

// Entries that name no folder are logged and removed; the entries behind
// them are still served.
TEST_F(ThumbWorkerTest, EntriesThatNameNoFolderAreRemovedAndWorkGoesOn) {
  std::string good = Folder("good");
  WriteFile(good + "/p.jpg", "x");
  WriteFile(dir_.File("file.jpg"), "x");
  WriteFile(queue_, "relative/path\n" + dir_.File("gone") + "\n" +
                        dir_.File("file.jpg") + "\n\n" + good + "\n");
  ThumbWorker worker = Worker();
  RunToIdle(worker);
  EXPECT_EQ(made_, std::vector<std::string>{good + "/p.jpg"});
  EXPECT_EQ(ReadFile(queue_), "");
  EXPECT_EQ(worker.counts().entries_refused, 4);
}

// An entry stays queued until its last photo is done: a daemon stopped (or
// killed) between photos finds it again; entries appended meanwhile stay.
TEST_F(ThumbWorkerTest, EntryLeavesTheQueueOnlyWhenItsWorkIsDone) {
  std::string a = Folder("a");
  WriteFile(a + "/1.jpg", "x");
  WriteFile(a + "/2.jpg", "x");
  ASSERT_EQ(WriteIndexQueue(a.c_str(), queue_.c_str()), 0);
  ThumbWorker worker = Worker();
  EXPECT_EQ(worker.Step(), Did::kRead);
  EXPECT_EQ(worker.Step(), Did::kListed);
  EXPECT_EQ(worker.Step(), Did::kPhoto);
  ASSERT_EQ(WriteIndexQueue("/later", queue_.c_str()), 0);
  EXPECT_EQ(ReadFile(queue_), a + "\n/later\n");  // stopping here redoes a
  EXPECT_EQ(worker.Step(), Did::kPhoto);
  EXPECT_EQ(worker.Step(), Did::kEntry);
  EXPECT_EQ(ReadFile(queue_), "/later\n");
}

// A photo added to the folder or rewritten while the entry was worked on:
// WriteThumbQueue skipped the folder as still queued, so the worker must
// send it to the back itself. Its own metadata directories do not count.
TEST_F(ThumbWorkerTest, FolderChangedDuringTheWorkGoesToTheBack) {
  struct Case {
    const char* fault;
    std::function<void(const std::string& folder)> change;
    bool requeued;
  } cases[] = {
      {"photo added",
       [](const std::string& f) { WriteFile(f + "/new.jpg", "x"); }, true},
      {"photo rewritten",
       [](const std::string& f) {
         struct timespec later[2];
         clock_gettime(CLOCK_REALTIME, &later[0]);
         later[0].tv_sec += 5;
         later[1] = later[0];
         utimensat(AT_FDCWD, (f + "/1.jpg").c_str(), later, 0);
       },
       true},
      {"non-photo added",
       [](const std::string& f) { WriteFile(f + "/notes.txt", "x"); }, false},
      {"metadata directory made",
       [](const std::string& f) { mkdir((f + "/.quvameta").c_str(), 0755); },
       false},
  };
  int n = 0;
  for (const Case& c : cases) {
    std::string folder = Folder("f" + std::to_string(n++));
    WriteFile(folder + "/1.jpg", "x");
    WriteFile(queue_, folder + "\n/other\n");
    bool changed = false;
    ThumbWorker worker = Worker([&](const std::string&) {
      if (!changed) c.change(folder);
      changed = true;
    });
    ASSERT_EQ(worker.Step(), Did::kRead);
    while (worker.Step() != Did::kEntry) {
    }
    EXPECT_EQ(ReadFile(queue_),
              c.requeued ? "/other\n" + folder + "\n" : std::string("/other\n"))
        << c.fault;
    EXPECT_EQ(worker.counts().entries_requeued, c.requeued ? 1 : 0) << c.fault;
  }
}

}  // namespace
