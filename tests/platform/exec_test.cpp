#include "kavo/exec.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <thread>
#include <tuple>
#include <vector>

#include "kavo/last_error.h"
#include "kavo/local/shares.h"
#include "kavo/service.h"
#include "support/faults.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

FAULTABLE(pid_t, waitpid, (pid_t child, int* status, int options), (child, status, options))

std::string root;
std::string systemctl;  // What is run in its place.
bool has_systemd = false;

// Stands before the platform's own.
__attribute__((visibility("default"))) const std::string& kavo::local::Root() { return root; }

INTERPOSED int stat(const char* path, struct stat* info) noexcept {
  static const auto real = REAL_FUNCTION(int, stat, (const char*, struct stat*));
  const bool is_asked = std::string(path) == "/run/systemd/system";
  return real(!is_asked ? path : has_systemd ? "/" : "/dev/null", info);
}

INTERPOSED int posix_spawn(pid_t* pid, const char* path, const posix_spawn_file_actions_t* actions,
                           const posix_spawnattr_t* attributes, char* const* arguments,
                           char* const* environment) {
  static const auto real =
      reinterpret_cast<decltype(&posix_spawn)>(dlsym(RTLD_NEXT, "posix_spawn"));
  return real(pid, std::string(path) == "/bin/systemctl" ? systemctl.c_str() : path, actions,
              attributes, arguments, environment);
}

// What a run writes to its standard output.
template <typename... Arguments>
std::string OutputOf(Arguments... arguments) {
  testing::internal::CaptureStdout();
  EXPECT_EQ(KLIBCExec(arguments..., nullptr), 0);
  return testing::internal::GetCapturedStdout();
}

TEST(KLIBCExec, TellsHowTheProgramEnded) {
  const TempFolder folder;
  WriteText(folder / "script", "exit 0\n");  // No shell takes what the kernel does not.
  ASSERT_EQ(chmod((folder / "script").c_str(), 0755), 0);
  using Case = std::tuple<std::string, const char*, int, int>;
  for (const auto& [path, script, want, error] : {
           Case{"/bin/sh", "exit 255", 255, 0},
           Case{"/bin/sh", "kill -9 $$", 137, 0},
           Case{folder / "missing", "", -1, ENOENT},
           Case{folder / "script", "", -1, ENOEXEC},
       }) {
    for (const bool is_lost : {false, true}) {  // As nobody keeps the exit status.
      const auto before = signal(SIGCHLD, is_lost ? SIG_IGN : SIG_DFL);
      const int got = is_lost ? KLIBCExecl(path.c_str(), 187, "-c", script, nullptr)
                              : KLIBCExec(path.c_str(), "-c", script, nullptr);
      EXPECT_TRUE(error == 0 || (errno == error && KLIBCErrGet() == KAVO_ERR_SYSTEM)) << path;
      EXPECT_EQ(got, want > 0 && is_lost ? 0 : want) << path << " " << script;
      signal(SIGCHLD, before);
    }
  }
}

TEST(KLIBCExec, HandsOnArgumentsAndNothingElse) {
  EXPECT_EQ(OutputOf("/usr/bin/printf", "[%s]", "-n", "", "a b", "'\"$HOME`", "*\n;\\", "\xff"),
            "[-n][][a b]['\"$HOME`][*\n;\\][\xff]");
  EXPECT_EQ(OutputOf("/bin/readlink", "/proc/self/fd/0"), "/dev/null\n");
  // NOLINTNEXTLINE(android-cloexec-dup): one that is inherited is what this is about.
  const int leaked = dup(STDERR_FILENO);
  EXPECT_EQ(OutputOf("/bin/ls", "/proc/self/fd"), "0\n1\n2\n3\n");  // The last is its own.
  close(leaked);
  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  const auto handler = signal(SIGPIPE, SIG_IGN);
  pthread_sigmask(SIG_BLOCK, &all, &before);
  const std::string signals = OutputOf("/bin/grep", "-E", "^Sig(Blk|Ign)", "/proc/self/status");
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  signal(SIGPIPE, handler);
  unsigned long long blocked = 1;
  unsigned long long ignored = 1;
  EXPECT_EQ(sscanf(signals.c_str(), "SigBlk: %llx SigIgn: %llx", &blocked, &ignored), 2);
  EXPECT_EQ(blocked | (ignored & ~0x180000000ULL), 0U);  // 32 and 33 are the C library's own.
}

TEST(KLIBCExec, WaitsForItsOwnChildAlone) {
  const pid_t other = fork();
  if (other == 0) {
    _exit(42);
  }
  siginfo_t info;
  ASSERT_EQ(waitid(P_PID, static_cast<id_t>(other), &info, WEXITED | WNOWAIT), 0);
  {
    const ScopedFault fault("waitpid", EINTR);
    std::vector<std::jthread> threads;
    threads.reserve(80);
    for (int i = 0; i < 80; ++i) {
      threads.emplace_back([i] {
        const std::string script = "exit " + std::to_string(i);
        EXPECT_EQ(KLIBCExec("/bin/sh", "-c", script.c_str(), nullptr), i);
      });
    }
  }
  int status = 0;
  EXPECT_EQ(waitpid(other, &status, 0), other);
  EXPECT_EQ(WEXITSTATUS(status), 42);
}

TEST(KLIBService, TellsTheServiceManagerWhereThereIsOne) {
  const TempFolder folder;
  systemctl = folder / "systemctl";
  const auto search = [](const char* share) { return KAVOSMBSetSpotlight(share, 1); };
  using Case = std::tuple<int (*)(const char*), bool, const char*, const char*, int, std::string>;
  for (const auto& [call, has_manager, own_root, status, error, want] : {
           Case{KLIBServicectlStart, true, "", "0", 0, "start -- -a.service"},
           Case{KLIBServiceRestart, true, "", "4", EACCES, "restart -- -a.service"},
           Case{KLIBServicectlStart, false, "", "1", 0, ""},
           Case{KLIBServicectlStart, true, "/private", "1", 0, ""},
           Case{search, true, "", "1", 0, ""},
       }) {
    std::tie(has_systemd, root) = std::tie(has_manager, own_root);
    const std::string told = folder / "told";
    WriteText(told, "");
    WriteText(systemctl, "#!/bin/sh\nprintf '%s ' \"$@\" >" + told + "; exit " + status);
    ASSERT_EQ(chmod(systemctl.c_str(), 0755), 0);
    SyslogCapture log;
    EXPECT_EQ(call("-a"), error == 0 ? 0 : -1) << want;
    EXPECT_TRUE(error == 0 || errno == error) << want;
    EXPECT_EQ(ReadText(told), want.empty() ? "" : "--no-ask-password --no-block " + want + " ");
    EXPECT_EQ(log.Take().size(), want.empty() ? 1U : 0U) << want << own_root;
  }
}
