#include "common/lock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <iterator>
#include <random>
#include <sstream>

#include "common/check.h"
#include "common/error.h"

namespace vexlo {
namespace {

constexpr int kMaxAttempts = 64;
constexpr useconds_t kPauseStepMicroseconds = 100000;

// Not rand(): unseeded, every process would draw the same pauses and collide again in step.
useconds_t RandomPause() {
  thread_local std::minstd_rand generator{std::random_device{}()};
  return static_cast<useconds_t>(generator() % 10) * kPauseStepMicroseconds;
}

// Whether everybody may make a file there and nobody remove another's: /tmp.
bool IsInSharedFolder(const std::string& path) {
  const size_t slash = path.rfind('/');
  const std::string folder = slash == std::string::npos ? "." : path.substr(0, slash + 1);
  struct stat info {};
  return stat(folder.c_str(), &info) == 0 && (info.st_mode & S_ISVTX) != 0 &&
         (info.st_mode & S_IWOTH) != 0;
}

bool IsProcessOfRoot(const std::string& process) {
  std::ifstream status("/proc/" + process + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("Uid:")) {
      // Real, effective, saved and of file accesses: a handler may act for a user at the moment.
      std::istringstream ids(line.substr(strlen("Uid:")));
      return std::find(std::istream_iterator<uid_t>(ids), {}, 0U) != std::istream_iterator<uid_t>();
    }
  }
  return false;
}

// Whether a process of root's has an flock on the file, as far as the kernel's list tells.
bool IsHeldByRoot(const std::string& path) {
  struct stat info {};
  if (lstat(path.c_str(), &info) != 0) {
    return false;
  }
  // The device there is not always that of stat(); one file too many does no harm.
  const std::string inode = ":" + std::to_string(info.st_ino);
  std::ifstream locks("/proc/locks");
  for (std::string line; std::getline(locks, line);) {
    std::istringstream fields(line);
    std::string number, kind, manner, access, process, file;
    fields >> number >> kind >> manner >> access >> process >> file;
    if (kind == "FLOCK" && file.ends_with(inode) && IsProcessOfRoot(process)) {
      return true;
    }
  }
  return false;
}

// Lets root, who is not to be kept from its work, remove what another user has put in a shared
// folder under the lock's name: a link (a second name of some file is one), or a file of that
// user's. True when the path is free by it.
bool RemovePlanted(const std::string& path) {
  struct stat info {};
  if (geteuid() != 0 || !IsInSharedFolder(path) || lstat(path.c_str(), &info) != 0 ||
      (S_ISREG(info.st_mode) && info.st_nlink == 1 && info.st_uid == 0) ||
      unlink(path.c_str()) != 0) {
    return false;
  }
  LogLine(VEXLO_SOURCE, __LINE__,
          "what another user put at a lock's path is removed, path=" + path +
              ", uid=" + std::to_string(info.st_uid));
  return true;
}

// Opening without O_CREAT first: with fs.protected_regular set, the kernel refuses even root an
// O_CREAT on another user's file in a sticky directory such as /tmp. Leaves errno when it succeeds.
int OpenWithoutLinks(const char* path) {
  // O_NONBLOCK keeps a FIFO planted at the path from holding us up; it means nothing to a file.
  constexpr int kFlags = O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK;
  const int before = errno;
  int fd = open(path, kFlags);
  if (fd < 0 && errno == ENOENT) {
    fd = open(path, kFlags | O_CREAT, 0644);
    if (fd < 0 && errno == EACCES) {  // Somebody else has made it meanwhile.
      fd = open(path, kFlags);
    }
  }
  struct stat info {};
  if (fd >= 0 && fstat(fd, &info) == 0 && S_ISDIR(info.st_mode)) {
    close(fd);
    fd = -1;
    errno = EISDIR;
  }
  errno = fd < 0 ? errno : before;
  return fd;
}

// A second name in a shared folder leads to a file that has nothing to do with the lock, and which
// somebody else may lock for reasons of their own.
int OpenLockFile(const std::string& path) {
  for (int attempt = 0; attempt < kMaxAttempts; ++attempt) {
    const int fd = OpenWithoutLinks(path.c_str());
    struct stat info {};
    const bool is_second_name =
        fd >= 0 && fstat(fd, &info) == 0 && info.st_nlink > 1 && IsInSharedFolder(path);
    if ((fd >= 0 || errno != ELOOP) && !is_second_name) {
      return fd;
    }
    const int error = is_second_name ? EMLINK : ELOOP;
    if (fd >= 0) {
      close(fd);
    }
    if (!RemovePlanted(path)) {
      errno = error;
      break;
    }
  }
  return -1;
}

bool IsStillAt(int fd, const char* path) {
  struct stat held {};
  struct stat named {};
  return fstat(fd, &held) == 0 && lstat(path, &named) == 0 && held.st_dev == named.st_dev &&
         held.st_ino == named.st_ino;
}

}  // namespace

Mutex::Mutex() : mutex_() { pthread_mutex_init(&mutex_, nullptr); }

Mutex::~Mutex() { pthread_mutex_destroy(&mutex_); }

bool Mutex::Lock() { return pthread_mutex_lock(&mutex_) == 0; }

bool Mutex::TryLock() { return pthread_mutex_trylock(&mutex_) == 0; }

bool Mutex::Unlock() { return pthread_mutex_unlock(&mutex_) == 0; }

LockMutex::LockMutex(Mutex& mutex) : mutex_(mutex) {
  if (!mutex_.Lock()) {
    LogFailure({VEXLO_SOURCE, __LINE__, __func__, "!mutex_.Lock()"}, errno);
  }
}

LockMutex::~LockMutex() {
  if (!mutex_.Unlock()) {
    LogFailure({VEXLO_SOURCE, __LINE__, __func__, "!mutex_.Unlock()"}, errno);
  }
}

LockFile::LockFile(const std::string& path, bool exclusive) : fd_(-1), path_(path) {
  const auto may_go_on = [this] { return !IsHeldByRoot(path_) && RemovePlanted(path_); };
  for (int attempt = 0; attempt < kMaxAttempts || (attempt == kMaxAttempts && may_go_on());
       ++attempt) {
    fd_ = OpenLockFile(path_);
    VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__,
                            "0 > (fd_ = open(path_.c_str(), O_RDONLY | O_CREAT, 0644))"}),
                   0 > fd_, ERR_LOCK, "open failed, path=" + path_ + ", reason=" + strerror(errno));
    const bool locked = flock(fd_, (exclusive ? LOCK_EX : LOCK_SH) | LOCK_NB) == 0;
    if (locked && IsStillAt(fd_, path_.c_str())) {
      return;
    }
    const int error = errno;
    close(fd_);  // The destructor does not run when a constructor throws.
    fd_ = -1;
    if (locked) {
      continue;  // The path names another file by now: nothing to wait for.
    }
    if (error != EINTR && error != EAGAIN) {
      errno = error;
      throw Error(ERR_LOCK, strerror(error));
    }
    usleep(RandomPause());
  }
  throw Error(ERR_LOCK, "Exceed max retry, path=" + path_);
}

LockFile::LockFile(const std::string& path, bool exclusive, std::try_to_lock_t)
    : fd_(-1), path_(path) {
  for (int attempt = 0; attempt < kMaxAttempts; ++attempt) {
    const int fd = OpenLockFile(path_);
    if (fd < 0) {
      return;
    }
    const bool locked = flock(fd, (exclusive ? LOCK_EX : LOCK_SH) | LOCK_NB) == 0;
    if (locked && IsStillAt(fd, path_.c_str())) {
      fd_ = fd;
      return;
    }
    const int error = locked ? EWOULDBLOCK : errno;
    close(fd);
    errno = error;
    if (!locked) {
      return;
    }
  }
}

LockFile::~LockFile() {
  if (fd_ >= 0) {
    flock(fd_, LOCK_UN);
    close(fd_);
  }
}

}  // namespace vexlo
