#include "daemons/kavoelasticd/judge.h"

#include <fcntl.h>
#include <linux/capability.h>
#include <poll.h>
#include <sys/capability.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstring>
#include <exception>
#include <memory>
#include <string_view>
#include <system_error>
#include <unordered_map>
#include <utility>

#include "daemons/common/sandbox.h"
#include "daemons/kavoelasticd/failure.h"
#include "kavo/local/frames.h"

namespace vexlo::elasticd {
namespace {

constexpr int kSocket = 3;
// Of one message: it has some 4 MiB at most, with the longest paths there are.
constexpr size_t kPathsAtOnce = 1024;
constexpr size_t kMostBytes = size_t{16} << 20;
constexpr size_t kMostFolders = 256;  // Held open.
constexpr std::chrono::seconds kPatience(10);
constexpr kavo::local::Deadline kNever = kavo::local::Deadline::max();

// A message is numbers of 64 bits, and behind them in a question the paths, each ended by a NUL:
//   question  UID GID COUNT-OF-GROUPS GROUP... PATHS
//   answer    for each path 1 and the time, or 0 and 0
void Append(std::string& message, uint64_t number) {
  message.append(reinterpret_cast<const char*>(&number), sizeof(number));
}

uint64_t TakeNumber(std::string_view& message) {
  uint64_t number = 0;
  memcpy(&number, message.data(), std::min(message.size(), sizeof(number)));
  message.remove_prefix(std::min(message.size(), sizeof(number)));
  return number;
}

// By system calls, as the C library has no words for what files are judged by alone, and none that
// leave the process able to do it again.
bool TakeOn(uid_t uid, gid_t gid, const std::vector<gid_t>& groups) {
  return uid != 0 && syscall(SYS_setgroups, groups.size(), groups.data()) == 0 &&
         syscall(SYS_setfsgid, gid) >= 0 && syscall(SYS_setfsuid, uid) >= 0 &&
         static_cast<gid_t>(syscall(SYS_setfsgid, -1)) == gid &&
         static_cast<uid_t>(syscall(SYS_setfsuid, -1)) == uid;
}

// The folders of one question, each looked up once.
class Folders {
 public:
  // -1 for one that cannot be reached.
  int Find(const std::string& path) {
    const auto found = open_.find(path);
    if (found != open_.end()) {
      return found->second.Get();
    }
    if (open_.size() >= kMostFolders) {
      open_.clear();
    }
    daemon::UniqueFd folder(open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    return open_.emplace(path, std::move(folder)).first->second.Get();
  }

 private:
  std::unordered_map<std::string, daemon::UniqueFd> open_;
};

Verdict JudgePath(Folders& folders, const std::string& path) {
  const size_t slash = path.rfind('/');
  const std::string name = slash == std::string::npos ? "" : path.substr(slash + 1);
  if (!path.starts_with('/') || name.empty()) {
    return {};
  }
  const int folder = folders.Find(path.substr(0, std::max<size_t>(slash, 1)));
  struct stat info {};
  // A link is not read, but what it leads to: nothing that is indexed is one.
  if (folder < 0 ||
      syscall(SYS_faccessat2, folder, name.c_str(), R_OK, AT_EACCESS | AT_SYMLINK_NOFOLLOW) != 0 ||
      fstatat(folder, name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0 || S_ISLNK(info.st_mode)) {
    return {};
  }
  return {true, static_cast<int64_t>(info.st_ctim.tv_sec) * 1000000000 + info.st_ctim.tv_nsec};
}

std::string Answer(std::string_view question) {
  const auto uid = static_cast<uid_t>(TakeNumber(question));
  const auto gid = static_cast<gid_t>(TakeNumber(question));
  std::vector<gid_t> groups(
      std::min<uint64_t>(TakeNumber(question), question.size() / sizeof(uint64_t)));
  for (gid_t& group : groups) {
    group = static_cast<gid_t>(TakeNumber(question));
  }
  const bool is_taken = TakeOn(uid, gid, groups);
  Folders folders;
  std::string answer;
  while (!question.empty()) {
    const std::string path(question.substr(0, question.find('\0')));
    question.remove_prefix(std::min(path.size() + 1, question.size()));
    const Verdict verdict = is_taken ? JudgePath(folders, path) : Verdict();
    Append(answer, verdict.is_readable ? 1 : 0);
    Append(answer, static_cast<uint64_t>(verdict.changed));
  }
  return answer;
}

bool Prepare(int socket) {
  for (const int signal : {SIGHUP, SIGINT, SIGTERM}) {  // The engine's, which closes the socket.
    std::signal(signal, SIG_IGN);
  }
  prctl(PR_SET_NAME, "kavoe-judge");
  // A duplicate onto itself would keep the mark that closes it.
  return (socket == kSocket || dup2(socket, kSocket) == kSocket) &&
         close_range(kSocket + 1, ~0U, 0) == 0 && chdir("/") == 0 &&
         daemon::KeepCapabilities({CAP_SETUID, CAP_SETGID}) &&
         (!daemon::kCanBeConfined || (daemon::ForbidAdministration() &&
                                      daemon::ForbidWriting({}) != daemon::PathRule::kFailed));
}

[[noreturn]] void RunJudge(int socket) {
  std::string question;
  bool goes_on = Prepare(socket);
  try {
    while (goes_on && kavo::local::ReceiveFrame(kSocket, kMostBytes, question, nullptr, kNever)) {
      goes_on = kavo::local::SendFrame(kSocket, Answer(question), -1, kNever);
    }
  } catch (const std::exception&) {  // Memory is short. Its end is seen as one.
  }
  _exit(0);
}

bool MayBecomeOthers() {
  const auto has = [](int capability) {
    const std::unique_ptr<std::remove_pointer_t<cap_t>, decltype(&cap_free)> own(cap_get_proc(),
                                                                                 cap_free);
    cap_flag_value_t value = CAP_CLEAR;
    return own != nullptr && cap_get_flag(own.get(), capability, CAP_EFFECTIVE, &value) == 0 &&
           value == CAP_SET;
  };
  return has(CAP_SETUID) && has(CAP_SETGID);
}

}  // namespace

Judge::Judge() {
  if (!MayBecomeOthers()) {
    return;
  }
  int ends[2] = {-1, -1};
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) {
    throw std::system_error(errno, std::generic_category(), "socketpair failed");
  }
  daemon::UniqueFd ours(ends[0]);
  const daemon::UniqueFd theirs(ends[1]);
  const pid_t pid = fork();
  if (pid < 0) {
    throw std::system_error(errno, std::generic_category(), "fork failed");
  }
  if (pid == 0) {
    RunJudge(theirs.Get());
  }
  socket_ = std::move(ours);
}

bool Judge::AwaitEnd(int quit) const {
  struct pollfd fds[] = {{socket_.Get(), 0, 0}, {quit, POLLIN, 0}};
  while (poll(fds, 2, -1) <= 0) {
  }
  return fds[1].revents == 0;
}

std::vector<Verdict> Judge::Ask(const daemon::Peer& peer, const std::vector<std::string>& paths) {
  std::vector<Verdict> verdicts;
  verdicts.reserve(paths.size());
  const kavo::local::MutexLock lock(mutex_);
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  for (size_t from = 0; from < paths.size(); from += kPathsAtOnce) {
    if (std::chrono::steady_clock::now() >= deadline) {
      throw Failure(Code::kTimeIsUp, "it takes too long to tell who may read what: ask for less");
    }
    AskSome(peer, paths, from, std::min(kPathsAtOnce, paths.size() - from), verdicts);
  }
  return verdicts;
}

void Judge::AskSome(const daemon::Peer& peer, const std::vector<std::string>& paths, size_t from,
                    size_t count, std::vector<Verdict>& verdicts) {
  if (is_waiting_) {
    Receive();
  }
  std::string question;
  Append(question, peer.uid);
  Append(question, peer.gid);
  Append(question, peer.groups.size());
  for (const gid_t group : peer.groups) {
    Append(question, group);
  }
  for (size_t i = from; i < from + count; ++i) {
    question.append(paths[i].c_str(), paths[i].size() + 1);
  }
  is_waiting_ = kavo::local::SendFrame(socket_.Get(), question, -1, kNever);
  const std::string answer = Receive();
  if (answer.size() != count * 2 * sizeof(uint64_t)) {
    throw Failure(Code::kInternal, "it cannot be told who may read what");
  }
  std::string_view left = answer;
  while (!left.empty()) {
    const bool is_readable = TakeNumber(left) == 1;
    verdicts.push_back({is_readable, static_cast<int64_t>(TakeNumber(left))});
  }
}

// The answer to the last question. One that does not come in time is received before the next.
std::string Judge::Receive() {
  struct pollfd socket = {socket_.Get(), POLLIN, 0};
  std::string answer;
  if (!is_waiting_ || poll(&socket, 1, std::chrono::milliseconds(kPatience).count()) != 1 ||
      !kavo::local::ReceiveFrame(socket_.Get(), kMostBytes, answer, nullptr, kNever)) {
    throw Failure(Code::kInternal, "it cannot be told who may read what");
  }
  is_waiting_ = false;
  return answer;
}

}  // namespace vexlo::elasticd
