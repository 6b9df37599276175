#include "daemons/kavocontentextractd/quarantine.h"

#include <unistd.h>

#include <filesystem>

#include "support/faults.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

FAULTABLE(int, fsync, (int fd), (fd))

namespace vexlo::extractd {
namespace {

const ContentKey kKey = {1, 2, 3, 4, 5};

class QuarantineTest : public testing::Test {
 protected:
  SyslogCapture log_;
  const TempFolder folder_;
  const std::string file_ = folder_ / "extract/quarantine.json";
};

TEST_F(QuarantineTest, HoldsAContentUntilItChanges) {
  const std::pair<ContentKey, bool> rows[] = {
      {kKey, true},
      {{9, 2, 3, 4, 5}, false},
      {{1, 9, 3, 4, 5}, false},
      {{1, 2, 9, 4, 5}, false},
      {{1, 2, 3, 9, 5}, false},
      {{1, 2, 3, 4, 9}, false},
  };
  for (const auto& [key, is_held] : rows) {
    Quarantine(file_).Add(kKey, Fault("crash", "by \xE9"), "/v/\xE9");
    Quarantine quarantine(file_);  // As the next start finds it.
    const std::optional<Fault> fault = quarantine.Find(key);
    ASSERT_EQ(fault.has_value(), is_held);
    if (fault) {
      EXPECT_EQ(fault->Reason() + ": " + fault->what(), "crash: by \xE9");
    }
    const bool is_same_file = key.device == kKey.device && key.inode == kKey.inode;
    EXPECT_EQ(quarantine.Size(), is_same_file && !is_held ? 0 : 1);
    std::filesystem::remove(file_);
  }
  EXPECT_EQ(std::filesystem::status(folder_ / "extract").permissions(),
            std::filesystem::perms::owner_all);
}

TEST_F(QuarantineTest, ForgetsTheOldest) {
  Quarantine quarantine(file_, /*most=*/3);
  for (const uint64_t inode : {1, 2, 3, 1, 4}) {  // The second time the first is new again.
    quarantine.Add({1, inode, 1, 1, 1}, Fault("deadline", ""), "");
  }
  EXPECT_EQ(quarantine.Size(), 3);
  EXPECT_FALSE(quarantine.Find({1, 2, 1, 1, 1}));
  for (const uint64_t inode : {1, 3, 4}) {
    EXPECT_TRUE(quarantine.Find({1, inode, 1, 1, 1})) << inode;
  }
  EXPECT_EQ(Quarantine(file_, /*most=*/2).Size(), 2);
}

TEST_F(QuarantineTest, HoldsWhatItCannotWrite) {
  Quarantine quarantine(file_);
  quarantine.Add(kKey, Fault("crash", ""), "");
  const std::string before = ReadText(file_);
  const ContentKey other = {7, 7, 7, 7, 7};
  {
    const ScopedFault fault("fsync", EIO);
    log_.Take();
    quarantine.Add(other, Fault("crash", ""), "");
    EXPECT_TRUE(fault.Fired());
  }
  EXPECT_TRUE(quarantine.Find(other));
  EXPECT_EQ(ReadText(file_), before);
  EXPECT_FALSE(log_.Take().empty());
}

}  // namespace
}  // namespace vexlo::extractd
