#include "kavo/exec.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdarg>
#include <memory>
#include <vector>

#include "platform/local/boundary.h"

using kavo::local::SetLastError;

namespace {

// The program and its arguments as execve() takes them, without the null pointer that ends them.
using Arguments = std::vector<char*>;

void Append(Arguments& arguments, va_list rest) {
  while (char* const argument = va_arg(rest, char*)) {
    arguments.push_back(argument);
  }
}

struct Destroy {
  void operator()(posix_spawn_file_actions_t* actions) const {
    posix_spawn_file_actions_destroy(actions);
  }
  void operator()(posix_spawnattr_t* attributes) const { posix_spawnattr_destroy(attributes); }
};

// Starts a program. 0 or the error.
int Spawn(const Arguments& arguments, pid_t& pid) {
  posix_spawn_file_actions_t actions;
  if (const int error = posix_spawn_file_actions_init(&actions); error != 0) {
    return error;
  }
  const std::unique_ptr<posix_spawn_file_actions_t, Destroy> actions_owner(&actions);
  posix_spawnattr_t attributes;
  if (const int error = posix_spawnattr_init(&attributes); error != 0) {
    return error;
  }
  const std::unique_ptr<posix_spawnattr_t, Destroy> attributes_owner(&attributes);
  sigset_t none;
  sigset_t all;
  sigemptyset(&none);
  sigfillset(&all);
  for (const int error :
       {posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0),
        posix_spawn_file_actions_addclosefrom_np(&actions, STDERR_FILENO + 1),
        posix_spawnattr_setsigmask(&attributes, &none),
        posix_spawnattr_setsigdefault(&attributes, &all),
        posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF)}) {
    if (error != 0) {
      return error;
    }
  }
  return posix_spawn(&pid, arguments.front(), &actions, &attributes, arguments.data(), environ);
}

// What KLIBCExec() returns.
int Run(Arguments& arguments) {
  arguments.push_back(nullptr);
  pid_t pid = -1;
  if (const int error = Spawn(arguments, pid); error != 0) {
    errno = error;
    return SetLastError(KAVO_ERR_SYSTEM);
  }
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno == ECHILD) {  // The end has been waited for; what it was nobody keeps.
      return 0;
    }
    if (errno != EINTR) {
      return SetLastError(KAVO_ERR_SYSTEM);
    }
  }
  return WIFSIGNALED(status) ? 128 + WTERMSIG(status) : WEXITSTATUS(status);
}

// What both functions do once they have found their list; `rest` ends in a null pointer.
int RunList(const char* path, va_list rest) noexcept {
  return kavo::local::Guarded([path, &rest] {
    Arguments arguments{const_cast<char*>(path)};
    Append(arguments, rest);
    return Run(arguments);
  });
}

}  // namespace

int KLIBCExec(const char* path, ...) {
  va_list rest;
  va_start(rest, path);
  const int result = RunList(path, rest);
  va_end(rest);
  return result;
}

int KLIBCExecl(const char* path, int options, ...) {
  va_list rest;
  va_start(rest, options);
  const int result = RunList(path, rest);
  va_end(rest);
  return result;
}
