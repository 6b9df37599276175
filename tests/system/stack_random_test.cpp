// Random changes under the whole stack: whatever happens, and whoever is killed at it, the index
// comes to be what the disk is.
//
// FILEINDEX_STACK_SEEDS says how many seeds each test takes (unset: as many as fit), and
// FILEINDEX_STACK_FIRST the first of them (1).
#include <gtest/gtest.h>

#include <charconv>
#include <cstdlib>
#include <cstring>

#include "kavo/monitor_queue.h"
#include "support/index_listing.h"
#include "support/random_tree.h"
#include "support/stack.h"

namespace {

const PrivateRoot kRoot;
constexpr std::chrono::seconds kTimeOfATest{10};
constexpr unsigned kFewestSeeds = 3;
constexpr int kChanges = 60;

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
    differences = Differences(ListDisk(stack.In()), ListIndex("docs", tree.Tokens()));
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

TEST(Stack, LosesNothingToKills) {
  Stack stack(kRoot);
  RecordHistory(stack);
  const std::vector<std::string> names = {"kavoelasticd", "kavocontentextractd", "fileindexd",
                                          "evnotifyd"};
  ForSeeds([&](unsigned seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Empty(stack.In());
    Empty(stack.Out());
    std::filesystem::resize_file(HistoryFile(), 0);
    RandomTree tree(stack.In(), stack.Out(), seed);
    for (int i = 0; i < kChanges; ++i) {
      tree.Change();
      usleep(tree.Below(5000));
      if (tree.Below(10) == 0) {
        const std::string& name = names[tree.Below(static_cast<unsigned>(names.size()))];
        stack.End(name, SIGKILL);
        for (unsigned left = tree.Below(5); left > 0; --left) {
          tree.Change();
        }
        stack.Start(name);
      }
    }
    ExpectIndexed(stack, tree);
  });
}

}  // namespace
