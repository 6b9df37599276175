#include "watch/watcher.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>

#include "common/json.h"
#include "support/temp_folder.h"

namespace vexlo::watch {
namespace {

namespace fs = std::filesystem;

constexpr std::chrono::seconds kRescan(30);

// Folders "in", the usual root, and "out"; a watcher once started, and a clock that it goes by.
class WatcherTest : public testing::Test {
 protected:
  void Start(const std::vector<std::string>& roots, const WatchOptions& options = {}) {
    watcher_.emplace(
        roots, options, [this](QueueEvent&& event) { events_.push_back(std::move(event)); }, now_);
  }

  // Runs the commands in "in": the kernel has queued their events when they have returned.
  void Do(const std::string& commands) const {
    const std::string all = "set -e; mkdir -p " + in_ + " " + out_ + "; cd " + in_ + ";" + commands;
    EXPECT_EQ(system(all.c_str()), 0) << commands;
  }
  void Clear() const { Do("rm -rf ../in ../out; mkdir ../in ../out"); }

  // All events so far, those included that only the end of the wait for a second half brings.
  std::vector<QueueEvent> Take(std::chrono::seconds later = {}) {
    now_ += later;
    for (int i = 0; i < 3; ++i) {
      watcher_->Poll(now_);
      now_ += std::chrono::milliseconds(60);
    }
    return std::exchange(events_, {});
  }

  // As "create d/f, rename d/ e/", with paths as they are seen from "in".
  std::string Text(const std::vector<QueueEvent>& events) const {
    static const std::map<uint32_t, std::string> kNames = {
        {kMaskAttrib, "attr"},    {kMaskCloseWrite, "write"}, {kMaskCreate, "create"},
        {kMaskDelete, "delete"},  {kMaskRename, "rename"},    {kMaskCrashed, "crashed"},
        {kMaskReindex, "reindex"}};
    std::string text;
    for (const QueueEvent& event : events) {
      text += (text.empty() ? "" : ", ") + kNames.at(event.mask);
      for (const std::string& path : {event.path_old, event.path}) {
        text += path.empty() ? "" : " " + fs::path(path).lexically_relative(in_).string();
        text += event.is_dir && !path.empty() ? "/" : "";
      }
    }
    return text;
  }

  const TempFolder base_;
  const std::string in_ = base_ / "in";
  const std::string out_ = base_ / "out";
  std::optional<Watcher> watcher_;
  std::vector<QueueEvent> events_;
  TimePoint now_{std::chrono::hours(1)};
};

TEST_F(WatcherTest, DeedsAndTheirEvents) {
  // What is there when the watcher starts, what is done then, and what it reports.
  const char* const cases[][4] = {
      {"File", "> a", "> f; echo >> a; chmod 600 f; rm f",
       "create f, write f, write a, attr f, delete f"},
      {"Links", "> f; > ../out/o", "ln f g; ln -s ../out l; > ../out/o", "create g, create l"},
      {"Attributes", "mkdir d", "chmod 700 d; chmod 700 .", "attr d/, attr ./"},
      {"Folder", "mkdir -p d/e x", "mv d x; > x/d/e/f; rm -r x/d/e",
       "rename d/ x/d/, create x/d/e/f, write x/d/e/f, delete x/d/e/f, delete x/d/e/"},
      {"NewAtOnce", "", "mkdir -p a/b/c; > a/b/c/f",
       "create a/, create a/b/, create a/b/c/, create a/b/c/f"},
      {"MovedOut", "mkdir d; > f; > d/g", "mv d f ../out; > ../out/d/h; > a",
       "delete d/, delete f, create a, write a"},
      {"ExtraFolder", "mkdir -p d/@eaDir/x; > f",
       "> d/@eaDir/x/f; mkdir @eaDir; chmod 700 @eaDir; mv f @eaDir; mv @eaDir e",
       "delete f, create e/, create e/f"},
      {"OwnFiles", "> f; mkdir ../out/m; > ../out/m/q",
       "> q.tmp; mv q.tmp q; mv f q; rm q; mv ../out/m .", "delete f, create m/"},
  };
  for (const auto& [name, before, deeds, want] : cases) {
    SCOPED_TRACE(name);
    Clear();
    Do(before);
    Start({in_}, {.ignored = {in_ + "/q", in_ + "/q.tmp", in_ + "/m/q"}});
    Do(deeds);
    EXPECT_EQ(Text(Take()), want);
    EXPECT_TRUE(watcher_->State().live) << watcher_->State().text;
  }
}

TEST_F(WatcherTest, RootsThatCannotBeWatched) {
  Do("> f; ln -s ../out l");
  for (const std::string path : {"/none", "/f", "/l", "/", "/../in", "//"}) {
    EXPECT_ANY_THROW(Start({in_ + path})) << path;
  }
  EXPECT_ANY_THROW(Start({"in"}));
}

TEST_F(WatcherTest, NamesAreBytesAndPathsHaveAnyLength) {
  Do("");
  const std::string names[] = {"\xff\x80", "\n\"\\\x01", " ", std::string(255, 'n')};
  std::string path = in_;
  Fd at = OpenDirectory(path);
  Start({in_});
  for (size_t level = 0; level < 80; ++level) {
    ASSERT_EQ(mkdirat(at.Get(), names[level % 4].c_str(), 0755), 0);
    at = OpenDirectory(at.Get(), names[level % 4]);
    path += "/" + names[level % 4];
    events_ = level < 40 ? Take() : events_;  // What follows is found by reading.
  }
  Take();
  close(openat(at.Get(), "f", O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
  const std::vector<QueueEvent> events = Take();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].path, path + "/f");
}

TEST_F(WatcherTest, FoldersBeyondTheLimitAreLookedAt) {
  Do("mkdir a b c d");
  Start({in_}, {.max_watches = 3});
  EXPECT_FALSE(watcher_->State().live);
  EXPECT_TRUE(watcher_->State().text.starts_with("2 folders of 5 not watched, but looked at "));
  // Whichever the two are: each change is told, at once or by the next look.
  for (const std::string deed : {"> $d/f", "echo > $d/f", "chmod 600 $d/f", "rm $d/f"}) {
    Do("for d in *; do " + deed + "; done");
    const std::string text = Text(Take()) + ", " + Text(Take(kRescan)) + ",";
    for (const std::string folder : {"a", "b", "c", "d"}) {
      EXPECT_NE(text.find(" " + folder + "/"), std::string::npos) << deed << " is not in " << text;
    }
    EXPECT_EQ(Text(Take(kRescan)), "");
  }
  Do("rm -r a b");
  Take(kRescan);
  Take(kRescan);
  EXPECT_TRUE(watcher_->State().live);
  Do("mkdir c/n d/n");
  EXPECT_EQ(Text(Take()), "create c/n/, create d/n/");
}

// With a watch and without it: what is made in it meanwhile has been read by nobody.
TEST_F(WatcherTest, AFolderThatCannotBeOpenedForAMomentIsReadThen) {
  Do("mkdir d");
  Start({in_}, {.polls_roots = false});
  Take();
  rlimit files{};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &files), 0);
  const rlimit none{STDERR_FILENO + 1, files.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &none), 0);
  for (const char* const path : {"/new", "/new/e", "/d/f"}) {
    EXPECT_EQ(mkdir((in_ + path).c_str(), 0755), 0) << path;
  }
  Take();
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &files), 0);
  EXPECT_NE(watcher_->State().unreadable, 0u);
  const auto wait =
      std::chrono::duration_cast<std::chrono::seconds>(watcher_->NextDeadline() - now_);
  EXPECT_LE(wait, std::chrono::seconds(1));
  EXPECT_TRUE(Text(Take(std::chrono::seconds(1))).ends_with("reindex ./"));
  EXPECT_EQ(watcher_->State().unreadable, 0u);
  EXPECT_EQ(watcher_->NextDeadline(), TimePoint::max());
  Do("> new/e/g; > d/f/g");
  EXPECT_EQ(Text(Take()), "create new/e/g, write new/e/g, create d/f/g, write d/f/g");
}

TEST_F(WatcherTest, HintsShortenTheWaitForThem) {
  Do("mkdir -p a b/c");
  Start({in_}, {.max_watches = 1, .takes_hints = true});
  if (watcher_->State().text.find("looked at after changes in them and every 30 s") ==
      std::string::npos) {
    GTEST_SKIP() << "not permitted here: " << watcher_->State().text;
  }
  Take();
  Do("> a/f; > b/c/f; > ../out/f; chmod 700 b");
  EXPECT_EQ(Text(Take()), "attr b/") << "they are not looked at for each event";
  std::vector<QueueEvent> events = Take(std::chrono::seconds(2));
  std::sort(events.begin(), events.end(),
            [](const QueueEvent& left, const QueueEvent& right) { return left.path < right.path; });
  EXPECT_EQ(Text(events), "reindex a/, reindex b/c/");
  for (const auto& [deeds, want] : {std::pair{"rm -r b/c; mkdir a/d; > a/d/f", "reindex a/"},
                                    {"echo more > a/d/f", "reindex a/d/"}}) {
    Do(deeds);
    EXPECT_EQ(Text(Take()), "");
    EXPECT_NE(Text(Take(std::chrono::seconds(2))).find(want), std::string::npos) << deeds;
  }
  EXPECT_LT(watcher_->NextDeadline(), now_ + kRescan);
}

TEST_F(WatcherTest, RootThatGoesAndComesBack) {
  const std::pair<const char*, const char*> cases[] = {
      {"rm -r r", "mkdir -p r/d"},
      {"mv r ../out", "mv ../out/r ."},
      {"mv ../in ../out", "rm -r ../in; mv ../out/in .."}};
  for (const auto& [goes, comes] : cases) {
    SCOPED_TRACE(goes);
    Clear();
    Do("mkdir -p r/d/below");
    Start({in_ + "/r", out_, in_ + "/r/d", out_});
    Do(goes);
    const std::string text = ", " + Text(Take()) + ", " + Text(Take(kRescan)) + ",";
    EXPECT_NE(text.find(", delete r/,"), std::string::npos) << text;
    EXPECT_EQ(text.find(", delete r/,"), text.rfind(", delete r/,")) << text;
    EXPECT_FALSE(watcher_->State().live);
    EXPECT_EQ(watcher_->State().text, in_ + "/r is gone");
    Do(comes);
    Take();
    EXPECT_EQ(Text(Take(kRescan)), "create r/");
    EXPECT_TRUE(watcher_->State().live);
    Do("mkdir r/d/n");
    EXPECT_EQ(Text(Take()), "create r/d/n/");
  }
  // Another folder in its place is a new one.
  Do("mv r ../out; mkdir -p r/e");
  Take();
  Take(kRescan);
  Do("touch r/e/new ../out/r/d/elsewhere");
  EXPECT_EQ(Text(Take()).substr(0, 14), "create r/e/new");
}

// As far as a look at it goes, the new folder is the old one.
TEST_F(WatcherTest, ARootThatIsMadeAnewWithItsInodeIsFoundAtOnce) {
  Do("mkdir r");
  Start({in_ + "/r"}, {.polls_roots = false});
  struct stat before {};
  struct stat after {};
  ASSERT_EQ(stat((in_ + "/r").c_str(), &before), 0);
  for (int i = 0; i < 100 && after.st_ino != before.st_ino; ++i) {
    Do("rmdir r; mkdir r");
    ASSERT_EQ(stat((in_ + "/r").c_str(), &after), 0);
  }
  if (after.st_ino != before.st_ino) {
    GTEST_SKIP() << "this file system gives no inode out again";
  }
  watcher_->CheckRoots(now_);
  EXPECT_EQ(Text(Take()), "delete r/, create r/");
  EXPECT_TRUE(watcher_->State().gone.empty());
  Do("> r/f");
  EXPECT_EQ(Text(Take()), "create r/f, write r/f");
}

TEST_F(WatcherTest, RootsComeAndGoWithoutAGapForTheOthers) {
  Do("mkdir -p a b/bin b/c");
  Start({in_ + "/a"}, {.ignored_names = {"bin"}, .takes_missing_roots = true});
  Do("mkdir a/d");
  for (const char* const path : {"/b", "/later", "/b/c"}) {
    EXPECT_TRUE(watcher_->AddRoot(in_ + path, now_)) << path;
  }
  EXPECT_FALSE(watcher_->AddRoot(in_ + "/b/c", now_)) << "is one already";
  EXPECT_FALSE(watcher_->AddRoot(in_, now_)) << "others are below it";
  EXPECT_ANY_THROW(watcher_->AddRoot(in_ + "/b/../x", now_));
  EXPECT_EQ(watcher_->State().gone, std::vector<std::string>{in_ + "/later"});
  Do("> b/c/f; > b/bin/f; mkdir later");
  watcher_->CheckRoots(now_);
  EXPECT_EQ(Text(Take()), "create later/, create a/d/, create b/c/f, write b/c/f");
  EXPECT_TRUE(watcher_->RemoveRoot(in_ + "/a"));
  EXPECT_FALSE(watcher_->RemoveRoot(in_ + "/a"));
  EXPECT_FALSE(watcher_->RemoveRoot(in_ + "/b")) << "the one below would go with it";
  EXPECT_TRUE(watcher_->RemoveRoot(in_ + "/b/c"));
  Do("> a/g; > b/g");
  EXPECT_EQ(Text(Take()), "create b/g, write b/g");
}

TEST_F(WatcherTest, ARootMayLieInWhatIsIgnored) {
  Do("mkdir -p @eaDir/d/@eaDir b/c");
  Start({in_, in_ + "/@eaDir/d", in_ + "/b/c"});
  EXPECT_EQ(watcher_->State().watched, 4u);
  Do("> @eaDir/d/f; > @eaDir/f; > @eaDir/d/@eaDir/f; > b/c/f");
  EXPECT_EQ(Text(Take()), "create @eaDir/d/f, write @eaDir/d/f, create b/c/f, write b/c/f");
}

TEST_F(WatcherTest, ARootBehindALinkInAnotherIsOneOfItsOwn) {
  Do("mkdir -p ../out/c a/d; ln -s ../out link");
  Start({in_, in_ + "/link/c", in_ + "/a/d"});
  Do("> link/c/f; > a/d/f");
  EXPECT_EQ(Text(Take()), "create link/c/f, write link/c/f, create a/d/f, write a/d/f");
}

TEST_F(WatcherTest, WithoutPollingOfRootsThereIsNoDeadlineAtRest) {
  Do("mkdir a");
  Start({in_ + "/a", in_ + "/b"}, {.takes_missing_roots = true, .polls_roots = false});
  Take();
  EXPECT_NE(watcher_->NextDeadline(), TimePoint::max()) << "one is gone";
  Do("mkdir b");
  EXPECT_EQ(Text(Take(kRescan)), "create b/");
  EXPECT_EQ(watcher_->NextDeadline(), TimePoint::max());
  Do("> a/f");
  Take();
  EXPECT_EQ(watcher_->NextDeadline(), TimePoint::max());
}

TEST(QueueLineTest, EveryByteOfANameComesBack) {
  EXPECT_EQ(QueueLine({kMaskRename, true, "/b", "/a"}),
            R"({"event":256,"is_dir":true,"path":"/b","path_old":"/a","data":null})"
            "\n");
  std::string bytes;
  while (bytes.size() < 255) {
    bytes += static_cast<char>(bytes.size() + 1);
  }
  const std::string line = QueueLine({kMaskCreate, false, bytes + bytes, ""});
  EXPECT_EQ(line.find('\n'), line.size() - 1);
  Json::Value value;
  ASSERT_TRUE(JsonFromString(value, line));
  EXPECT_EQ(value["path"].asString(), bytes + bytes);
}

// What a reader of the events knows: it believes them, and looks only where they tell it to.
struct Reader {
  explicit Reader(const std::string& root) { Look(root); }

  void Apply(const QueueEvent& event) {
    if (event.mask == kMaskCreate) {
      entries[event.path] = event.is_dir;
    } else if (event.mask == kMaskRename) {
      const std::map<std::string, bool> moved = Forget(event.path_old);
      Forget(event.path);
      for (const auto& [rest, is_dir] : moved) {
        entries[event.path + rest] = is_dir;
      }
      if (moved.empty()) {
        Look(event.path);
      }
    } else if (event.mask == kMaskDelete) {
      Forget(event.path);
    } else if (event.mask == kMaskReindex || event.mask == kMaskCrashed) {
      Look(event.path);
    }
  }

  std::map<std::string, bool> entries;  // Paths; true for folders.

  void Look(const std::string& path) {
    Forget(path);
    if (fs::exists(path) && !path.ends_with("/@eaDir")) {
      entries[path] = fs::is_directory(path);
      std::error_code no_folder;
      for (const fs::directory_entry& entry : fs::directory_iterator(path, no_folder)) {
        Look(entry.path());
      }
    }
  }
  std::map<std::string, bool> Forget(const std::string& path) {
    std::map<std::string, bool> gone;
    std::erase_if(entries, [&](const auto& entry) {
      const bool below = (entry.first + "/").starts_with(path + "/");
      return below && gone.emplace(entry.first.substr(path.size()), entry.second).second;
    });
    return gone;
  }
};

// A deed somewhere in two folders; it fails as often as it makes no sense.
void DoRandom(const std::string& base, std::mt19937& random) {
  const auto place = [&] {
    std::string path = base + (random() % 5 == 0 ? "/out" : "/in");
    for (size_t depth = 1 + random() % 4; depth > 0; --depth) {
      path += random() % 40 == 0 ? "/@eaDir" : std::string("/") + "abc"[random() % 3];
    }
    return path;
  };
  const std::string a = place();
  const std::string b = place();
  std::error_code ignored;
  const size_t kind = random() % 40;
  (void)(kind < 14   ? mkdir(a.c_str(), 0755)
         : kind < 18 ? close(open(a.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644))
         : kind < 31 ? rename(a.c_str(), b.c_str())
         : kind < 33 ? renameat2(AT_FDCWD, a.c_str(), AT_FDCWD, b.c_str(), RENAME_EXCHANGE)
         : kind < 35 ? static_cast<int>(fs::remove_all(a, ignored))
                     : remove(a.c_str()));
}

TEST_F(WatcherTest, AReaderOfTheEventsKnowsTheTree) {
  size_t limit = 0;
  std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> limit;
  const std::string file = in_ + "/file";
  // The most watches, how many seeds, and the events that are lost in every 20th round.
  const size_t cases[][3] = {{0, 60, 0}, {5, 30, 0}, {0, 4, std::min<size_t>(limit, 100000) + 2}};
  for (const auto& [max_watches, seeds, lost] : cases) {
    for (size_t seed = 1; seed <= seeds; ++seed) {
      Clear();
      Start({in_}, {.max_watches = max_watches});
      Reader reader(in_);
      std::mt19937 random(static_cast<uint32_t>(seed));
      for (int round = 0; round < 60; ++round) {
        const bool flood = lost > 0 && round % 20 == 9;
        for (size_t i = 0; flood && i < lost; i += 2) {
          close(open(file.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
          chmod(in_.c_str(), 0755);
        }
        for (size_t i = flood ? 40 : random() % 8; i > 0; --i) {
          DoRandom(base_.Path(), random);
        }
        const std::vector<QueueEvent> events = max_watches == 0 ? Take() : Take(kRescan);
        for (const QueueEvent& event : events) {
          reader.Apply(event);
        }
        EXPECT_EQ(Text(events).find("crashed") != std::string::npos, flood);
        ASSERT_EQ(reader.entries, Reader(in_).entries)
            << max_watches << " " << lost << " " << seed << " " << round << ": " << Text(events);
      }
    }
  }
}

}  // namespace
}  // namespace vexlo::watch
