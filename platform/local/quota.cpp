#include "kavo/quota.h"

#include <fcntl.h>
#include <linux/dqblk_xfs.h>
#include <sys/quota.h>
#include <sys/statvfs.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
#include <exception>
#include <optional>

#include "platform/local/fd.h"
#include "platform/local/last_error.h"
#include "platform/local/mount_info.h"

namespace kavo::local {
namespace {

constexpr uint64_t kLimitUnitBytes = 1024;  // Of limits, whatever the file system's blocks are.

// Puts a question on user quota to the file system of the path. False when it has no answer.
bool AskQuota(const char* path, int question, uid_t user, void* answer) {
  const int command = QCMD(question, USRQUOTA);
  // O_PATH, as the file itself is not to be opened.
  const ScopedFd fd(open(path, O_PATH | O_CLOEXEC));
  if (fd.Get() < 0) {
    return false;
  }
  if (syscall(SYS_quotactl_fd, fd.Get(), command, user, answer) == 0) {
    return true;
  }
  if (errno != ENOSYS) {
    return false;
  }
  // Linux before 5.14, which is asked by device, or a file system without quotas, which is not to
  // be told from it.
  const std::optional<Mount> mount = FindMountOf(path);
  return mount.has_value() && quotactl(command, mount->source.c_str(), static_cast<int>(user),
                                       static_cast<caddr_t>(answer)) == 0;
}

// Whether limits that are set are enforced, which is a state of its own: they may be kept while
// only the use is counted. A file system that does not tell enforces them.
bool AreLimitsEnforced(const char* path) {
  struct fs_quota_stat state {};
  return !AskQuota(path, Q_XGETQSTAT, 0, &state) || (state.qs_flags & FS_QUOTA_UDQ_ENFD) != 0;
}

bool IsWithinLimit(uint64_t limit, uint64_t used, uint64_t bytes) {
  if (limit == 0) {
    return true;
  }
  const uint64_t limit_bytes =
      limit <= UINT64_MAX / kLimitUnitBytes ? limit * kLimitUnitBytes : UINT64_MAX;
  return used <= limit_bytes && bytes <= limit_bytes - used;
}

bool IsWithinQuota(uid_t user, const char* path, uint64_t bytes) {
  struct dqblk quota {};
  if (!AskQuota(path, Q_GETQUOTA, user, &quota)) {
    return true;
  }
  // The soft limit holds once the time for which it may be exceeded is over.
  const bool is_grace_over =
      quota.dqb_btime != 0 && static_cast<uint64_t>(time(nullptr)) >= quota.dqb_btime;
  return (IsWithinLimit(quota.dqb_bhardlimit, quota.dqb_curspace, bytes) &&
          (!is_grace_over || IsWithinLimit(quota.dqb_bsoftlimit, quota.dqb_curspace, bytes))) ||
         !AreLimitsEnforced(path);
}

bool HasRoom(const struct statvfs& volume, uint64_t bytes) {
  // A tmpfs without a limit, and file systems that do not know, have no blocks at all.
  if (volume.f_blocks == 0 || volume.f_frsize == 0) {
    return true;
  }
  const uint64_t blocks = bytes / volume.f_frsize + (bytes % volume.f_frsize != 0 ? 1 : 0);
  return blocks <= volume.f_bavail;
}

}  // namespace
}  // namespace kavo::local

int KAVOQuotaIsEnough(uid_t user, const char* path, uint64_t bytes) {
  using kavo::local::SetLastError;
  struct statvfs volume {};
  if (statvfs(path, &volume) != 0) {
    SetLastError(KAVO_ERR_SYSTEM);
    return 0;
  }
  if (!kavo::local::HasRoom(volume, bytes)) {
    SetLastError(KAVO_ERR_NO_SPACE);
    return 0;
  }
  try {
    if (user == 0 || bytes == 0 || kavo::local::IsWithinQuota(user, path, bytes)) {
      return 1;
    }
    SetLastError(KAVO_ERR_QUOTA);
  } catch (const std::exception&) {
    errno = ENOMEM;
    SetLastError(KAVO_ERR_SYSTEM);
  }
  return 0;
}
