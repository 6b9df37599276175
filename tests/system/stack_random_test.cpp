// Random changes under the whole stack: whatever happens, and whoever is killed at it, the index
// comes to be what the disk is.
//
// FILEINDEX_STACK_SEEDS says how many seeds each test takes (unset: as many as fit),
// FILEINDEX_STACK_KILLS at how many moments something is killed, and FILEINDEX_STACK_FIRST the
// first seed (1).
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>

#include <algorithm>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <map>

#include "common/error.h"
#include "common/sdk/share.h"
#include "faults/every_fault.h"
#include "fileindex/folder_mgr.h"
#include "kavo/local/monitor_queues.h"
#include "kavo/monitor_queue.h"
#include "support/index_listing.h"
#include "support/random_tree.h"
#include "support/stack.h"

namespace {

const PrivateRoot kRoot;
constexpr std::chrono::seconds kTimeOfATest{10};
constexpr std::chrono::seconds kTimeOfKills{90};
constexpr unsigned kFewestSeeds = 3;
constexpr int kChanges = 60;
// None where the sanitizers need themselves the functions whose place the module takes.
constexpr bool kHasModule = *FAIL_NTH_MODULE != '\0';
constexpr unsigned kKillsOfARun = 25;

unsigned FromEnvironment(const char* name, unsigned otherwise) {
  const char* const text = getenv(name);  // NOLINT(concurrency-mt-unsafe): one thread.
  if (text != nullptr) {
    std::from_chars(text, text + strlen(text), otherwise);
  }
  return otherwise;
}

// Calls test(seed) for as many as are wanted, or fit, up to the first that fails.
template <typename Test>
void ForSeeds(const Test& test) {
  const auto until = Stack::Clock::now() + kTimeOfATest;
  const unsigned first = FromEnvironment("FILEINDEX_STACK_FIRST", 1);
  const unsigned count = FromEnvironment("FILEINDEX_STACK_SEEDS", 0);
  unsigned done = 0;
  while (!testing::Test::HasFailure() &&
         (count > 0 ? done < count : done < kFewestSeeds || Stack::Clock::now() < until)) {
    test(first + done++);
  }
  printf("%u seeds\n", done);
  testing::Test::RecordProperty("seeds", static_cast<int>(done));
}

void Empty(const std::string& folder) {
  for (const auto& entry : std::filesystem::directory_iterator(folder)) {
    std::filesystem::remove_all(entry);
  }
}

// Another queue that is fed with all that happens, and that nobody takes.
std::string HistoryFile() { return kRoot / "logs/history"; }
void RecordHistory(const Stack& stack) {
  Json::Value description;
  description["queue"] = HistoryFile();
  Json::Value folder;
  folder["path"] = stack.In();
  folder["mask"] = 0xFFCC;
  folder["ignore"].append("@eaDir");
  description["config"].append(folder);
  WriteText(HistoryFile(), "");
  ASSERT_TRUE(EVNOTIFYD::MonitorQueue::Upsert(EVNOTIFYD::MonitorQueue(description), "history",
                                              EVNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION));
}

// Waits until there is nothing left to do, and then for the index to be what the disk is.
void ExpectIndexed(Stack& stack, const RandomTree& tree) {
  EXPECT_TRUE(stack.AwaitQuiet()) << tree.Text();
  std::string differences;
  const auto is_same = [&] {
    try {
      differences = Differences(ListDisk(stack.In()), ListIndex("docs", tree.Tokens()));
    } catch (const vexlo::Error& error) {  // The question may be what a fault meets.
      differences = error.what();
    }
    return differences.empty();
  };
  // Texts that nobody was there to read are asked for once a minute in the end.
  EXPECT_TRUE(Stack::Await(is_same, std::chrono::seconds(90)))
      << differences << tree.Text() << ReadText(HistoryFile()) << stack.Logs();
}

TEST(Stack, FollowsRandomChanges) {
  Stack stack(kRoot);
  RecordHistory(stack);
  ForSeeds([&](unsigned seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Empty(stack.In());
    Empty(stack.Out());
    std::filesystem::resize_file(HistoryFile(), 0);
    RandomTree tree(stack.In(), stack.Out(), seed);
    // From all at once to each in another cycle.
    const unsigned longest_pause = tree.Below(3) * 5000;
    for (int i = 0; i < kChanges; ++i) {
      tree.Change();
      usleep(tree.Below(longest_pause + 1));
    }
    ExpectIndexed(stack, tree);
  });
}

// A daemon whose Nth call fails does its work all the same, or ends with an error and is started
// anew.
TEST(Stack, LosesNothingToFaults) {
  if (!kHasModule) {
    GTEST_SKIP() << "the module takes the place of functions that the sanitizers need themselves";
  }
  Stack stack(kRoot);
  RecordHistory(stack);
  const std::vector<std::string> names = {"fileindexd", "kavoelasticd"};
  const std::string report = kRoot / "tmp/fault";
  unsigned done = 0;
  unsigned reached = 0;
  ForSeeds([&](unsigned seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Empty(stack.In());
    Empty(stack.Out());
    std::filesystem::resize_file(HistoryFile(), 0);
    RandomTree tree(stack.In(), stack.Out(), seed);
    // Not the first: for a full disk the index daemon waits a minute.
    const FaultKind& kind = kFaultKinds[1 + tree.Below(std::size(kFaultKinds) - 1)];
    const std::string& name = names[tree.Below(static_cast<unsigned>(names.size()))];
    // Rather an early one, as few calls of some kinds are made.
    const unsigned at = 1 + tree.Below(1 + tree.Below(kind.error == ENOMEM ? 30000 : 300));
    SCOPED_TRACE(name + ", " + kind.name + ", call " + std::to_string(at));
    EXPECT_EQ(stack.End(name, SIGTERM), 0);
    stack.Start(name, "env LD_PRELOAD=" FAIL_NTH_MODULE " FAIL_CALLS=" + std::string(kind.calls) +
                          " FAIL_ERROR=" + std::to_string(kind.error) +
                          " FAIL_AT=" + std::to_string(at) + " FAIL_REPORT=" + report + " ");
    for (int i = 0; i < kChanges / 4; ++i) {
      tree.Change();
      usleep(tree.Below(20000));
    }
    // Whoever looks after the daemons starts anew what has ended.
    // Without memory it may end as if it were killed.
    if (stack.HasEnded(name)) {
      const int status = stack.End(name, 0);
      EXPECT_TRUE(status < 128 || (kind.error == ENOMEM && status == 128 + SIGABRT))
          << status << stack.Logs();
      stack.Start(name);
    }
    ExpectIndexed(stack, tree);
    EXPECT_LT(stack.End(name, SIGTERM), 128) << stack.Logs();
    stack.Start(name);
    ++done;
    reached += std::filesystem::remove(report) ? 1 : 0;
  });
  printf("%u of %u faults were reached\n", reached, done);
  EXPECT_GE(3 * reached, done);
}

// --- Kills

// A piece of work, and who is killed in it: instead of one of the next calls of these, the `most`
// at most that it makes.
struct Moment {
  const char* name;
  const char* victim;
  const char* calls;
  unsigned most;
  std::string_view command = {};  // Of the tool, to bring the work about, or to be killed itself.
};

constexpr char kTool[] = "fileindex";
constexpr char kAdd[] = "folder add ";
constexpr char kDelete[] = "folder delete ";
constexpr char kJudge[] = "judge";
constexpr char kWrites[] = ",open,write,truncate,sync,rename,unlink,flock,";
constexpr char kTalks[] = ",connect,send,recv,";
constexpr char kAll[] = ",open,write,truncate,sync,rename,unlink,flock,connect,send,recv,";
constexpr Moment kFolderMoments[] = {
    {"folder add", kTool, kAll, 60, kAdd},
    {"folder set", kTool, kAll, 60, "folder set "},
    {"folder delete", kTool, kAll, 60, kDelete},
};
constexpr Moment kMoments[] = {
    {"commit", "kavoelasticd", ",write,truncate,sync,", 30},
    {"request", "kavoelasticd", kTalks, 20},
    {"judge", kJudge, "", 0},
    {"snapshot and state", "fileindexd", kWrites, 5},
    {"rename and upsert", "fileindexd", kTalks, 12},
    {"crawl", "fileindexd", kTalks, 12, "folder reindex /docs/in"},
    {"append", "evnotifyd", kWrites, 4},
    {"extraction", "kavocontentextractd", ",open,read,send,recv,", 10},
    kFolderMoments[0],
    kFolderMoments[1],
    kFolderMoments[2],
};

// Through which a process learns at which call it is to die.
class DeathWarrant {
 public:
  explicit DeathWarrant(std::string file) : file_(std::move(file)) {
    WriteText(file_, std::string(sizeof(DeathOrder), '\0'));
    const int fd = open(file_.c_str(), O_RDWR | O_CLOEXEC);
    order_ = static_cast<DeathOrder*>(
        mmap(nullptr, sizeof(DeathOrder), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0));
    close(fd);
  }
  ~DeathWarrant() { munmap(order_, sizeof(DeathOrder)); }
  DeathWarrant(const DeathWarrant&) = delete;
  DeathWarrant& operator=(const DeathWarrant&) = delete;

  // To stand before the command of whom it is for.
  std::string Prefix() const {
    return !kHasModule ? "env " : "env LD_PRELOAD=" FAIL_NTH_MODULE " FAIL_DEATH=" + file_ + " ";
  }
  void Sign(const char* calls, unsigned at) {
    order_->left = 0;
    strncpy(order_->calls, calls, sizeof(order_->calls) - 1);
    order_->left = at;
  }
  void Withdraw() { order_->left = 0; }

 private:
  const std::string file_;
  DeathOrder* order_;
};

// What was done so far: of each moment, and to each process.
struct Tally {
  unsigned kills = 0;
  unsigned audits = 0;
  std::map<std::string, std::pair<unsigned, unsigned>> moments;  // At a call, and by the clock.
  std::map<std::string, unsigned> killed;

  void Print() const {
    printf("%-20s %9s %9s\n", "moment", "at a call", "by clock");
    for (const auto& [name, counts] : moments) {
      printf("%-20s %9u %9u\n", name.c_str(), counts.first, counts.second);
    }
    for (const auto& [name, count] : killed) {
      printf("%s killed %u times\n", name.c_str(), count);
    }
    printf("%u moments, %u audits, %s\n", kills, audits,
           testing::Test::HasFailure() ? "see above for what was lost" : "nothing lost");
  }
};

// Files change in the indexed folder, in one of the same share that is indexed at times, and in
// another share that is indexed at times.
class Torture {
 public:
  Torture(unsigned seed, Tally& tally)
      : tally_(tally),
        stack_(kRoot, {{"fileindexd", "--cycle 5"}},
               [] {
                 kRoot.MakeFolder("vol/docs/more");
                 kRoot.MakeFolder("vol/other");
               }),
        more_(kRoot / "vol/docs/more"),
        other_(kRoot / "vol/other"),
        tree_(stack_.In(), more_, seed, /*with_links=*/false),
        other_tree_(other_, more_, seed + 5'000'000, /*with_links=*/false) {
    stack_.SetShare(R"(},{"name":"other","path":")" + other_ + "\"");
    RecordHistory(stack_);
    for (const auto& [name, program] : kDaemonPrograms) {
      warrants_.emplace(name, kRoot / ("tmp/warrant." + name));
      stack_.End(name, SIGKILL);
      Start(name);
    }
    warrants_.emplace(kTool, kRoot / "tmp/warrant.tool");
    // Few kinds in one run, as what one of them does may hide what another one loses: a watcher
    // that starts has everything compared.
    for (unsigned i = 1 + tree_.Below(4); i > 0; --i) {
      moments_.push_back(&kMoments[tree_.Below(std::size(kMoments))]);
    }
    kills_more_ = tree_.Below(3);
  }

  void Kill() {
    Change(1 + tree_.Below(8));
    const Moment& moment = *moments_[tree_.Below(static_cast<unsigned>(moments_.size()))];
    std::set<std::string> killed;
    bool at_call = false;
    if (moment.victim == std::string(kTool)) {
      if (!KillTool(moment)) {
        return;
      }
      at_call = kHasModule;
      killed.insert(kTool);
    } else if (moment.victim == std::string(kJudge)) {
      if (!KillJudge()) {
        return;
      }
      tally_.killed[kJudge] += 1;
      killed.insert("kavoelasticd");
    } else {
      at_call = KillDaemon(moment);
      killed.insert(moment.victim);
    }
    ++(at_call ? tally_.moments[moment.name].first : tally_.moments[moment.name].second);
    ++tally_.kills;
    for (const auto& [name, program] : kDaemonPrograms) {
      if (tree_.Below(3) < kills_more_ && tree_.Below(3) == 0) {
        killed.insert(name);
        stack_.Signal(name, SIGKILL);
      }
    }
    for (const std::string& name : killed) {
      tally_.killed[name] += 1;
      if (name != kTool) {
        stack_.End(name, SIGKILL);
      }
    }
    killed.erase(kTool);
    while (!killed.empty()) {
      Change(tree_.Below(3));
      const auto next =
          std::next(killed.begin(), tree_.Below(static_cast<unsigned>(killed.size())));
      Start(*next);
      killed.erase(next);
    }
  }

  // A last command is cut short, and made good by the daemon. Then all that is listed is in the
  // index as it is on the disk.
  void Judge() {
    ++tally_.audits;
    while (!KillTool(kFolderMoments[tree_.Below(std::size(kFolderMoments))])) {
    }
    // A command that was cut short is made good first. Of a share without folders the watcher may
    // append a last line behind the removal of its queue.
    EXPECT_TRUE(Stack::Await([&] { return AreFoldersSettled(); })) << stack_.Logs();
    const auto remove_last_line = [] {
      if (!vexlo::fileindex::FolderMgr().HasFolder("/other")) {
        const std::string queue = vexlo::sdk::SDKShare("other").GetQueuePath();
        std::filesystem::remove(queue);
        std::filesystem::remove(queue + ".tmp");
      }
    };
    EXPECT_TRUE(stack_.AwaitQuiet(remove_last_line)) << tree_.Text();
    std::string differences;
    const auto is_same = [&] {
      try {
        differences = FindDifferences();
      } catch (const vexlo::Error& error) {  // The index may be still to be made.
        differences = error.what();
      }
      return differences.empty();
    };
    EXPECT_TRUE(Stack::Await(is_same, std::chrono::seconds(90)))
        << differences << tree_.Text() << other_tree_.Text() << ReadText(HistoryFile())
        << stack_.Logs();
    EXPECT_TRUE(
        Stack::Await([&] { return stack_.Tool("audit --grace 0") == 0; }, std::chrono::seconds(30)))
        << stack_.Logs();
  }

 private:
  static constexpr auto kPatience = std::chrono::milliseconds(40);

  void Start(const std::string& name) { stack_.Start(name, warrants_.at(name).Prefix()); }

  void Change(unsigned count) {
    for (; count > 0; --count) {
      (tree_.Below(4) == 0 ? other_tree_ : tree_).Change();
    }
  }

  // Whether those are registered that are listed, and no others, and the watcher knows.
  bool AreFoldersSettled() {
    const vexlo::fileindex::FolderMgr folders;
    std::set<std::string> listed;
    for (const auto& folder : folders.GetFolders()) {
      listed.insert(folder->GetFullPath());
    }
    std::set<std::string> watched;
    for (const auto& queue : kavo::local::ReadMonitorQueues().queues) {
      for (const auto& folder : queue.folders) {
        if (queue.app == "fileindex") {
          watched.insert(folder.path);
        }
      }
    }
    const std::string other = vexlo::sdk::SDKShare("other").GetQueuePath();
    const Json::Value queues = stack_.WatchedQueues();
    const bool feeds_other = std::any_of(queues.begin(), queues.end(),
                                         [&](const Json::Value& q) { return q["queue"] == other; });
    return listed == watched && !queues.empty() && feeds_other == folders.HasFolder("/other");
  }

  // False when it had to be killed by the clock.
  bool KillDaemon(const Moment& moment) {
    const std::string victim = moment.victim;
    warrants_.at(victim).Sign(moment.calls, 1 + tree_.Below(moment.most));
    if (!moment.command.empty()) {
      stack_.Tool(std::string(moment.command));
    }
    Change(1 + tree_.Below(4));
    const auto until = Stack::Clock::now() +
                       (!kHasModule ? std::chrono::milliseconds(tree_.Below(30)) : kPatience);
    while (!stack_.HasEnded(victim) && Stack::Clock::now() < until) {
      usleep(100);
    }
    const bool has_ended = stack_.HasEnded(victim);
    stack_.Signal(victim, SIGKILL);
    warrants_.at(victim).Withdraw();
    return has_ended;
  }

  // False when it was done before that.
  bool KillTool(const Moment& moment) {
    const bool is_more = tree_.Below(2) == 0;
    const std::string folder = is_more ? more_ : other_;
    const bool adds = moment.command == kAdd;
    if (vexlo::fileindex::FolderMgr().HasFolder(is_more ? "/docs/more" : "/other") == adds) {
      stack_.Tool((adds ? kDelete : kAdd) + folder);
    }
    const std::string types = tree_.Below(2) == 0 ? " --types document" : " --types document,photo";
    warrants_.at(kTool).Sign(moment.calls, 1 + tree_.Below(moment.most));
    return stack_.Tool(
               std::string(moment.command) + folder + (moment.command == kDelete ? "" : types),
               warrants_.at(kTool).Prefix(),
               kHasModule ? std::chrono::seconds(60)
                          : std::chrono::milliseconds(1 + tree_.Below(30))) == 128 + SIGKILL;
  }

  bool KillJudge() {
    const std::string engine = std::to_string(stack_.Pid("kavoelasticd"));
    std::ifstream children("/proc/" + engine + "/task/" + engine + "/children");
    pid_t judge = 0;
    if (!(children >> judge)) {
      return false;
    }
    kill(judge, SIGKILL);
    EXPECT_TRUE(Stack::Await([&] { return stack_.HasEnded("kavoelasticd"); }));
    return true;
  }

  std::string FindDifferences() const {
    Listing disk;
    Listing index;
    std::set<std::string> tokens = tree_.Tokens();
    const vexlo::fileindex::FolderMgr folders;
    for (const auto& folder : folders.GetFolders()) {
      Listing listing = ListDisk(folder->GetFullPath());
      disk.paths.merge(listing.paths);
      for (const auto& [token, paths] : listing.tokens) {
        disk.tokens[token].insert(paths.begin(), paths.end());
        tokens.insert(token);
      }
    }
    for (const std::string& share : folders.GetIndexedShares()) {
      Listing listing = ListIndex(share, tokens);
      index.paths.merge(listing.paths);
      index.tokens = listing.tokens;
    }
    return Differences(disk, index);
  }

  Tally& tally_;
  Stack stack_;
  const std::string more_;
  const std::string other_;
  RandomTree tree_;
  RandomTree other_tree_;
  std::map<std::string, DeathWarrant> warrants_;
  std::vector<const Moment*> moments_;
  unsigned kills_more_ = 0;
};

TEST(Stack, LosesNothingToKills) {
  const unsigned wanted = FromEnvironment("FILEINDEX_STACK_KILLS", kHasModule ? 500 : 50);
  unsigned seed = FromEnvironment("FILEINDEX_STACK_FIRST", 1);
  // Of a machine that is busy fewer are asked, but not when somebody named their number.
  const bool may_be_fewer = FromEnvironment("FILEINDEX_STACK_KILLS", 0) == 0;
  const auto until = Stack::Clock::now() + kTimeOfKills;
  Tally tally;
  while (!HasFailure() && tally.kills < wanted && (!may_be_fewer || Stack::Clock::now() < until)) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Torture torture(seed++, tally);
    for (unsigned kill = 0; kill < kKillsOfARun && tally.kills < wanted; ++kill) {
      torture.Kill();
    }
    torture.Judge();
  }
  tally.Print();
}

}  // namespace
