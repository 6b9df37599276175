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
  Quarantine(file_).Add(kKey, Fault("crash", "by \xE9"), "/v/\xE9");
  Quarantine quarantine(file_);  // As the next start finds it.
  const std::optional<Fault> fault = quarantine.Find(kKey);
  ASSERT_TRUE(fault.has_value());
  EXPECT_EQ(fault->Reason() + ": " + fault->what(), "crash: by \xE9");
  EXPECT_FALSE(quarantine.Find({1, 9, 3, 4, 5})) << "another file";
  EXPECT_EQ(quarantine.Size(), 1);
  EXPECT_FALSE(quarantine.Find({1, 2, 3, 4, 9})) << "the same with other attributes";
  EXPECT_EQ(quarantine.Size(), 0);
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
