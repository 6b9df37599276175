// Makes system calls fail on demand, also inside the shared libraries.
//
// A test program defines the functions it wants to fail, once each:
//
//   FAULTABLE(int, fsync, (int fd), (fd))
//   ...
//   const ScopedFault fault("fsync", EIO);
#ifndef SUPPORT_FAULTS_H_
#define SUPPORT_FAULTS_H_

#include <dlfcn.h>

#include <atomic>
#include <cerrno>
#include <cstring>

// While one of these lives, the `nth` call of the function from now on, and with `lasting` all that
// follow it, return -1 with errno `error`. One at a time.
class ScopedFault {
 public:
  ScopedFault(const char* function, int error, int nth = 1, bool lasting = false)
      : function_(function), error_(error), left_(nth), lasting_(lasting) {
    current_ = this;
  }
  ~ScopedFault() { current_ = nullptr; }
  ScopedFault(const ScopedFault&) = delete;
  ScopedFault& operator=(const ScopedFault&) = delete;

  // Whether the call was reached.
  bool Fired() const { return left_ <= 0; }

  // Asked by each faultable function; sets errno.
  static bool Fires(const char* function) noexcept {
    ScopedFault* const fault = current_;
    if (fault == nullptr || strcmp(function, fault->function_) != 0) {
      return false;
    }
    const int left = --fault->left_;
    const bool fires = left == 0 || (left < 0 && fault->lasting_);
    errno = fires ? fault->error_ : errno;
    return fires;
  }

 private:
  inline static constinit std::atomic<ScopedFault*> current_ = nullptr;

  const char* function_;
  int error_;
  std::atomic<int> left_;
  bool lasting_;
};

// Exported, as shared libraries would not find it otherwise.
#define INTERPOSED extern "C" __attribute__((visibility("default")))

// The C library's function behind the program's own.
// NOLINTBEGIN(bugprone-macro-parentheses): these are types.
#define REAL_FUNCTION(result, name, parameters) \
  reinterpret_cast<result(*) parameters>(dlsym(RTLD_NEXT, #name))
// NOLINTEND(bugprone-macro-parentheses)

#define FAULTABLE(result, name, parameters, arguments)                \
  INTERPOSED result name parameters {                                 \
    static const auto real = REAL_FUNCTION(result, name, parameters); \
    return ScopedFault::Fires(#name) ? -1 : real arguments;           \
  }

#endif  // SUPPORT_FAULTS_H_
