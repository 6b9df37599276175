#include "kavo/quota.h"

#include <gtest/gtest.h>
#include <linux/dqblk_xfs.h>
#include <sys/quota.h>
#include <sys/syscall.h>

#include <cstdarg>
#include <ctime>
#include <string>

#include "kavo/last_error.h"
#include "support/faults.h"
#include "support/private_mounts.h"
#include "support/temp_folder.h"

namespace {

// What the kernel is made to say of quotas.
struct Quota {
  uint64_t hard_kib = 0;
  uint64_t soft_kib = 0;
  uint64_t used_bytes = 0;
  uint64_t grace_end = 0;
  int state = FS_QUOTA_UDQ_ACCT | FS_QUOTA_UDQ_ENFD;  // Or minus an errno.
  int error = 0;
};
const Quota* given = nullptr;

int Answer(int command, long user, void* answer) {
  const auto result = [](int error) { return error == 0 ? 0 : (errno = error, -1); };
  if (given == nullptr) {
    return result(ENOTBLK);
  }
  if (command == static_cast<int>(QCMD(Q_XGETQSTAT, USRQUOTA))) {
    static_cast<fs_quota_stat*>(answer)->qs_flags = static_cast<uint16_t>(given->state);
    return result(given->state < 0 ? -given->state : 0);
  }
  if (command != static_cast<int>(QCMD(Q_GETQUOTA, USRQUOTA)) || user != 1234) {
    return result(ESRCH);
  }
  auto* quota = static_cast<dqblk*>(answer);
  quota->dqb_bhardlimit = given->hard_kib;
  quota->dqb_bsoftlimit = given->soft_kib;
  quota->dqb_curspace = given->used_bytes;
  quota->dqb_btime = given->grace_end;
  return result(given->error);
}

}  // namespace

// NOLINTBEGIN(readability-identifier-naming): the C library's names.
INTERPOSED long syscall(long number, ...) noexcept {
  static const auto real = REAL_FUNCTION(long, syscall, (long, ...));
  va_list list;
  va_start(list, number);
  long a[6];
  for (long& argument : a) {
    argument = va_arg(list, long);
  }
  va_end(list);
  if (number != SYS_quotactl_fd || given == nullptr) {
    return real(number, a[0], a[1], a[2], a[3], a[4], a[5]);
  }
  // NOLINTNEXTLINE(performance-no-int-to-ptr): system calls take all arguments as numbers.
  return Answer(static_cast<int>(a[1]), a[2], reinterpret_cast<void*>(a[3]));
}

// NOLINTEND(readability-identifier-naming)

namespace {

std::string Ask(uid_t user, const std::string& path, uint64_t bytes) {
  if (KAVOQuotaIsEnough(user, path.c_str(), bytes) != 0) {
    return "enough";
  }
  const int error = KLIBCErrGet();
  return error == KAVO_ERR_NO_SPACE ? "no space"
         : error == KAVO_ERR_QUOTA  ? "quota"
         : error == KAVO_ERR_SYSTEM ? strerror(errno)
                                    : std::to_string(error);
}

TEST(KAVOQuotaIsEnough, ComparesWithTheUsersLimits) {
  const TempFolder folder;
  const auto past = static_cast<uint64_t>(time(nullptr)) - 1;
  const uint64_t future = past + 3600;
  constexpr int kCounted = FS_QUOTA_UDQ_ACCT;
  struct {
    const char* name;
    uid_t user;
    uint64_t bytes;
    Quota quota;
    const char* want;
  } const rows[] = {
      {"UpToTheHardLimit", 1234, 1048, {2, 0, 1000}, "enough"},
      {"OneOverTheHardLimit", 1234, 1049, {2, 0, 1000}, "quota"},
      {"UsedMoreThanTheLimit", 1234, 1, {2, 0, 5000}, "quota"},
      {"NothingIsWritten", 1234, 0, {2, 0, 5000}, "enough"},
      {"LimitBeyond64Bits", 1234, 9999, {UINT64_MAX / 1000, 0, 5000}, "enough"},
      {"SoftLimitInGrace", 1234, 9, {0, 1, 5000, future}, "enough"},
      {"SoftLimitAfterGrace", 1234, 9, {0, 1, 5000, past}, "quota"},
      {"OnlyCounted", 1234, 9, {1, 0, 5000, 0, kCounted}, "enough"},
      {"NotOn", 1234, 9, {1, 0, 5000, 0, kCounted, ESRCH}, "enough"},
      {"NotAllowedToAsk", 1234, 9, {1, 0, 5000, 0, kCounted, EPERM}, "enough"},
      {"Root", 0, 9, {1, 0, 5000}, "enough"},
  };
  for (const auto& row : rows) {
    given = &row.quota;
    EXPECT_EQ(Ask(row.user, folder.Path(), row.bytes), row.want) << row.name;
  }
  given = nullptr;
}

TEST(KAVOQuotaIsEnough, ComparesWithTheRoomOnTheVolume) {
  const TempFolder folder;
  const auto volume = ScopedMount::Tmpfs(folder / "volume", "size=1m");
  SKIP_IF_REFUSED(volume);
  const auto endless = ScopedMount::Tmpfs(folder / "endless", "size=0");
  SKIP_IF_REFUSED(endless);
  constexpr uint64_t kRoom = 512 << 10;
  WriteText(volume / "half", std::string(kRoom, 'x'));
  for (const uid_t user : {0, 1234}) {
    EXPECT_EQ(Ask(user, volume.Path(), kRoom), "enough");
    EXPECT_EQ(Ask(user, volume / "half", kRoom + 1), "no space");
    EXPECT_EQ(Ask(user, volume.Path(), UINT64_MAX), "no space");
    EXPECT_EQ(Ask(user, endless.Path(), UINT64_MAX), "enough");
    EXPECT_EQ(Ask(user, volume / "missing", 0), strerror(ENOENT));
  }
}

}  // namespace
