#include "kavo/filesystem.h"

#include <fcntl.h>
#include <linux/btrfs.h>
#include <linux/btrfs_tree.h>
#include <linux/magic.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/vfs.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <iterator>
#include <optional>
#include <string>
#include <string_view>

#include "platform/local/boundary.h"
#include "platform/local/fd.h"
#include "platform/local/fs_type.h"
#include "platform/local/mount_info.h"

namespace kavo::local {
namespace {

constexpr std::string_view kSnapshotsName = ".snapshots";
constexpr char kHiddenName[] = "@eaDir";

// Those that <linux/magic.h> lacks.
constexpr uint32_t kLustreMagic = 0x0BD00BD0;
constexpr uint32_t kBeegfsMagic = 0x19830326;
constexpr uint32_t kGpfsMagic = 0x47504653;
constexpr uint32_t kOrangefsMagic = 0x20030528;
constexpr uint32_t kVboxsfMagic = 0x786F4256;
constexpr uint32_t kVmhgfsMagic = 0xBACBACBC;

constexpr std::string_view kRemoteFuseNames[] = {
    "afp_client",
    "afpfs",
    "afpfsd",
    "alluxio",
    "alluxio-fuse",
    "blobfuse",
    "blobfuse2",
    "ceph",
    "ceph-fuse",
    "curlftpfs",
    "cvmfs2",
    "davfs",
    "davfs2",
    "fuse_dfs",
    "gcsfuse",
    "glusterfs",
    "goofys",
    "google-drive-ocamlfuse",
    "gvfs-fuse-daemon",
    "gvfsd-fuse",
    "httpfs",
    "hubicfuse",
    "juicefs",
    "kio-fuse",
    "lizardfs",
    "mfs",
    "moosefs",
    "mount-s3",
    "mountpoint-s3",
    "nfs",
    "objectivefs",
    "onedriver",
    "quobyte",
    "rclone",
    "s3fs",
    "s3ql",
    "saunafs",
    "seaweedfs",
    "smbnetfs",
    "sshfs",
    "virtiofs",
    "weed",
};
constexpr std::string_view kImageFuseNames[] = {
    "archivemount", "cdfs",      "dwarfs",     "erofsfuse",  "fuse-archive",  "fuse-zip",
    "fuseiso",      "mount-zip", "ratarmount", "squashfuse", "squashfuse_ll",
};

// For the file systems that statfs() shows as FUSE. What the list of mounts does not have lies
// outside the root of this process, and is taken for an ordinary one.
int FindFuseType(const char* path) {
  const std::optional<Mount> mount = FindMountOf(path);
  if (mount.has_value()) {
    return TypeOfFuse(mount->type, mount->source);
  }
  return errno == 0 ? kOrdinaryFs : SetLastError(KAVO_ERR_SYSTEM);
}

bool HasSnapshotsComponent(std::string_view path) {
  while (!path.empty()) {
    const size_t end = std::min(path.find('/'), path.size());
    if (path.substr(0, end) == kSnapshotsName) {
      return true;
    }
    path.remove_prefix(std::min(end + 1, path.size()));
  }
  return false;
}

// The folder that holds the path's last component.
std::string ParentOf(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') {
    path.remove_suffix(1);
  }
  const size_t slash = path.rfind('/');
  return slash == std::string_view::npos ? "." : std::string(path.substr(0, slash + 1));
}

// 1 or 0, or -1 with errno, by the subvolume that a path of a btrfs lies in. `fd` is its O_PATH
// descriptor, and no file is opened: only a folder, for the ioctl.
int IsInReadOnlySubvolume(const char* path, int fd) {
  constexpr int kFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
  int folder = openat(fd, ".", kFlags);
  if (folder < 0 && errno == ENOTDIR) {
    folder = open(ParentOf(path).c_str(), kFlags);
  }
  const ScopedFd owner(folder);
  struct btrfs_ioctl_get_subvol_info_args info {};
  // It succeeds with 1, too, for other subvolumes than the topmost.
  if (folder < 0 || ioctl(folder, BTRFS_IOC_GET_SUBVOL_INFO, &info) < 0) {
    return -1;
  }
  // This ioctl has the flags as they are on disk, unlike BTRFS_IOC_SUBVOL_GETFLAGS.
  return (info.flags & BTRFS_ROOT_SUBVOL_RDONLY) != 0 ? 1 : 0;
}

int PathInSnapshot(const char* path, int& is_inside) {
  is_inside = 0;
  if (HasSnapshotsComponent(path)) {
    is_inside = 1;
    return 0;
  }
  const ScopedFd fd(open(path, O_PATH | O_NOFOLLOW | O_CLOEXEC));
  struct statfs info {};
  if (fd.Get() < 0 || fstatfs(fd.Get(), &info) != 0) {
    return SetLastError(KAVO_ERR_SYSTEM);
  }
  if (static_cast<uint32_t>(info.f_type) != BTRFS_SUPER_MAGIC) {
    return 0;
  }
  const int result = IsInReadOnlySubvolume(path, fd.Get());
  is_inside = result > 0 ? 1 : 0;
  return result < 0 ? SetLastError(KAVO_ERR_SYSTEM) : 0;
}

// For kernels that do not report the root of a mount. Without mount ids, too, a bind mount of a
// folder of the same file system does not show.
int IsMountPointByParent(const char* path) {
  constexpr unsigned kMask = STATX_INO | STATX_MNT_ID;
  struct statx self {};
  struct statx parent {};
  if (statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT, kMask, &self) != 0 ||
      statx(AT_FDCWD, (std::string(path) + "/..").c_str(), AT_NO_AUTOMOUNT, kMask, &parent) != 0) {
    return SetLastError(KAVO_ERR_SYSTEM);
  }
  const bool same_device =
      self.stx_dev_major == parent.stx_dev_major && self.stx_dev_minor == parent.stx_dev_minor;
  const bool same_mount = (self.stx_mask & parent.stx_mask & STATX_MNT_ID) != 0
                              ? self.stx_mnt_id == parent.stx_mnt_id
                              : same_device;
  const bool is_root = same_device && self.stx_ino == parent.stx_ino;
  return !same_mount || is_root ? 1 : 0;
}

template <size_t kCount>
bool Contains(const std::string_view (&names)[kCount], std::string_view name) {
  return std::find(std::begin(names), std::end(names), name) != std::end(names);
}

}  // namespace

FsType TypeOfMagic(uint32_t magic) {
  switch (magic) {
    case NFS_SUPER_MAGIC:
      return kNfs;
    case SMB_SUPER_MAGIC:
    case CIFS_SUPER_MAGIC:
    case SMB2_SUPER_MAGIC:
      return kSmb;
    case AFS_SUPER_MAGIC:
    case AFS_FS_MAGIC:
      return kAfs;
    case V9FS_MAGIC:
      return k9p;
    case CEPH_SUPER_MAGIC:
      return kCeph;
    case CODA_SUPER_MAGIC:
      return kCoda;
    case NCP_SUPER_MAGIC:
      return kNcp;
    case kLustreMagic:
    case kBeegfsMagic:
    case kGpfsMagic:
    case kOrangefsMagic:
      return kClusterFs;
    case kVboxsfMagic:
    case kVmhgfsMagic:
      return kHostShare;
    case ISOFS_SUPER_MAGIC:
      return kIso9660;
    case UDF_SUPER_MAGIC:
      return kUdf;
    case SQUASHFS_MAGIC:
      return kSquashfs;
    case CRAMFS_MAGIC:
    case CRAMFS_MAGIC_WEND:
      return kCramfs;
    case EROFS_SUPER_MAGIC_V1:
      return kErofs;
    default:
      return kOrdinaryFs;
  }
}

FsType TypeOfFuse(std::string_view type, std::string_view source) {
  const size_t dot = type.find('.');
  // Programs that give no subtype mostly give their own name for a source.
  std::string_view name = dot == std::string_view::npos ? type : type.substr(dot + 1);
  if (name == "fuse" || name == "fuseblk") {
    name = source;
  }
  if (Contains(kRemoteFuseNames, name)) {
    return kRemoteFuse;
  }
  if (Contains(kImageFuseNames, name)) {
    return kImageFuse;
  }
  // The first slash ends "host:" or "scheme:". A list of local folders ("/a:/b") begins with one.
  const size_t slash = source.find('/');
  const bool names_host = slash != std::string_view::npos && slash > 1 && source[slash - 1] == ':';
  return names_host ? kRemoteFuse : kOrdinaryFs;
}

}  // namespace kavo::local

int KAVOGetFSType(const char* path, int /*flags*/) {
  struct statfs info {};
  if (statfs(path, &info) != 0) {
    return kavo::local::SetLastError(KAVO_ERR_SYSTEM);
  }
  const auto magic = static_cast<uint32_t>(info.f_type);
  if (magic != FUSE_SUPER_MAGIC) {
    return kavo::local::TypeOfMagic(magic);
  }
  return kavo::local::Guarded([&] { return kavo::local::FindFuseType(path); });
}

int KAVOFSIsRemoteFS(int type) {
  return type >= kavo::local::kNfs && type <= kavo::local::kRemoteFuse ? 1 : 0;
}

int KAVOFSIsImageFS(int type) {
  return type >= kavo::local::kIso9660 && type <= kavo::local::kImageFuse ? 1 : 0;
}

int KAVOFSDirIsMntPoint(const char* path) {
  // Asked for nothing but what the kernel adds itself, a server that hangs is not waited for, and
  // FUSE answers where only another user is let in.
  struct statx info {};
  if (statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | AT_STATX_DONT_SYNC, 0, &info) !=
      0) {
    return kavo::local::SetLastError(KAVO_ERR_SYSTEM);
  }
  if ((info.stx_mask & STATX_TYPE) != 0 && !S_ISDIR(info.stx_mode)) {
    return 0;
  }
  if ((info.stx_attributes_mask & STATX_ATTR_MOUNT_ROOT) != 0) {
    return (info.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0 ? 1 : 0;
  }
  return kavo::local::Guarded([&] { return kavo::local::IsMountPointByParent(path); });
}

int KLIBFhsPathInSnapshot(const char* path, int* is_inside) {
  if (path == nullptr || is_inside == nullptr) {
    errno = EINVAL;
    return kavo::local::SetLastError(KAVO_ERR_BAD_PARAMETER);
  }
  return kavo::local::Guarded([&] { return kavo::local::PathInSnapshot(path, *is_inside); });
}

int KAVOEAIsHiddenDir(const char* name) {
  return name != nullptr && strcmp(name, kavo::local::kHiddenName) == 0 ? 1 : 0;
}
