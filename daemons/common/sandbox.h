// What a process gives up for good, so that whoever takes it over gets little. All of it holds for
// the calling thread and what it starts from then on: called before there are other threads.
#ifndef DAEMONS_COMMON_SANDBOX_H_
#define DAEMONS_COMMON_SANDBOX_H_

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

namespace vexlo::daemon {

// A sanitizer's run-time opens files, starts a process and traces it, all at moments of its own.
// So programs that are built with one leave off what keeps them from files and system calls; the
// user, the capabilities and the limits are the same.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
inline constexpr bool kCanBeConfined = false;
#else
inline constexpr bool kCanBeConfined = true;
#endif

struct Account {
  uid_t uid = 0;
  gid_t gid = 0;
};

// The user of that name and its main group; nothing when the system knows none.
std::optional<Account> FindAccount(const std::string& name);

// Turns a superuser into the account, without further groups. True for whoever is none, and for one
// who may not change its identity, which has little to give up; false with errno.
bool BecomeAccount(const Account& account);

// Keeps, of the capabilities that the process has, those of the list (CAP_...), and nothing that a
// program it starts could win by being set-uid or by its file's capabilities. False with errno.
bool KeepCapabilities(const std::vector<int>& kept);

// Refuses (EPERM) the system calls that administer a machine whoever makes them: mounts, modules,
// other kernels, clocks, quotas, tracing, namespaces, keys. No service of this kind has a use for
// them, and CAP_SYS_ADMIN, where one must keep it, comes to less. False with errno. Ends the
// process (status 1) when that takes ten seconds.
bool ForbidAdministration();

// Whether the kernel lets the process be confined by path.
enum class PathRule { kInForce, kNotThere, kFailed };

// No file can be opened, made, changed or removed by its path from here on, but for reading those
// that stand below `readable`; what is open stays so. Ones that are missing give nothing. Neither
// can TCP be spoken, nor, where the kernel knows these scopes, another process signalled or an
// abstract socket of one connected to.
PathRule ForbidPaths(const std::vector<std::string>& readable);

// No file can be written, made, cut or removed by its path from here on but those of `writable` and
// what is below them; reading is as it was, and what is open stays so. Ones that are missing give
// nothing.
PathRule ForbidWriting(const std::vector<std::string>& writable);

// Lets the process do what a reader of open files does: memory that is not executable, reading,
// waiting, messages on `socket`, and writing to its standard output and error. What else libraries
// try as a matter of course is answered with an error: to open a file (unless `may_open`, and then
// for reading alone), to ask for one by its path, to set up a terminal. Any other system call kills
// the process, among them those that start programs, processes and threads, make sockets, and write
// to files. False with errno.
bool AllowReadingOnly(int socket, bool may_open);

}  // namespace vexlo::daemon

#endif  // DAEMONS_COMMON_SANDBOX_H_
