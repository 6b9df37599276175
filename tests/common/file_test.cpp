#include "common/file.h"

#include <gtest/gtest.h>
#include <pwd.h>

#include <algorithm>
#include <tuple>

#include "common/error.h"
#include "common/lock.h"
#include "kavo/acl.h"
#include "support/faults.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

size_t max_write = SIZE_MAX;
const uid_t kId = geteuid() == 0 ? 60001 : geteuid();

FAULTABLE(int, fchmod, (int fd, mode_t mode) noexcept, (fd, mode))
FAULTABLE(int, fchown, (int fd, uid_t user, gid_t group) noexcept, (fd, user, group))
FAULTABLE(int, fsync, (int fd), (fd))
FAULTABLE(ssize_t, read, (int fd, void* buffer, size_t size), (fd, buffer, size))
FAULTABLE(int, rename, (const char* from, const char* to) noexcept, (from, to))
FAULTABLE(ssize_t, write, (int fd, const void* data, size_t size),
          (fd, data, std::min(size, max_write)))

INTERPOSED int getpwnam_r(const char* name, struct passwd* entry, char* buffer, size_t /*bytes*/,
                          struct passwd** found) {
  entry->pw_name = buffer;
  entry->pw_uid = entry->pw_gid = kId;
  *found = strcmp(name, "Vexlo") == 0 ? entry : nullptr;
  buffer[0] = '\0';
  return 0;
}

namespace vexlo {

class File : public testing::Test {
 protected:
  const TempFolder folder_;
  const std::string path_ = folder_ / "file";
};

TEST_F(File, TheKindsOfObjects) {
  WriteText(path_, "x");
  std::filesystem::create_symlink(path_, folder_ / "to_file");
  std::filesystem::create_symlink("/tmp", folder_ / "to_folder");
  EXPECT_TRUE(IsFileExist(path_));
  EXPECT_FALSE(IsFileExist(folder_ / "to_file") || IsFileExist("/tmp"));
  for (const bool follow_link : {false, true}) {
    EXPECT_TRUE(IsDirExist(folder_.Path(), follow_link));
    EXPECT_EQ(IsDirExist(folder_ / "to_folder", follow_link), follow_link);
    for (const char* name : {"file", "to_file", "missing"}) {
      EXPECT_FALSE(IsDirExist(folder_ / name, follow_link)) << name;
    }
  }
  EXPECT_EQ(RealPath(folder_ / "to_folder/../tmp") + RealPath(folder_ / "missing"), "/tmp");
}

TEST_F(File, ThePlatformsAnswers) {
  WriteText(path_, "x");
  EXPECT_TRUE(CheckACLPerm(path_, KAVO_ACL_READ | KAVO_ACL_EXECUTE)) << "any bit";
  EXPECT_FALSE(CheckACLPerm(path_, KAVO_ACL_EXECUTE));
  EXPECT_TRUE(CPFile(path_, folder_ / "copy") && MVFile(folder_ / "copy", folder_ / "moved"));
  EXPECT_EQ(ReadText(folder_ / "moved"), "x");
  EXPECT_EQ(folder_.Names(), (std::set<std::string>{"file", "moved"}));
  EXPECT_FALSE(Unlink(folder_.Path()));
  EXPECT_TRUE(Unlink(path_) && Unlink(path_)) << "gone already";
  EXPECT_FALSE(ChownVexlo(path_));
  EXPECT_TRUE(ChownVexlo(folder_ / "moved"));
  struct stat info {};
  EXPECT_EQ(stat((folder_ / "moved").c_str(), &info), 0);
  EXPECT_TRUE(info.st_uid == kId && info.st_gid == kId) << info.st_uid << ":" << info.st_gid;
}

TEST_F(File, AReplacedFileIsWholeAndReadable) {
  const std::string content = std::string(1, '\0') + std::string(200000, 'x');
  for (const bool is_link : {false, true}) {
    ASSERT_EQ(is_link ? symlink("victim", path_.c_str()) : mknod(path_.c_str(), S_IFREG, 0), 0);
    ASSERT_EQ(lchown(path_.c_str(), kId, kId), 0);
    ASSERT_TRUE(ReplaceFile(path_, content));
    struct stat info {};
    EXPECT_EQ(lstat(path_.c_str(), &info), 0);
    EXPECT_EQ(info.st_mode, static_cast<mode_t>(S_IFREG | 0644));
    EXPECT_EQ(info.st_uid, is_link ? geteuid() : kId);
    EXPECT_EQ(folder_.Names(), std::set<std::string>{"file"});
    for (const int error : {EINTR, EIO}) {
      const ScopedFault fault("read", error, 2);
      std::string read = "before";
      EXPECT_EQ(ReadFile(read, path_) && read == content, error == EINTR);
    }
    unlink(path_.c_str());
  }
  WriteText(path_, "old");
  const ScopedFault fault("fchown", EINVAL);
  EXPECT_TRUE(ReplaceFile(path_, "new") && fault.Fired()) << "an owner that cannot be given";
}

TEST_F(File, AFailureLeavesTheOldContentAndNothingElse) {
  using Case = std::tuple<const char*, int, int>;
  for (const auto& [function, error, nth] :
       {Case{"write", ENOSPC, 1}, Case{"write", ENOSPC, 2}, Case{"fsync", EIO, 1},
        Case{"rename", EIO, 1}, Case{"fchmod", EIO, 1}}) {
    SCOPED_TRACE(function);
    WriteText(path_, "old\ntorn");
    max_write = 1;
    for (const char* const deed : {"replace", "append", "try"}) {
      const ScopedFault fault(function, error, nth);
      const bool append = deed != std::string("replace");
      if (deed == std::string("append") && error == ENOSPC) {
        EXPECT_THROW(AppendLines(path_, "a\nb\n"), Error);
      } else if (append && error == ENOSPC) {
        EXPECT_FALSE(TryAppendLines(path_, "a\nb\n"));
        EXPECT_EQ(errno, ENOSPC);
      } else if (!append) {
        EXPECT_FALSE(ReplaceFile(path_, "a\nb\n"));
        EXPECT_EQ(errno, error);
        EXPECT_TRUE(fault.Fired());
      }
      EXPECT_EQ(ReadText(path_), "old\ntorn");
      EXPECT_EQ(folder_.Names(), std::set<std::string>{"file"});
    }
    max_write = SIZE_MAX;
  }
}

TEST_F(File, AppendedLinesStandAlone) {
  for (const std::string before : {"", "old\n", "old\nto", "\n"}) {
    WriteText(path_, before);
    AppendLines(path_, "new\n");
    EXPECT_EQ(ReadText(path_), before + (before.ends_with("o") ? "\nnew\n" : "new\n"));
    EXPECT_TRUE(TryAppendLines(path_, "newer\n"));
    const LockFile lock(path_, /*exclusive=*/true);
    EXPECT_FALSE(TryAppendLines(path_, "newest\n"));
    EXPECT_EQ(errno, EWOULDBLOCK);
    EXPECT_TRUE(ReadText(path_).ends_with("new\nnewer\n"));
  }
}

}  // namespace vexlo
