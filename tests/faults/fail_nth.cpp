#include "faults/fail_nth.h"

#include <dirent.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <link.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdarg>
#include <cstdint>
#include <cstdlib>
#include <cstring>

namespace {

FailNth current;
char report[PATH_MAX];
std::atomic<bool> armed = false;
std::atomic<long> left = 0;
std::atomic<const char*> failed = nullptr;
DeathOrder* death = nullptr;
pid_t mortal = 0;  // Not the processes that it forks.

// Past the functions of this file, and of what may call them.
void Report(const char* name) {
  const auto fd =
      static_cast<int>(syscall(SYS_openat, AT_FDCWD, report, O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
  syscall(SYS_write, fd, name, strlen(name));
  syscall(SYS_close, fd);
}

bool IsAmong(const char* calls, const char* name) {
  const size_t length = strlen(name);
  for (const char* at = calls; (at = strstr(at, name)) != nullptr; at += length) {
    if (at[-1] == ',' && at[length] == ',') {
      return true;
    }
  }
  return false;
}

// Where the code of the C library and its loader lies. What they do without memory is their own
// affair: looking up a user, or a thread's first use of a variable of its own, ends the process.
struct CodeRange {
  uintptr_t begin = 0;
  uintptr_t end = 0;
};
CodeRange runtime_code[2];

int NoteRuntime(dl_phdr_info* info, size_t /*size*/, void* /*data*/) {
  const bool is_library = strstr(info->dlpi_name, "/libc.so") != nullptr;
  if (!is_library && strstr(info->dlpi_name, "/ld-linux") == nullptr) {
    return 0;
  }
  for (int i = 0; i < info->dlpi_phnum; ++i) {
    const auto& segment = info->dlpi_phdr[i];
    if (segment.p_type == PT_LOAD && (segment.p_flags & PF_X) != 0) {
      const uintptr_t begin = info->dlpi_addr + segment.p_vaddr;
      runtime_code[is_library ? 0 : 1] = {begin, begin + segment.p_memsz};
    }
  }
  return 0;
}

void DieIfOrdered(const char* name) {
  if (death != nullptr && death->left > 0 && IsAmong(death->calls, name) && getpid() == mortal &&
      --death->left == 0) {
    kill(mortal, SIGKILL);
  }
}

// Whether this call fails, with errno set.
bool Fires(const char* name) {
  DieIfOrdered(name);
  if (!armed || !IsAmong(current.calls, name)) {
    return false;
  }
  const long rest = --left;
  if (rest > 0 || (rest < 0 && !current.lasting)) {
    return false;
  }
  const char* none = nullptr;
  if (failed.compare_exchange_strong(none, name) && report[0] != '\0') {
    Report(name);
  }
  errno = current.error;
  return true;
}

// Whether the call fails altogether, for functions that transfer nothing.
bool Refuses(const char* name) { return current.error != 0 && Fires(name); }

// The number of bytes that a call may transfer; -1 when it fails.
ssize_t Allowed(const char* name, size_t size) {
  if (!Fires(name)) {
    return static_cast<ssize_t>(size);
  }
  return current.error != 0 ? -1 : static_cast<ssize_t>(std::min<size_t>(size, 1));
}

}  // namespace

void Arm(const FailNth& order) {
  dl_iterate_phdr(NoteRuntime, nullptr);
  current = order;
  left = order.at;
  failed = nullptr;
  armed = true;
}

const char* Disarm() {
  armed = false;
  return failed;
}

#define EXPORTED extern "C" __attribute__((visibility("default")))
// NOLINTBEGIN(bugprone-macro-parentheses): these are types.
#define REAL(result, name, parameters) \
  static const auto real = reinterpret_cast<result(*) parameters>(dlsym(RTLD_NEXT, #name))

// A function that fails as `called` with the value `failure`.
#define FALLIBLE(result, failure, called, name, parameters, arguments) \
  EXPORTED result name parameters {                                    \
    REAL(result, name, parameters);                                    \
    return Refuses(called) ? failure : real arguments;                 \
  }

// One that transfers `size` bytes at most.
#define TRANSFER(called, name, parameters, arguments) \
  EXPORTED ssize_t name parameters {                  \
    REAL(ssize_t, name, parameters);                  \
    const ssize_t allowed = Allowed(called, size);    \
    if (allowed < 0) {                                \
      return -1;                                      \
    }                                                 \
    size = static_cast<size_t>(allowed);              \
    return real arguments;                            \
  }

#define OPEN(called, name, before, known)                        \
  EXPORTED int name(before const char* path, int flags, ...) {   \
    REAL(int, name, (before const char*, int, ...));             \
    va_list more;                                                \
    va_start(more, flags);                                       \
    const auto mode = va_arg(more, mode_t);                      \
    va_end(more);                                                \
    return Refuses(called) ? -1 : real(known path, flags, mode); \
  }
#define NOTHING
#define FOLDER int folder,
#define FOLDER_ARGUMENT folder,
// NOLINTEND(bugprone-macro-parentheses)
OPEN("open", open, NOTHING, NOTHING)
OPEN("open", open64, NOTHING, NOTHING)
OPEN("open", openat, FOLDER, FOLDER_ARGUMENT)
OPEN("open", openat64, FOLDER, FOLDER_ARGUMENT)

FALLIBLE(int, -1, "open", mkostemp, (char* path, int flags), (path, flags))
FALLIBLE(int, -1, "open", mkostemp64, (char* path, int flags), (path, flags))
FALLIBLE(DIR*, nullptr, "open", opendir, (const char* path), (path))
FALLIBLE(DIR*, nullptr, "open", fdopendir, (int fd), (fd))
FALLIBLE(dirent*, nullptr, "readdir", readdir, (DIR * folder), (folder))
FALLIBLE(dirent64*, nullptr, "readdir", readdir64, (DIR * folder), (folder))

TRANSFER("read", read, (int fd, void* data, size_t size), (fd, data, size))
TRANSFER("read", pread, (int fd, void* data, size_t size, off_t at), (fd, data, size, at))
TRANSFER("read", pread64, (int fd, void* data, size_t size, off64_t at), (fd, data, size, at))
TRANSFER("write", write, (int fd, const void* data, size_t size), (fd, data, size))
TRANSFER("write", pwrite, (int fd, const void* data, size_t size, off_t at), (fd, data, size, at))
TRANSFER("write", pwrite64, (int fd, const void* data, size_t size, off64_t at),
         (fd, data, size, at))
TRANSFER("recv", recv, (int fd, void* data, size_t size, int flags), (fd, data, size, flags))
TRANSFER("send", send, (int fd, const void* data, size_t size, int flags), (fd, data, size, flags))

FALLIBLE(ssize_t, -1, "send", sendmsg, (int fd, const msghdr* message, int flags),
         (fd, message, flags))
FALLIBLE(ssize_t, -1, "recv", recvmsg, (int fd, msghdr* message, int flags), (fd, message, flags))
FALLIBLE(int, -1, "sync", fsync, (int fd), (fd))
FALLIBLE(int, -1, "sync", fdatasync, (int fd), (fd))
FALLIBLE(int, -1, "truncate", ftruncate, (int fd, off_t size) noexcept, (fd, size))
FALLIBLE(int, -1, "truncate", ftruncate64, (int fd, off64_t size) noexcept, (fd, size))
FALLIBLE(int, -1, "rename", rename, (const char* from, const char* to) noexcept, (from, to))
FALLIBLE(int, -1, "unlink", unlink, (const char* path) noexcept, (path))
FALLIBLE(int, -1, "unlink", unlinkat, (int folder, const char* path, int flags) noexcept,
         (folder, path, flags))
FALLIBLE(int, -1, "mkdir", mkdir, (const char* path, mode_t mode) noexcept, (path, mode))
FALLIBLE(int, -1, "chmod", fchmod, (int fd, mode_t mode) noexcept, (fd, mode))
FALLIBLE(int, -1, "chmod", chmod, (const char* path, mode_t mode) noexcept, (path, mode))
FALLIBLE(int, -1, "chown", fchown, (int fd, uid_t user, gid_t group) noexcept, (fd, user, group))
FALLIBLE(int, -1, "flock", flock, (int fd, int operation) noexcept, (fd, operation))
FALLIBLE(int, -1, "stat", stat, (const char* path, struct stat* info) noexcept, (path, info))
FALLIBLE(int, -1, "stat", stat64, (const char* path, struct stat64* info) noexcept, (path, info))
FALLIBLE(int, -1, "stat", lstat, (const char* path, struct stat* info) noexcept, (path, info))
FALLIBLE(int, -1, "stat", lstat64, (const char* path, struct stat64* info) noexcept, (path, info))
FALLIBLE(int, -1, "stat", fstat, (int fd, struct stat* info) noexcept, (fd, info))
FALLIBLE(int, -1, "stat", fstat64, (int fd, struct stat64* info) noexcept, (fd, info))
FALLIBLE(int, -1, "stat", statx,
         (int folder, const char* path, int flags, unsigned mask, struct statx* info) noexcept,
         (folder, path, flags, mask, info))
FALLIBLE(int, -1, "socket", socket, (int domain, int type, int protocol) noexcept,
         (domain, type, protocol))
FALLIBLE(int, -1, "socket", accept4, (int fd, sockaddr* peer, socklen_t* length, int flags),
         (fd, peer, length, flags))
FALLIBLE(int, -1, "socket", epoll_create1, (int flags) noexcept, (flags))
FALLIBLE(int, -1, "socket", inotify_init1, (int flags) noexcept, (flags))
FALLIBLE(int, -1, "connect", connect, (int fd, const sockaddr* peer, socklen_t length),
         (fd, peer, length))
FALLIBLE(int, -1, "poll", poll, (pollfd * fds, nfds_t count, int timeout), (fds, count, timeout))
FALLIBLE(int, -1, "poll", epoll_wait, (int fd, epoll_event* events, int count, int timeout),
         (fd, events, count, timeout))

// dlsym() itself takes memory, so these go by the C library's other names.
// NOLINTBEGIN(bugprone-reserved-identifier,readability-identifier-naming)
extern "C" {
void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* memory, size_t size);
}

static bool RefusesMemory(const void* caller) {
  const auto address = reinterpret_cast<uintptr_t>(caller);
  return armed &&
         std::none_of(std::begin(runtime_code), std::end(runtime_code),
                      [address](const CodeRange& code) {
                        return code.begin <= address && address < code.end;
                      }) &&
         Refuses("malloc");
}

EXPORTED void* malloc(size_t size) noexcept {
  return RefusesMemory(__builtin_return_address(0)) ? nullptr : __libc_malloc(size);
}
EXPORTED void* calloc(size_t count, size_t size) noexcept {
  return RefusesMemory(__builtin_return_address(0)) ? nullptr : __libc_calloc(count, size);
}
EXPORTED void* realloc(void* memory, size_t size) noexcept {
  return RefusesMemory(__builtin_return_address(0)) ? nullptr : __libc_realloc(memory, size);
}

#ifdef FAIL_NTH_MODULE
namespace {

using Main = int (*)(int, char**, char**);
Main program_main;
char calls[1024];

long Number(const char* name) {
  const char* const text = getenv(name);
  return text == nullptr ? 0 : strtol(text, nullptr, 10);
}

void TakeDeathOrders() {
  const char* const file = getenv("FAIL_DEATH");
  if (file == nullptr) {
    return;
  }
  const auto fd = static_cast<int>(syscall(SYS_openat, AT_FDCWD, file, O_RDWR | O_CLOEXEC));
  void* const shared = mmap(nullptr, sizeof(DeathOrder), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  syscall(SYS_close, fd);
  mortal = getpid();
  death = shared == MAP_FAILED ? nullptr : static_cast<DeathOrder*>(shared);
  unsetenv("FAIL_DEATH");
}

void ArmFromEnvironment() {
  const char* const wanted = getenv("FAIL_CALLS");
  if (wanted == nullptr) {
    return;
  }
  strncpy(calls, wanted, sizeof(calls) - 1);
  if (const char* const file = getenv("FAIL_REPORT"); file != nullptr) {
    strncpy(report, file, sizeof(report) - 1);
  }
  Arm({calls, static_cast<int>(Number("FAIL_ERROR")), Number("FAIL_AT"),
       Number("FAIL_LASTING") != 0});
}

int MainWithFaults(int argc, char** argv, char** environment) {
  TakeDeathOrders();
  ArmFromEnvironment();
  return program_main(argc, argv, environment);
}

}  // namespace

EXPORTED int __libc_start_main(Main main, int argc, char** argv, void (*init)(), void (*fini)(),
                               void (*rtld_fini)(), void* stack_end) {
  REAL(int, __libc_start_main, (Main, int, char**, void (*)(), void (*)(), void (*)(), void*));
  program_main = main;
  return real(MainWithFaults, argc, argv, init, fini, rtld_fini, stack_end);
}
#else
// Thousands of errors are no matter for the system's log.
EXPORTED void syslog(int /*priority*/, const char* /*format*/, ...) {}
#endif
// NOLINTEND(bugprone-reserved-identifier,readability-identifier-naming)
