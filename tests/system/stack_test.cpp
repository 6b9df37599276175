// The whole stack in hard times: more changes than the kernel keeps, fewer watches than folders, no
// room, no share. What the disk holds is found in the end, and nothing before its time.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>

#include "fileindex/status_mgr.h"
#include "support/index_listing.h"
#include "support/private_mounts.h"
#include "support/stack.h"

namespace {

namespace fs = std::filesystem;
using std::to_string;

const PrivateRoot kRoot;

// Waits for the index to be what the disk is, with these tokens.
testing::AssertionResult AwaitSame(const Stack& stack, const std::set<std::string>& tokens = {},
                                   std::chrono::seconds patience = std::chrono::seconds(120)) {
  std::string differences;
  const auto is_same = [&] {
    try {
      Listing disk = ListDisk(stack.In());
      std::erase_if(disk.tokens, [&](const auto& row) { return !tokens.contains(row.first); });
      differences = Differences(disk, ListIndex("docs", tokens));
    } catch (const std::exception& error) {
      differences = error.what();
    }
    return differences.empty();
  };
  if (Stack::Await(is_same, patience)) {
    return testing::AssertionSuccess();
  }
  return testing::AssertionFailure() << differences << stack.Logs();
}

// A file with a token of its own, in a folder that is made.
std::string MakeFile(const std::string& path, int number) {
  fs::create_directories(fs::path(path).parent_path());
  char token[32];
  snprintf(token, sizeof(token), "q%015d", number);
  WriteText(path, token);
  return token;
}

// A hundred of them in five folders.
std::set<std::string> MakeFiles(const std::string& folder) {
  std::set<std::string> tokens;
  for (int i = 0; i < 100; ++i) {
    tokens.insert(MakeFile(folder + "/" + to_string(i % 5) + "/" + to_string(i) + ".txt", i));
  }
  return tokens;
}

// Waits until the lines of the last of them are queued.
bool AwaitQueued(const Stack& stack) {
  return Stack::Await([&] {
    std::string lines;
    for (const auto& entry : fs::directory_iterator(stack.QueueFolder())) {
      lines += ReadText(entry.path());
    }
    return lines.find("99.txt") != std::string::npos;
  });
}

bool AwaitState(const Stack& stack, const char* state) {
  return Stack::Await([&] { return stack.Indexing()["state"] == state; });
}

TEST(Stack, FindsMoreNewFilesThanTheKernelKeepsEventsOf) {
  constexpr int kFiles = 20000;
  constexpr int kFolders = 50;
  Stack stack(kRoot);
  for (int i = 0; i < kFolders; ++i) {
    fs::create_directory(stack.In() + "/" + to_string(i));
  }
  ASSERT_TRUE(stack.AwaitQuiet());
  stack.Signal("evnotifyd", SIGSTOP);
  std::set<std::string> tokens;
  for (int i = 0; i < kFiles; ++i) {
    const std::string folder = stack.In() + "/" + to_string(i % kFolders);
    const std::string token = MakeFile(folder + "/" + to_string(i) + ".txt", i);
    if (i % 1999 == 0) {
      tokens.insert(token);
    }
  }
  stack.Signal("evnotifyd", SIGCONT);
  EXPECT_TRUE(stack.AwaitQuiet());
  EXPECT_TRUE(AwaitSame(stack, tokens));
  EXPECT_GT(stack.Watching()["overflows"].asInt(), 0);
}

TEST(Stack, FindsWhatCannotBeWatched) {
  constexpr int kFolders = 1000;
  Stack stack(kRoot, {{"evnotifyd", "--max-watches 10 --rescan 1"}});
  const auto folder = [&](int i) {
    return stack.In() + "/" + to_string(i % 100) + "/" + to_string(i);
  };
  for (int i = 0; i < kFolders; ++i) {
    MakeFile(folder(i) + "/a.txt", i);
  }
  std::set<std::string> tokens = {MakeFile(stack.In() + "/0/0/b.txt", kFolders)};
  EXPECT_TRUE(Stack::Await([&] { return stack.Watching()["state"] == "degraded"; }));
  EXPECT_TRUE(AwaitSame(stack, tokens));
  // The index daemon may have found all before the notify daemon has counted all.
  Json::Value watching;
  EXPECT_TRUE(Stack::Await([&] {
    watching = stack.Watching();
    return watching["reason"].asString().find("1101") != std::string::npos;
  })) << watching["reason"].asString();
  EXPECT_EQ(watching["state"], "degraded");
  EXPECT_LE(watching["watches"].asInt(), 10);
  // Changes deep below, which only a look at the folders tells.
  for (int i = 0; i < kFolders; i += 97) {
    tokens.insert(MakeFile(folder(i) + "/c.txt", 2 * kFolders + i));
    fs::remove(folder(i) + "/a.txt");
  }
  EXPECT_TRUE(AwaitSame(stack, tokens));
}

TEST(Stack, LosesNothingToAFullDisk) {
  const std::string state = kRoot / "var/lib/kavo";
  std::unique_ptr<ScopedMount> disk;  // Goes last.
  Stack stack(kRoot, {}, [&] {
    fs::create_directories(state);
    disk = std::make_unique<ScopedMount>("tmpfs", state, "tmpfs", 0, "size=8m");
    kRoot.MakeFolder("var/lib/kavo/fileindex/queue");
    kRoot.MakeFolder("var/lib/kavo/fileindex/db");
    kRoot.MakeFolder("var/lib/kavo/evnotify");
  });
  SKIP_IF_REFUSED(*disk);
  ASSERT_TRUE(stack.AwaitQuiet());
  std::set<std::string> tokens = {MakeFile(stack.In("gone.txt"), 1),
                                  MakeFile(stack.In("changed.txt"), 2)};
  EXPECT_TRUE(AwaitSame(stack, tokens));
  const std::string ballast = state + "/ballast";
  std::ofstream(ballast) << std::string(size_t{16} << 20, 'x');
  // More than the room that is left in the engine's pages.
  for (int i = 0; i < 2000; ++i) {
    const std::string token =
        MakeFile(stack.In(to_string(i % 20) + "/" + to_string(i) + ".txt"), 10 + i);
    if (i % 100 == 0) {
      tokens.insert(token);
    }
  }
  fs::remove(stack.In("gone.txt"));
  tokens.insert(MakeFile(stack.In("changed.txt"), 3));
  const auto is_noticed = [&] {
    return stack.Indexing()["state"] == "failing" ||
           stack.Watching()["reason"].asString().find("No space") != std::string::npos;
  };
  EXPECT_TRUE(Stack::Await(is_noticed)) << stack.Logs();
  fs::remove(ballast);
  EXPECT_EQ(stack.Tool("resume"), 0);  // Or it looks for room once a minute.
  EXPECT_TRUE(AwaitSame(stack, tokens));
}

TEST(Stack, KeepsAShareThatGoesAwayAndComesBack) {
  Stack stack(kRoot);
  std::set<std::string> tokens = MakeFiles(stack.In());
  ASSERT_TRUE(stack.AwaitQuiet());
  EXPECT_TRUE(AwaitSame(stack, tokens));
  const Listing before = ListIndex("docs", tokens);
  const std::string away = kRoot / "vol/away";
  fs::rename(stack.Share(), away);
  EXPECT_TRUE(Stack::Await([&] { return stack.Watching()["state"] == "degraded"; }));
  EXPECT_TRUE(AwaitState(stack, "unavailable")) << stack.Logs();
  EXPECT_EQ(Differences(before, ListIndex("docs", tokens)), "");
  // What changes where nobody looks.
  tokens.insert(MakeFile(away + "/in/3/new.txt", 1000));
  fs::remove_all(away + "/in/2");
  fs::rename(away + "/in/4", away + "/in/renamed");
  fs::rename(away, stack.Share());
  EXPECT_TRUE(AwaitSame(stack, tokens));
  ASSERT_TRUE(stack.AwaitQuiet());
  EXPECT_TRUE(AwaitSame(stack, tokens));
}

TEST(Stack, TakesUpAVolumeThatIsUnmountedAndMountedAgain) {
  Stack stack(kRoot);
  const std::string volume = kRoot / "vol/volume";
  std::set<std::string> tokens = MakeFiles(volume + "/in");
  for (int i = 0; i < 3; ++i) {
    const ScopedMount mount = ScopedMount::Bind(volume, stack.Share());
    SKIP_IF_REFUSED(mount);
    EXPECT_TRUE(AwaitSame(stack, tokens));
    fs::rename(volume + "/in/0", volume + "/in/00");
    tokens.insert(MakeFile(volume + "/in/3/" + to_string(i) + "new.txt", 1000 + i));
    fs::remove_all(volume + "/in/" + to_string(4 - i));
    fs::rename(volume + "/in/00", volume + "/in/0");
  }
  EXPECT_TRUE(AwaitSame(stack, tokens));  // The folder below the mount.
}

TEST(Stack, TakesAMountedShareAndNothingThatIsMountedInIt) {
  Stack stack(kRoot);
  const std::string volume = kRoot / "vol/mounted";
  std::set<std::string> tokens = MakeFiles(volume + "/in");
  fs::create_directory(volume + "/in/inner");
  MakeFile(kRoot / "vol/other/a/b.txt", 500);
  const ScopedMount mount = ScopedMount::Bind(volume, stack.Share());
  SKIP_IF_REFUSED(mount);
  ASSERT_TRUE(AwaitSame(stack, tokens));
  vexlo::fileindex::StatusMgr().SetShareStatus("docs", 3);
  EXPECT_EQ(stack.Tool("folder reindex /docs/in"), 0);
  ASSERT_TRUE(stack.AwaitQuiet());
  EXPECT_TRUE(AwaitSame(stack, tokens)) << "the index is made anew";
  EXPECT_EQ(stack.Tool("audit"), 0);
  const ScopedMount inner = ScopedMount::Bind(kRoot / "vol/other", stack.In("inner"));
  MakeFile(stack.In("inner/a/c.txt"), 501);
  tokens = {MakeFile(stack.In("seen.txt"), 502)};
  EXPECT_TRUE(
      Stack::Await([&] { return ListIndex("docs", tokens).tokens.size() == tokens.size(); }));
  ASSERT_TRUE(stack.AwaitQuiet());
  for (const auto& [path, facts] : ListIndex("docs", {}).paths) {
    EXPECT_FALSE(path.starts_with(stack.In("inner/"))) << path;
  }
  EXPECT_EQ(stack.Tool("audit"), 0);
}

TEST(Stack, ReadsLaterWhatNobodyCouldRead) {
  Stack stack(kRoot);
  ASSERT_TRUE(stack.AwaitQuiet());
  stack.End("kavocontentextractd", SIGKILL);
  std::set<std::string> tokens;
  for (int i = 0; i < 20; ++i) {
    tokens.insert(MakeFile(stack.In() + "/" + to_string(i) + ".html", i));
  }
  EXPECT_TRUE(stack.AwaitQuiet());
  // By their names at least.
  EXPECT_TRUE(AwaitSame(stack));
  EXPECT_TRUE(ListIndex("docs", tokens).tokens.empty());
  fs::rename(stack.In() + "/7.html", stack.In() + "/seven.html");
  stack.Restart("fileindexd", SIGKILL);
  stack.Start("kavocontentextractd");
  EXPECT_TRUE(AwaitSame(stack, tokens));
}

// All is queued, also when the daemon was away, and none of it done before its time.
TEST(Stack, RestsWhilePausedOrWhileTheShareCannotBeIndexed) {
  for (const std::string why : {"paused", "encrypted", "read_only"}) {
    SCOPED_TRACE(why);
    Stack stack(kRoot);
    ASSERT_TRUE(stack.AwaitQuiet());
    const Listing before = ListIndex("docs", {});
    const bool is_pause = why == "paused";
    if (is_pause) {
      EXPECT_EQ(stack.Tool("pause"), 0);
      ASSERT_TRUE(AwaitState(stack, "paused"));
    } else {
      stack.SetShare(",\"" + why + "\":true");
    }
    const std::set<std::string> tokens = MakeFiles(stack.In());
    stack.Restart("fileindexd", SIGKILL);
    ASSERT_TRUE(AwaitState(stack, is_pause ? "paused" : "unavailable")) << stack.Logs();
    ASSERT_TRUE(AwaitQueued(stack));
    EXPECT_EQ(Differences(before, ListIndex("docs", tokens)), "");
    if (is_pause) {
      EXPECT_EQ(stack.Tool("resume"), 0);
    } else {
      stack.SetShare("");
      stack.Command(
          R"({"type":"notify_setting_changed","data":{"share_name":"docs","is_upsert":true}})");
    }
    EXPECT_TRUE(AwaitSame(stack, tokens));
  }
}

}  // namespace
