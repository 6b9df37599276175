#include "daemons/common/sandbox.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/landlock.h>
#include <pwd.h>
#include <seccomp.h>
#include <sys/capability.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdlib>
#include <iterator>
#include <memory>

#include "daemons/common/unique_fd.h"

namespace vexlo::daemon {
namespace {

// The rights of a Landlock rule set as of the kernel's version of the interface, first to last.
// Written out: the system's headers may be older than the kernel that the program runs on.
struct RightsOfVersion {
  uint64_t files;
  uint64_t net;
  uint64_t scopes;
};
constexpr RightsOfVersion kRights[] = {
    {0x1FFF, 0, 0},  // Opening, making and removing.
    {0x3FFF, 0, 0},  // Linking and renaming between folders.
    {0x7FFF, 0, 0},  // truncate().
    {0x7FFF, 3, 0},  // bind() and connect() of TCP.
    {0xFFFF, 3, 0},  // ioctl() on devices.
    {0xFFFF, 3, 3},  // Abstract sockets and signals.
};
// landlock_ruleset_attr with all of its members.
struct RuleSet {
  uint64_t files;
  uint64_t net;
  uint64_t scopes;
};

// All that changes a file or a folder: of the first row all but executing and reading, linking
// between folders, truncating.
constexpr uint64_t kWritingRights =
    0x7FFF & ~uint64_t{LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_READ_FILE |
                       LANDLOCK_ACCESS_FS_READ_DIR};
// Those that a rule for a file may have.
constexpr uint64_t kFileRights =
    LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_WRITE_FILE | uint64_t{1} << 14;
constexpr int64_t kLinkingVersion = 2;  // Before it nothing can be moved to another folder.

int64_t PathRuleVersion() {
  return syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
}

// False when what is there is not allowed: whoever went on would be kept from his own files.
bool Allow(int rules, const std::string& path, uint64_t rights) {
  const UniqueFd folder(open(path.c_str(), O_PATH | O_CLOEXEC));
  if (folder.Get() < 0) {
    return errno == ENOENT || errno == ENOTDIR;
  }
  struct stat info {};
  if (fstat(folder.Get(), &info) != 0) {
    return false;
  }
  struct landlock_path_beneath_attr rule {};
  rule.allowed_access = S_ISDIR(info.st_mode) ? rights : rights & kFileRights;
  rule.parent_fd = folder.Get();
  return rule.allowed_access == 0 ||
         syscall(SYS_landlock_add_rule, rules, LANDLOCK_RULE_PATH_BENEATH, &rule, 0) == 0;
}

// Forbids what is in `set` but for `rights` below the paths.
PathRule Enforce(const RuleSet& set, const std::vector<std::string>& paths, uint64_t rights) {
  // A kernel takes members that it does not know as long as they are zero.
  const UniqueFd rules(
      static_cast<int>(syscall(SYS_landlock_create_ruleset, &set, sizeof(set), 0)));
  if (rules.Get() < 0) {
    return PathRule::kFailed;
  }
  const bool are_allowed = std::all_of(paths.begin(), paths.end(), [&](const std::string& path) {
    return Allow(rules.Get(), path, rights);
  });
  return are_allowed && prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
                 syscall(SYS_landlock_restrict_self, rules.Get(), 0) == 0
             ? PathRule::kInForce
             : PathRule::kFailed;
}

size_t RowOf(int64_t version) {
  return std::min<size_t>(static_cast<size_t>(version), std::size(kRights)) - 1;
}

// What needs no look at the arguments.
constexpr int kHarmless[] = {
    SCMP_SYS(brk),          SCMP_SYS(clock_getres), SCMP_SYS(clock_gettime),
    SCMP_SYS(close),        SCMP_SYS(close_range),  SCMP_SYS(exit),
    SCMP_SYS(exit_group),   SCMP_SYS(fadvise64),    SCMP_SYS(fstat),
    SCMP_SYS(futex),        SCMP_SYS(getdents64),   SCMP_SYS(getegid),
    SCMP_SYS(geteuid),      SCMP_SYS(getgid),       SCMP_SYS(getpid),
    SCMP_SYS(getrandom),    SCMP_SYS(getrusage),    SCMP_SYS(gettid),
    SCMP_SYS(gettimeofday), SCMP_SYS(getuid),       SCMP_SYS(lseek),
    SCMP_SYS(_llseek),      SCMP_SYS(madvise),      SCMP_SYS(munmap),
    SCMP_SYS(mremap),       SCMP_SYS(nanosleep),    SCMP_SYS(clock_nanosleep),
    SCMP_SYS(poll),         SCMP_SYS(ppoll),        SCMP_SYS(pread64),
    SCMP_SYS(preadv),       SCMP_SYS(read),         SCMP_SYS(readv),
    SCMP_SYS(recvmsg),      SCMP_SYS(rt_sigaction), SCMP_SYS(rt_sigprocmask),
    SCMP_SYS(rt_sigreturn), SCMP_SYS(sched_yield),  SCMP_SYS(sched_getaffinity),
    SCMP_SYS(sigaltstack),  SCMP_SYS(sysinfo),      SCMP_SYS(restart_syscall),
    SCMP_SYS(time),         SCMP_SYS(times),        SCMP_SYS(uname),
    SCMP_SYS(getrlimit),    SCMP_SYS(ugetrlimit),
};

// What libraries try and can do without.
struct Denied {
  int call;
  int error;
};
constexpr Denied kDenied[] = {
    {SCMP_SYS(access), EACCES},
    {SCMP_SYS(faccessat), EACCES},
    {SCMP_SYS(faccessat2), EACCES},
    {SCMP_SYS(stat), EACCES},
    {SCMP_SYS(lstat), EACCES},
    {SCMP_SYS(statfs), EACCES},
    {SCMP_SYS(readlink), EACCES},
    {SCMP_SYS(openat2), ENOSYS},
    {SCMP_SYS(readlinkat), EACCES},
    {SCMP_SYS(getcwd), EACCES},
    {SCMP_SYS(ioctl), ENOTTY},
    {SCMP_SYS(prctl), EPERM},
    {SCMP_SYS(sched_setaffinity), EPERM},
};

// Of the machine, or of other processes.
constexpr int kAdministration[] = {
    SCMP_SYS(acct),
    SCMP_SYS(add_key),
    SCMP_SYS(adjtimex),
    SCMP_SYS(bpf),
    SCMP_SYS(chroot),
    SCMP_SYS(clock_adjtime),
    SCMP_SYS(clock_settime),
    SCMP_SYS(delete_module),
    SCMP_SYS(finit_module),
    SCMP_SYS(fsconfig),
    SCMP_SYS(fsmount),
    SCMP_SYS(fsopen),
    SCMP_SYS(fspick),
    SCMP_SYS(init_module),
    SCMP_SYS(ioperm),
    SCMP_SYS(iopl),
    SCMP_SYS(io_uring_setup),
    SCMP_SYS(kcmp),
    SCMP_SYS(kexec_file_load),
    SCMP_SYS(kexec_load),
    SCMP_SYS(keyctl),
    SCMP_SYS(lookup_dcookie),
    SCMP_SYS(mknod),
    SCMP_SYS(mknodat),
    SCMP_SYS(mount),
    SCMP_SYS(mount_setattr),
    SCMP_SYS(move_mount),
    SCMP_SYS(nfsservctl),
    SCMP_SYS(open_tree),
    SCMP_SYS(perf_event_open),
    SCMP_SYS(personality),
    SCMP_SYS(pidfd_getfd),
    SCMP_SYS(pivot_root),
    SCMP_SYS(process_vm_readv),
    SCMP_SYS(process_vm_writev),
    SCMP_SYS(ptrace),
    SCMP_SYS(quotactl),
    SCMP_SYS(quotactl_fd),
    SCMP_SYS(reboot),
    SCMP_SYS(request_key),
    SCMP_SYS(setdomainname),
    SCMP_SYS(sethostname),
    SCMP_SYS(setns),
    SCMP_SYS(settimeofday),
    SCMP_SYS(swapoff),
    SCMP_SYS(swapon),
    SCMP_SYS(syslog),
    SCMP_SYS(umount),
    SCMP_SYS(umount2),
    SCMP_SYS(unshare),
    SCMP_SYS(userfaultfd),
    SCMP_SYS(vhangup),
};

using Filter = std::unique_ptr<void, decltype(&seccomp_release)>;
using Comparison = struct scmp_arg_cmp;

// Rules one after another; what fails is kept.
class Rules {
 public:
  explicit Rules(scmp_filter_ctx filter) : filter_(filter) {}

  void Add(uint32_t action, int call, const std::vector<Comparison>& comparisons = {}) {
    // A call that another architecture has and this one does not is no failure.
    const int error =
        seccomp_rule_add_array(filter_, action, call, static_cast<unsigned>(comparisons.size()),
                               comparisons.empty() ? nullptr : comparisons.data());
    error_ = error_ != 0 || error == -EDOM ? error_ : error;
  }
  int Error() const { return error_; }

 private:
  scmp_filter_ctx filter_;
  int error_ = 0;
};

Comparison MaskedIs(unsigned argument, uint64_t mask, uint64_t value) {
  return {argument, SCMP_CMP_MASKED_EQ, mask, value};
}
Comparison Is(unsigned argument, int value) {
  return {argument, SCMP_CMP_EQ, static_cast<unsigned>(value), 0};
}

bool Load(const Filter& filter, const Rules& rules) {
  const int error = rules.Error() != 0 ? rules.Error() : seccomp_load(filter.get());
  errno = -error;
  return error == 0;
}

// Ends the process when what is done meanwhile takes too long: libseccomp goes round in circles for
// ever when it has no memory.
class ShortWork {
 public:
  ShortWork() {
    struct sigaction action {};
    action.sa_handler = End;
    sigaction(SIGALRM, &action, nullptr);
    alarm(kMostSeconds);
  }
  ~ShortWork() {
    alarm(0);
    signal(SIGALRM, SIG_DFL);
  }
  ShortWork(const ShortWork&) = delete;
  ShortWork& operator=(const ShortWork&) = delete;

 private:
  static constexpr unsigned kMostSeconds = 10;

  static void End(int /*signal*/) {
    constexpr char kText[] = "failed: rights cannot be given up in time\n";
    (void)!write(STDERR_FILENO, kText, sizeof(kText) - 1);
    _exit(EXIT_FAILURE);
  }
};

void AddMemory(Rules& rules) {
  for (const int call : {SCMP_SYS(mmap), SCMP_SYS(mmap2), SCMP_SYS(mprotect)}) {
    rules.Add(SCMP_ACT_ALLOW, call, {MaskedIs(2, PROT_EXEC, 0)});
  }
}

void AddFiles(Rules& rules, bool may_open) {
  constexpr uint64_t kChanging = O_ACCMODE | O_CREAT | O_TRUNC | O_PATH;
  const uint32_t rest = SCMP_ACT_ERRNO(EACCES);
  // One rule each way: where both fitted, the filter's order would decide.
  if (may_open) {
    rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(openat), {MaskedIs(2, kChanging, O_RDONLY)});
    rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(open), {MaskedIs(1, kChanging, O_RDONLY)});
  } else {
    rules.Add(rest, SCMP_SYS(openat), {MaskedIs(2, kChanging, O_RDONLY)});
    rules.Add(rest, SCMP_SYS(open), {MaskedIs(1, kChanging, O_RDONLY)});
  }
  // How the C library's fstat() is made; by a path it is an error.
  rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(newfstatat), {MaskedIs(3, AT_EMPTY_PATH, AT_EMPTY_PATH)});
  rules.Add(rest, SCMP_SYS(newfstatat), {MaskedIs(3, AT_EMPTY_PATH, 0)});
  rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(statx), {MaskedIs(2, AT_EMPTY_PATH, AT_EMPTY_PATH)});
  rules.Add(rest, SCMP_SYS(statx), {MaskedIs(2, AT_EMPTY_PATH, 0)});
  for (const int command : {F_GETFD, F_SETFD, F_GETFL, F_DUPFD_CLOEXEC}) {
    rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(fcntl), {Is(1, command)});
  }
}

void AddOutput(Rules& rules, int socket) {
  rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(sendmsg), {Is(0, socket)});
  for (const int stream : {STDOUT_FILENO, STDERR_FILENO}) {
    rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(write), {Is(0, stream)});
    rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(writev), {Is(0, stream)});
  }
  // Of itself alone: abort(), and the C library's getrlimit().
  rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(tgkill), {Is(0, getpid())});
  rules.Add(SCMP_ACT_ALLOW, SCMP_SYS(prlimit64), {Is(0, 0), Is(2, 0)});
}

}  // namespace

std::optional<Account> FindAccount(const std::string& name) {
  struct passwd entry {};
  struct passwd* found = nullptr;
  std::vector<char> buffer(size_t{16} << 10);
  getpwnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &found);
  return found == nullptr ? std::nullopt : std::optional(Account{found->pw_uid, found->pw_gid});
}

bool BecomeAccount(const Account& account) {
  return geteuid() != 0 ||
         (setgroups(0, nullptr) == 0 && setresgid(account.gid, account.gid, account.gid) == 0 &&
          setresuid(account.uid, account.uid, account.uid) == 0) ||
         errno == EPERM;
}

bool KeepCapabilities(const std::vector<int>& kept) {
  // Only who has CAP_SETPCAP may empty the bounding set, and nobody else needs to: no_new_privs
  // makes it meaningless.
  for (int capability = 0; cap_get_bound(capability) >= 0; ++capability) {
    if (std::find(kept.begin(), kept.end(), capability) == kept.end()) {
      cap_drop_bound(capability);
    }
  }
  cap_reset_ambient();
  const std::unique_ptr<std::remove_pointer_t<cap_t>, decltype(&cap_free)> had(cap_get_proc(),
                                                                               cap_free);
  const std::unique_ptr<std::remove_pointer_t<cap_t>, decltype(&cap_free)> left(cap_init(),
                                                                                cap_free);
  if (had == nullptr || left == nullptr || prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) {
    return false;
  }
  for (const int capability : kept) {
    cap_flag_value_t is_permitted = CAP_CLEAR;
    cap_get_flag(had.get(), capability, CAP_PERMITTED, &is_permitted);
    if (is_permitted == CAP_SET) {
      cap_set_flag(left.get(), CAP_PERMITTED, 1, &capability, CAP_SET);
      cap_set_flag(left.get(), CAP_EFFECTIVE, 1, &capability, CAP_SET);
    }
  }
  return cap_set_proc(left.get()) == 0;
}

bool ForbidAdministration() {
  const Filter filter(seccomp_init(SCMP_ACT_ALLOW), seccomp_release);
  if (filter == nullptr) {
    errno = ENOMEM;
    return false;
  }
  Rules rules(filter.get());
  for (const int call : kAdministration) {
    rules.Add(SCMP_ACT_ERRNO(EPERM), call);
  }
  const ShortWork limit;
  return Load(filter, rules);
}

PathRule ForbidPaths(const std::vector<std::string>& readable) {
  const int64_t version = PathRuleVersion();
  if (version < 1) {
    return PathRule::kNotThere;
  }
  const RightsOfVersion& rights = kRights[RowOf(version)];
  return Enforce({rights.files, rights.net, rights.scopes}, readable,
                 LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR);
}

PathRule ForbidWriting(const std::vector<std::string>& writable) {
  const int64_t version = PathRuleVersion();
  if (version < kLinkingVersion) {
    return PathRule::kNotThere;
  }
  const uint64_t rights = kRights[RowOf(version)].files & kWritingRights;
  return Enforce({rights, 0, 0}, writable, rights);
}

bool AllowReadingOnly(int socket, bool may_open) {
  const Filter filter(seccomp_init(SCMP_ACT_KILL_PROCESS), seccomp_release);
  if (filter == nullptr) {
    errno = ENOMEM;
    return false;
  }
  Rules rules(filter.get());
  for (const int call : kHarmless) {
    rules.Add(SCMP_ACT_ALLOW, call);
  }
  for (const Denied& denied : kDenied) {
    rules.Add(SCMP_ACT_ERRNO(static_cast<uint32_t>(denied.error)), denied.call);
  }
  AddMemory(rules);
  AddFiles(rules, may_open);
  AddOutput(rules, socket);
  return Load(filter, rules);
}

}  // namespace vexlo::daemon
