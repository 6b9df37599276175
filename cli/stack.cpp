#include "cli/stack.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <system_error>
#include <thread>
#include <utility>

#include "cli/command.h"
#include "cli/text.h"
#include "common/file.h"
#include "fileindex/paths.h"

namespace vexlo::cli {
namespace {

constexpr auto kTick = std::chrono::milliseconds(20);
constexpr auto kPatience = std::chrono::seconds(4);  // Until a daemon that is to end is killed.
constexpr auto kTrialTime = std::chrono::seconds(60);
constexpr size_t kMostStarts = 5;   // Within the time above.
constexpr int kAlreadyRunning = 3;  // The exit status of a daemon that finds another of its kind.

std::string ProgramFolder() {
  std::error_code error;
  return std::filesystem::read_symlink("/proc/self/exe", error).parent_path();
}

// In the child. What a shell would give for a program that cannot be run is the exit status.
[[noreturn]] void Become(const std::string& program, const std::string& log, pid_t parent) {
  setpgid(0, 0);
  prctl(PR_SET_PDEATHSIG, SIGTERM);
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
  const int in = open("/dev/null", O_RDONLY | O_CLOEXEC);
  const int out = open(log.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  dup2(in, STDIN_FILENO);
  dup2(out, STDOUT_FILENO);
  dup2(out, STDERR_FILENO);
  if (getppid() == parent) {
    execl(program.c_str(), program.c_str(), nullptr);
    const char* const reason = strerror(errno);  // NOLINT(concurrency-mt-unsafe): one thread.
    dprintf(STDERR_FILENO, "%s cannot be run: %s\n", program.c_str(), reason);
  }
  _exit(127);
}

}  // namespace

Stack::Stack(Notice notice) : notice_(std::move(notice)) {
  for (const DaemonPlace& place : LocalDaemons()) {
    children_.push_back({place, {}});
  }
}

Stack::~Stack() { Stop(); }

bool Stack::Start(const std::function<bool()>& is_stopped) {
  for (Child& child : children_) {
    if (ReachOf(child.place.socket) == Reach::kClosed) {
      throw Failure(WhyUnreached(child.place.name, child.place.socket));
    }
    if (IsListening(child.place.socket)) {
      notice_(std::string(child.place.name) + " runs already, and is left alone");
      continue;
    }
    Spawn(child);
    while (!IsListening(child.place.socket)) {
      if (HasEnded(child)) {
        throw Failure(std::string(child.place.name) + " does not start: " + LastWords(child));
      }
      if (is_stopped()) {
        return false;
      }
      std::this_thread::sleep_for(kTick);
    }
  }
  return true;
}

void Stack::Tend() {
  for (Child& child : children_) {
    if (child.pid == 0) {
      TakeOver(child);
      continue;
    }
    if (!HasEnded(child)) {
      continue;
    }
    if (child.exit_status == kAlreadyRunning) {
      child.starts.pop_back();  // Whoever has it was faster, or is just ending it.
      continue;
    }
    notice_(std::string(child.place.name) + " has ended and is started again: " + LastWords(child));
    const Clock::time_point since = Clock::now() - kTrialTime;
    std::erase_if(child.starts, [since](Clock::time_point start) { return start < since; });
    if (child.starts.size() >= kMostStarts) {
      throw Failure(std::string(child.place.name) + " ends again and again; its lines are in '" +
                    LogFile(child) + "'");
    }
    Spawn(child);
  }
}

// Somebody else's is left alone as long as it is there.
void Stack::TakeOver(Child& child) {
  if (ReachOf(child.place.socket) != Reach::kNobody) {
    child.is_missed = false;
    return;
  }
  if (!std::exchange(child.is_missed, true)) {
    notice_(std::string(child.place.name) + " runs no longer, and is started");
  }
  Spawn(child);
}

void Stack::Stop() {
  const Clock::time_point until = Clock::now() + kPatience;
  // The engine and the extraction last, as the other two finish what they have in hand with them.
  for (const bool is_base : {false, true}) {
    const auto in_turn = [&](const Child& child) {
      return child.pid != 0 && (&child < &children_[2]) == is_base;
    };
    for (Child& child : children_) {
      if (in_turn(child)) {
        kill(child.pid, SIGTERM);
      }
    }
    for (Child& child : children_) {
      while (in_turn(child) && !HasEnded(child)) {
        if (Clock::now() > until) {
          kill(child.pid, SIGKILL);
        }
        std::this_thread::sleep_for(kTick);
      }
    }
  }
}

void Stack::Spawn(Child& child) {
  const std::string log = LogFile(child);
  std::error_code error;
  const std::filesystem::path folder = std::filesystem::path(log).parent_path();
  std::filesystem::create_directories(folder, error);
  // The lines name files that others may not see.
  std::filesystem::permissions(folder, std::filesystem::perms::owner_all, error);
  const std::string program = ProgramFolder() + "/" + child.place.name;
  const pid_t parent = getpid();
  const pid_t pid = fork();
  if (pid == 0) {
    Become(program, log, parent);
  }
  if (pid < 0) {
    throw Failure(std::string(child.place.name) +
                  " cannot be started: " + std::generic_category().message(errno));
  }
  child.pid = pid;
  child.starts.push_back(Clock::now());
}

// True once, when it has.
bool Stack::HasEnded(Child& child) {
  int status = 0;
  if (child.pid == 0 || waitpid(child.pid, &status, WNOHANG) == 0) {
    return false;
  }
  child.pid = 0;
  child.exit_status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return true;
}

std::string Stack::LogFile(const Child& child) const {
  return fileindex::GetFileIndexRoot() + "/var/log/fileindex/" + child.place.name + ".log";
}

std::string Stack::LastWords(const Child& child) const {
  std::string text;
  ReadFile(text, LogFile(child));
  while (text.ends_with('\n')) {
    text.pop_back();
  }
  text.erase(0, text.find_last_of('\n') + 1);  // npos + 1 is 0.
  return text.empty() ? "it left no word" : ForTerminal(text);
}

}  // namespace vexlo::cli
