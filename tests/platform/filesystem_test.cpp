#include "kavo/filesystem.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/vfs.h>

#include <map>
#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "kavo/last_error.h"
#include "platform/local/fs_type.h"
#include "platform/local/mount_info.h"
#include "support/faults.h"
#include "support/private_mounts.h"
#include "support/temp_folder.h"

namespace {

std::optional<unsigned> given_magic;  // For what no machine of ours can mount.
bool hides_mount_root = false;        // As kernels before 5.8 do,
bool hides_mount_id = false;          // which have neither.

}  // namespace

// NOLINTBEGIN(readability-identifier-naming): the C library's names.
INTERPOSED int statfs(const char* path, struct statfs* info) noexcept {
  static const auto real = REAL_FUNCTION(int, statfs, (const char*, struct statfs*));
  const int result = real(path, info);
  info->f_type = result == 0 && given_magic ? *given_magic : info->f_type;
  return result;
}

INTERPOSED int statx(int folder, const char* path, int flags, unsigned mask,
                     struct statx* info) noexcept {
  static const auto real =
      REAL_FUNCTION(int, statx, (int, const char*, int, unsigned, struct statx*));
  const int result = real(folder, path, flags, mask, info);
  info->stx_attributes_mask &= ~(hides_mount_root ? STATX_ATTR_MOUNT_ROOT : 0ULL);
  info->stx_mask &= ~(hides_mount_id ? STATX_MNT_ID : 0U);
  return result;
}
// NOLINTEND(readability-identifier-naming)

namespace {

using kavo::local::FindMount;
using kavo::local::Mount;
using kavo::local::TypeOfFuse;

std::string KindOf(int type) {
  return std::string(type < 0 ? "failed " : "") + (type == 12 ? "12 " : "") +
         (KAVOFSIsRemoteFS(type) != 0 ? "remote" : "") +
         (KAVOFSIsImageFS(type) != 0 ? "image" : "");
}

std::string KindOf(const std::string& path) { return KindOf(KAVOGetFSType(path.c_str(), 0)); }

// "inside", "", or what errno says.
std::string Snapshot(const std::string& path) {
  int is_inside = -1;
  const int result = KLIBFhsPathInSnapshot(path.c_str(), &is_inside);
  return result < 0 ? strerror(errno) : is_inside == 1 ? "inside" : is_inside == 0 ? "" : "unset";
}

TEST(KAVOGetFSType, KnowsTheNumbersOfTheKernel) {
  const std::map<std::string, std::vector<unsigned>> rows = {
      // ext4, btrfs, XFS, tmpfs; FUSE, when the list of mounts names nothing else.
      {"", {0xEF53, 0x9123683E, 0x58465342, 0x01021994, 0x65735546}},
      // NFS, SMB2, with the highest bit set as no int has it.
      {"remote", {0x6969, 0xFE534D42}},
      // ISO 9660, squashfs.
      {"image", {0x9660, 0x73717368}},
  };
  for (const auto& [want, magics] : rows) {
    for (const unsigned magic : magics) {
      given_magic = magic;
      EXPECT_EQ(KindOf("/proc"), want) << std::hex << magic;
    }
  }
  given_magic.reset();
}

TEST(TypeOfFuse, GoesByNameThenBySource) {
  // Type and source with a blank between them.
  const std::map<std::string, std::vector<std::string>> rows = {
      {"remote", {"fuse.sshfs nas", "virtiofs tag", "fuse [fe80::1]:/export", "fuse https://h/d"}},
      {"image", {"fuse.squashfuse /a.sqfs", "fuse.archivemount host:/a.tar"}},
      {"", {"fuse.mergerfs /disk1:/disk2", "fuse.x :/a", "fuse.ssh sshfs", " "}},
  };
  for (const auto& [want, mounts] : rows) {
    for (const std::string& mount : mounts) {
      const size_t blank = mount.find(' ');
      EXPECT_EQ(KindOf(TypeOfFuse(mount.substr(0, blank), mount.substr(blank + 1))), want) << mount;
    }
  }
}

TEST(KLIBFhsPathInSnapshot, GoesByWholeNamesAndFollowsNoLink) {
  EXPECT_EQ(Snapshot("/missing/.snapshots/1/file"), "inside");
  EXPECT_EQ(Snapshot("/missing/.snapshotsx"), strerror(ENOENT));
  EXPECT_EQ(Snapshot("/missing/x.snapshots/a"), strerror(ENOENT));
  const TempFolder folder;
  ASSERT_EQ(symlink("nowhere", (folder / "link").c_str()), 0);
  EXPECT_EQ(Snapshot(folder / "link"), "") << "it was followed";
}

TEST(FindMount, ReadsTheListOfMounts) {
  const std::string text =
      "36 35 98:0 / /a rw,noatime master:1 propagate_from:2 - fuse.sshfs host:/x\\040y\\134\\9 rw\n"
      "\nno line\n136 35 0:41 /- /n\\040- rw - ext4 /dev/\\303\\244 rw\n38 35 0:42 / /o rw";
  const auto find = [&text](std::optional<uint64_t> id, dev_t device) {
    const std::optional<Mount> mount = FindMount(text, id, device);
    return mount ? mount->type + "|" + mount->source : "none";
  };
  EXPECT_EQ(find(36, 0), "fuse.sshfs|host:/x y\\\\9");
  EXPECT_EQ(find({}, makedev(0, 41)), "ext4|/dev/\u00e4");
  EXPECT_EQ(find(38, 0) + find(6, 0), "nonenone");
}

TEST(RealMounts, MemoryAndBind) {
  const TempFolder folder;
  ASSERT_EQ(mkdir((folder / "plain").c_str(), 0755), 0);
  ASSERT_EQ(symlink("tmpfs", (folder / "link").c_str()), 0);
  const auto memory = ScopedMount::Tmpfs(folder / "tmpfs");
  SKIP_IF_REFUSED(memory);
  const auto read_only = ScopedMount::Tmpfs(folder / "read_only", "", MS_RDONLY);
  SKIP_IF_REFUSED(read_only);
  const auto bind = ScopedMount::Bind(folder / "plain", folder / "bind");
  SKIP_IF_REFUSED(bind);
  WriteText(memory / "file", "");
  WriteText(folder / "bound", "");
  const auto bound = ScopedMount::Bind(memory / "file", folder / "bound");
  EXPECT_EQ(KindOf(memory.Path()) + KindOf(read_only.Path()), "");
  // The answer, and that of a kernel that tells devices alone.
  const std::tuple<std::string, int, int> rows[] = {
      {memory.Path(), 1, 1},    {read_only.Path() + "/", 1, 1}, {bind.Path(), 1, 0},
      {folder / "plain", 0, 0}, {folder / "link", 0, 0},        {memory / "file", 0, 0},
      {bound.Path(), 0, 0},     {folder / "missing", -1, -1},   {"/", 1, 1},
  };
  for (const auto& [path, want, want_by_device] : rows) {
    EXPECT_EQ(KAVOFSDirIsMntPoint(path.c_str()), want) << path;
    hides_mount_root = true;
    EXPECT_EQ(KAVOFSDirIsMntPoint(path.c_str()), want) << path << " by mount id";
    hides_mount_id = true;
    EXPECT_EQ(KAVOFSDirIsMntPoint(path.c_str()), want_by_device) << path << " by device";
    hides_mount_root = hides_mount_id = false;
  }
}

TEST(RealMounts, BtrfsSubvolumes) {
  const TempFolder folder;
  const auto volume =
      ScopedMount::Image("truncate -s 128M $IMAGE; mkfs.btrfs -q $IMAGE", folder / "volume", "rw");
  SKIP_IF_REFUSED(volume);
  ASSERT_EQ(RunCommands("cd " + volume.Path() +
                        "; btrfs subvolume create live; mkdir live/folder; touch live/file"
                        "; ln -s ../live/file live/link; mkfifo live/fifo; ln -s taken/file link"
                        "; btrfs subvolume snapshot -r live taken"
                        "; btrfs subvolume snapshot live written"),
            "");
  for (const char* name : {"taken", "taken/folder/", "taken/file", "taken/link", "taken/fifo"}) {
    EXPECT_EQ(Snapshot(volume / name), "inside") << name;
  }
  for (const char* name : {"", "live", "live/file", "written/folder", "link"}) {
    EXPECT_EQ(Snapshot(volume / name), "") << name;
  }
  EXPECT_EQ(KAVOFSDirIsMntPoint((volume / "live").c_str()), 0);
}

// Mounts of a user with number 12345, in which root is not let in and nobody serves.
TEST(RealMounts, FuseOfAnotherUser) {
  const TempFolder folder;
  const std::tuple<const char*, const char*, const char*> rows[] = {
      {"fuse", "nas:/ex port", "remote"}, {"fuse.fuseiso", "disc", "image"}, {"fuse.x", "/a", ""}};
  for (const auto& [type, source, want] : rows) {
    const int device = open("/dev/fuse", O_RDWR | O_CLOEXEC);
    const ScopedMount mounted(
        source, folder / "mount", type, 0,
        "fd=" + std::to_string(device) + ",rootmode=40000,user_id=12345,group_id=12345");
    close(device);
    SKIP_IF_REFUSED(mounted);
    for (const bool hides_id : {false, true}) {
      hides_mount_id = hides_id;
      EXPECT_EQ(KindOf(mounted.Path()), want) << type << " " << hides_id;
    }
    hides_mount_id = false;
    EXPECT_EQ(KAVOFSDirIsMntPoint(mounted.Path().c_str()), 1) << type;
  }
}

}  // namespace
