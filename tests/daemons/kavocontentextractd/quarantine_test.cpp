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
  const struct {
    const char* name;
    ContentKey key;
    bool is_held;
  } rows[] = {
      {"Same", kKey, true},
      {"OtherDevice", {9, 2, 3, 4, 5}, false},
      {"OtherInode", {1, 9, 3, 4, 5}, false},
      {"OtherSize", {1, 2, 9, 4, 5}, false},
      {"Modified", {1, 2, 3, 9, 5}, false},
      {"AttributesChanged", {1, 2, 3, 4, 9}, false},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    Quarantine(file_).Add(kKey, Fault("crash", "by \xE9"), "/v/\xE9");
    Quarantine quarantine(file_);  // As the next start finds it.
    const std::optional<Fault> fault = quarantine.Find(row.key);
    ASSERT_EQ(fault.has_value(), row.is_held);
    if (fault) {
      EXPECT_EQ(fault->Reason() + ": " + fault->what(), "crash: by \xE9");
    }
    const bool is_same_file = row.key.device == kKey.device && row.key.inode == kKey.inode;
    EXPECT_EQ(quarantine.Size(), is_same_file && !row.is_held ? 0 : 1);
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

TEST_F(QuarantineTest, SetsADamagedListAside) {
  const std::string good =
      R"({"device":1,"inode":2,"size":3,"modified":-4,"changed":5,"reason":"r","msg":"m","path":"p","time":6})";
  const std::string bad[] = {
      "", "[]", "{}", "{\"files\":{}}", "{\"files\":[" + good + ",1]}", "{\"files\":[" + good};
  for (const std::string& text : bad) {
    std::filesystem::create_directories(folder_ / "extract");
    WriteText(file_, text);
    EXPECT_EQ(Quarantine(file_).Size(), 0) << text;
    EXPECT_EQ(ReadText(file_ + ".damaged"), text);
    EXPECT_FALSE(std::filesystem::exists(file_));
  }
  WriteText(file_, "{\"files\":[" + good + "]}");
  EXPECT_TRUE(Quarantine(file_).Find({1, 2, 3, -4, 5}));
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
