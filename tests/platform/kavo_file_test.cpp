#include "kavo/file.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/xattr.h>

#include <algorithm>
#include <functional>
#include <sstream>
#include <tuple>
#include <utility>
#include <vector>

#include "support/faults.h"
#include "support/temp_folder.h"

std::function<void()> before_fsync = [] {};

FAULTABLE(int, fchown, (int fd, uid_t user, gid_t group) noexcept, (fd, user, group))
FAULTABLE(int, fsetxattr,
          (int fd, const char* name, const void* value, size_t size, int flags) noexcept,
          (fd, name, value, size, flags))
FAULTABLE(int, fsync, (int fd), ((std::exchange(before_fsync, [] {})(), fd)))
FAULTABLE(ssize_t, read, (int fd, void* buffer, size_t size), (fd, buffer, size))
FAULTABLE(ssize_t, write, (int fd, const void* data, size_t size), (fd, data, size))
FAULTABLE(int, rename, (const char* from, const char* to) noexcept, (from, to))
FAULTABLE(int, unlink, (const char* path) noexcept, (path))
FAULTABLE(ssize_t, copy_file_range,
          (int from, off64_t* at_from, int to, off64_t* at_to, size_t size, unsigned flags),
          (from, at_from, to, at_to, size, flags))

constexpr KAVO_FILE_COPY_ARGS kBare = {.keep_attributes = 0, .remove_source = 0};
constexpr KAVO_FILE_COPY_ARGS kCopy = {.keep_attributes = 1, .remove_source = 0};
constexpr KAVO_FILE_COPY_ARGS kMove = {.keep_attributes = 1, .remove_source = 1};
// The last access lies ahead, as reading moves only one that has passed.
constexpr struct timespec kTimes[2] = {{4000000001, 123456789}, {1000000002, 987654321}};

// The error, or 0.
int Copy(const std::string& from, const std::string& to, const KAVO_FILE_COPY_ARGS& args) {
  return KAVOFileCopy(from.c_str(), to.c_str(), &args) == 0 ? 0 : errno;
}

void SetAcl(const std::string& path, acl_type_t type, const char* text) {
  const acl_t acl = acl_from_text(text);
  EXPECT_EQ(acl_set_file(path.c_str(), type, acl), 0) << path;
  acl_free(acl);
}

// All that a copy keeps: mode, ids, times, content and attributes.
std::string Describe(const std::string& path) {
  struct stat info {};
  if (lstat(path.c_str(), &info) != 0) {
    return "<missing>";
  }
  const bool is_link = S_ISLNK(info.st_mode);
  std::ostringstream out;
  out << std::oct << info.st_mode << " " << info.st_uid << " " << info.st_gid << " "
      << (is_link ? 0 : info.st_atim.tv_sec) << " " << info.st_mtim.tv_sec << " "
      << (is_link ? std::filesystem::read_symlink(path).string() : ReadText(path));
  for (const char* name : {"user.test", "system.posix_acl_access"}) {
    char value[4096] = {};
    const ssize_t size = lgetxattr(path.c_str(), name, value, sizeof(value));
    out << name << std::string(value, static_cast<size_t>(std::max<ssize_t>(size, 0)));
  }
  return out.str();
}

// With something of everything that a copy keeps; a `plain` one has no ACL.
enum Kind { kPlain, kDressed, kLink };
void Make(const std::string& path, Kind kind) {
  if (kind == kLink) {
    EXPECT_EQ(symlink(std::string(300, 'x').c_str(), path.c_str()), 0);
  } else {
    WriteText(path, std::string(300000, 'x') + "\n");
    EXPECT_EQ(setxattr(path.c_str(), "user.test", "a\0b", 3, 0), 0);
  }
  EXPECT_TRUE(geteuid() != 0 || lchown(path.c_str(), 60001, 60002) == 0);
  if (kind == kDressed) {
    EXPECT_EQ(chmod(path.c_str(), 06750), 0);
    SetAcl(path, ACL_TYPE_ACCESS, "u::r-x,u:60005:rwx,g::r--,m::rwx,o::-");
  }
  EXPECT_EQ(utimensat(AT_FDCWD, path.c_str(), kTimes, AT_SYMLINK_NOFOLLOW), 0);
}

TEST(KAVOFileCopy, TheTargetIsWhatTheSourceWasOrAllIsAsItWas) {
  using Case = std::tuple<Kind, KAVO_FILE_COPY_ARGS, const char*, int, int>;
  const std::vector<Case> cases = {
      {kDressed, kCopy, "", 0, 1},           {kPlain, kCopy, "copy_file_range", ENOSYS, 1},
      {kDressed, kMove, "write", EINTR, 2},  {kLink, kMove, "", 0, 1},
      {kDressed, kMove, "read", EIO, 2},     {kDressed, kMove, "write", ENOSPC, 2},
      {kDressed, kCopy, "fchown", EIO, 1},   {kDressed, kCopy, "fsetxattr", ENOSPC, 1},
      {kDressed, kCopy, "fsync", EIO, 1},    {kDressed, kCopy, "rename", EIO, 1},
      {kDressed, kMove, "fsync", EIO, 2},  // The folder's.
      {kDressed, kMove, "unlink", EROFS, 1},
  };
  for (const auto& [kind, args, fails, error, nth] : cases) {
    for (const bool has_target : {false, true}) {
      SCOPED_TRACE(std::string(fails) + std::to_string(nth) +
                   (has_target ? ", over a target" : ""));
      const TempFolder from;
      const TempFolder to(args.remove_source != 0 ? "/dev/shm" : "/tmp");
      SetAcl(to.Path(), ACL_TYPE_DEFAULT, "u::rwx,u:60005:rwx,g::rwx,m::rwx,o::rwx");
      Make(from / "source", kind);
      const std::string target = to / std::string(255, 't');
      EXPECT_TRUE(!has_target || (std::ofstream(target) << "old" &&
                                  utimensat(AT_FDCWD, target.c_str(), kTimes, 0) == 0));
      const int want = error == EINTR || error == ENOSYS ? 0 : error;
      const auto source_before = Describe(from / "source");
      const auto target_before = Describe(target);
      const ScopedFault fault(fails, error, nth);
      EXPECT_EQ(Copy(from / "source", target, args), want);
      EXPECT_EQ(fault.Fired(), error != 0);
      EXPECT_EQ(Describe(target), want == 0 ? source_before : target_before);
      EXPECT_EQ(to.Names().size(), want == 0 || has_target ? 1U : 0U);
      EXPECT_EQ(Describe(from / "source"),
                want != 0 || args.remove_source == 0 ? source_before : "<missing>");
    }
  }
}

TEST(KAVOFileCopy, WhatTheTargetCannotHaveOpensNothing) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "only root sets all of these attributes";
  }
  using Case = std::tuple<KAVO_FILE_COPY_ARGS, const char*, int, mode_t>;
  // With an ACL the group bits are its mask, which would give the group more than it had.
  for (const auto& [args, fails, error, want] :
       {Case{kBare, "", 0, 0550}, Case{kCopy, "fsetxattr", ENOTSUP, 06540},
        Case{kCopy, "fchown", EPERM, 0570}}) {
    const TempFolder folder;
    Make(folder / "source", kDressed);
    const ScopedFault fault(fails, error, 1, /*lasting=*/true);
    EXPECT_EQ(Copy(folder / "source", folder / "copy", args), 0);
    struct stat info {};
    stat((folder / "copy").c_str(), &info);
    EXPECT_EQ(info.st_mode & ALLPERMS, want);
  }
}

TEST(KAVOFileCopy, RefusesWhatItCannotCopyAndLosesNothing) {
  const TempFolder folder;
  ASSERT_EQ(mkdir((folder / "directory").c_str(), 0755), 0);
  ASSERT_EQ(mkfifo((folder / "fifo").c_str(), 0644), 0);
  WriteText(folder / "file", "x");
  using Case = std::tuple<const char*, const char*, KAVO_FILE_COPY_ARGS, int>;
  const std::set<std::string> names = folder.Names();
  for (const auto& [from, to, args, want] :
       {Case{"missing", "new", kMove, ENOENT}, Case{"directory", "new", kMove, EISDIR},
        Case{"fifo", "new", kMove, ENOTSUP}, Case{"file", "directory", kCopy, EISDIR},
        Case{"file", "missing/new", kCopy, ENOENT}, Case{"file", "./file", kMove, 0}}) {
    const ScopedFault fault("rename", EXDEV);  // As between two mounts, be it of one folder.
    EXPECT_EQ(Copy(folder / from, folder / to, args), want) << from;
    EXPECT_EQ(folder.Names(), names) << from;
  }
  before_fsync = [&folder] { WriteText(folder / "file", "x and more"); };
  const ScopedFault fault("rename", EXDEV);
  EXPECT_EQ(Copy(folder / "file", folder / "new", kMove), EBUSY);
  EXPECT_EQ(ReadText(folder / "file"), "x and more");
  EXPECT_EQ(folder.Names(), names);
  ASSERT_EQ(link((folder / "file").c_str(), (folder / "hard_link").c_str()), 0);
  EXPECT_EQ(Copy(folder / "hard_link", folder / "file", kMove), 0);
  EXPECT_EQ(folder.Names(), names);
  EXPECT_EQ(Copy("/proc/version", folder / "file", kCopy), 0);  // Has no size.
  EXPECT_EQ(ReadText(folder / "file"), ReadText("/proc/version"));
}
