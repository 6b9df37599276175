// What the daemon decides without looking at anything: failures, renames, stamps.
#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <set>

#include "common/json.h"
#include "daemons/fileindexd/consequence.h"
#include "daemons/fileindexd/rename_plan.h"
#include "daemons/fileindexd/share_state.h"
#include "daemons/fileindexd/stamp.h"

namespace vexlo::fileindexd {
namespace {

TEST(Decisions, WhatACodeDoesToAnOperationAndToACycle) {
  const struct {
    int code;
    Consequence operation;
    Consequence cycle;
  } cases[] = {
      {914, Consequence::kGoOn, Consequence::kRetry},
      {31337, Consequence::kGoOn, Consequence::kRetry},
      {913, Consequence::kRetry, Consequence::kRetry},
      {2009, Consequence::kRetry, Consequence::kRetry},
      {2011, Consequence::kRetry, Consequence::kRetry},
      {1003, Consequence::kNoSpace, Consequence::kNoSpace},
      {800, Consequence::kUnavailable, Consequence::kUnavailable},
      {2005, Consequence::kRebuild, Consequence::kRebuild},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(OfOperation(c.code), c.operation) << c.code;
    EXPECT_EQ(OfCycle(c.code), c.cycle) << c.code;
  }
}

TEST(Decisions, OnlyTheDocumentsOfWhatHasMovedMove) {
  constexpr auto kNone = std::nullopt;
  const struct {
    const char* name;
    RenameFacts facts;
    RenameStep want;
  } cases[] = {
      {"MovedAndTheOldPathUsedAnew", {true, true, 7, 8, 7}, RenameStep::kMove},
      {"DoneBeforeAndTheOldPathIndexedAnew", {true, true, 8, 8, 7}, RenameStep::kReconcile},
      {"DoneBefore", {true, false, kNone, kNone, 7}, RenameStep::kReconcile},
      {"AnotherFileStandsThereNow", {true, true, 7, kNone, 9}, RenameStep::kReconcile},
      {"WithoutStamp", {true, true, kNone, kNone, 7}, RenameStep::kMove},
      {"WithoutStampAndTheOldPathUsedAnew", {true, true, kNone, 8, 7}, RenameStep::kReconcile},
      {"RenamedOnAndTheOldPathUsedAnew", {true, true, 7, 8, kNone}, RenameStep::kMove},
      {"RenamedOnAndDoneBefore", {true, true, 8, 8, kNone}, RenameStep::kForget},
      {"GoneAndNeverIndexed", {true, false, kNone, kNone, kNone}, RenameStep::kForget},
      {"NotWanted", {false, true, 7, kNone, 7}, RenameStep::kForget},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(PlanRename(c.facts), c.want) << c.name;
  }
}

constexpr int64_t kSecond = 1'000'000'000;

TEST(Decisions, AStampTellsWhetherAFileHasChanged) {
  struct stat file {};
  file.st_size = 10;
  file.st_mtim = {1000, 5};
  file.st_ctim = {2000, 7};
  file.st_ino = 3;
  const struct {
    const char* name;
    std::function<void(struct stat&)> change;
    int64_t indexed_after_ns;  // The change of the attributes.
    bool content;
    bool is_current;
  } cases[] = {
      {"Modified", [](struct stat& s) { ++s.st_mtim.tv_nsec; }, kSecond, true, false},
      {"CopiedWithItsDates", [](struct stat& s) { ++s.st_ctim.tv_nsec; }, kSecond, true, false},
      {"InodeAlone", [](struct stat& s) { ++s.st_ino; }, kSecond, true, true},
      {"ContentIsWantedNow", [](struct stat&) {}, kSecond, false, false},
      {"IndexedInTheTickOfTheChange", [](struct stat&) {}, kSecond / 100, true, false},
      {"IndexedAfterTheTick", [](struct stat&) {}, kSecond / 10, true, true},
  };
  for (const auto& c : cases) {
    const int64_t now = 2000 * kSecond + 7 + c.indexed_after_ns;
    const Stamp indexed = StampOf(file, c.content, {now / kSecond, now % kSecond});
    struct stat changed = file;
    c.change(changed);
    EXPECT_EQ(IsCurrent(StampFrom(ToJson(indexed)), StampOf(changed, /*content=*/true, {})),
              c.is_current)
        << c.name;
  }
  // Without fractions of a second the file system may keep none.
  file.st_ctim.tv_nsec = 0;
  EXPECT_TRUE(StampOf(file, true, {2001, 900'000'000}).is_young);
  EXPECT_FALSE(StampOf(file, true, {2002, 100'000'000}).is_young);
}

TEST(Decisions, WhatIsNoStampIsNone) {
  for (const char* const text :
       {"null", R"({"size":1,"mtime":2,"ctime":3})", R"({"size":1,"mtime":2,"ctime":3,"inode":-1})",
        R"({"size":"1","mtime":2,"ctime":3,"inode":4})"}) {
    Json::Value value;
    ASSERT_TRUE(JsonFromString(value, text)) << text;
    EXPECT_FALSE(StampFrom(value)) << text;
  }
}

TEST(MissedPaths, AreKnownBelowWhatIsRenamedUntilTheyAreTooMany) {
  MissedPaths missed;
  missed.Note("/v/a/b");
  missed.Note("/v/a.b");
  for (const auto& [path, want] : std::map<std::string, bool>{
           {"/v/a", true}, {"/v/a/b", true}, {"/v/a/b/c", false}, {"/v/a.", false}}) {
    EXPECT_EQ(missed.HaveBelow(path), want) << path;
  }
  missed.Forget("/v/a");
  EXPECT_EQ(missed.Paths(), std::set<std::string>{"/v/a.b"});
  for (int i = 0; i < 10000; ++i) {
    missed.Note("/v/" + std::to_string(i));
  }
  EXPECT_TRUE(missed.HaveBelow("/elsewhere"));
  missed.Forget("/elsewhere");
  EXPECT_TRUE(missed.HaveBelow("/elsewhere"));
  missed.Clear();
  EXPECT_FALSE(missed.HaveBelow("/v"));
}

}  // namespace
}  // namespace vexlo::fileindexd
