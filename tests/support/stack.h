// The four daemons and the tool, as a machine runs them, on the root of the test program.
#ifndef SUPPORT_STACK_H_
#define SUPPORT_STACK_H_

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "common/json.h"
#include "fileindex/comm.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/index_mgr/monitor.h"
#include "fileindex/paths.h"
#include "support/private_root.h"
#include "support/program.h"
#include "support/raw_client.h"

// As the program's CMakeLists.txt defines them.
inline const std::map<std::string, std::string> kDaemonPrograms = {
    {"kavoelasticd", KAVOELASTICD_PROGRAM},
    {"kavocontentextractd", KAVOCONTENTEXTRACTD_PROGRAM},
    {"fileindexd", FILEINDEXD_PROGRAM},
    {"evnotifyd", EVNOTIFYD_PROGRAM},
};

// A share "docs" with a folder "in", folders outside of both, and the daemons, of which none runs
// at first. Everything below the root is made anew for each of these, and must be on one file
// system, so that renames work. Where something does not come about, the test fails with the logs.
class Daemons {
 public:
  using Clock = std::chrono::steady_clock;

  // `arguments` of each daemon, by its name.
  explicit Daemons(const PrivateRoot& root, std::map<std::string, std::string> arguments = {})
      : root_(root), arguments_(std::move(arguments)) {
    for (const char* const name : {"var", "vol", "tmp", "logs"}) {
      std::filesystem::remove_all(root / name);
    }
    // As an installation has them, and the test's own.
    for (const char* const name :
         {"var/run", "var/packages/Vexlo/etc", "var/lib/kavo/fileindex/queue",
          "var/lib/kavo/fileindex/db", "var/lib/kavo/evnotify", "tmp", "vol/docs/in", "vol/out",
          "logs"}) {
      root.MakeFolder(name);
    }
    SetShare("");
  }
  // The watcher first, so that everybody still has whom it talks to.
  ~Daemons() {
    for (const char* const name :
         {"evnotifyd", "fileindexd", "kavocontentextractd", "kavoelasticd"}) {
      if (programs_.contains(name)) {
        Signal(name, SIGCONT);
        EXPECT_EQ(End(name, SIGTERM), 0) << name << "\n" << Logs();
      }
    }
  }
  Daemons(const Daemons&) = delete;
  Daemons& operator=(const Daemons&) = delete;

  // Returns when the daemon answers, or has ended. `before` stands before its command.
  void Start(const std::string& name, const std::string& before = "") {
    const std::string command = before + kDaemonPrograms.at(name) + " " + arguments_[name] + " >&2";
    programs_.emplace(
        name, std::make_unique<Program>("exec 2>>'" + root_ / ("logs/" + name) + "'", command));
    EXPECT_TRUE(Await([&] { return IsAnswering(name) || HasEnded(name); })) << name << "\n"
                                                                            << Logs();
    EXPECT_TRUE(!before.empty() || !HasEnded(name)) << name << "\n" << Logs();
  }
  // Whether it has ended by itself; End() has its status then.
  bool HasEnded(const std::string& name) const { return HasEnded(*programs_.at(name)); }
  pid_t Pid(const std::string& name) const { return programs_.at(name)->pid; }
  void Signal(const std::string& name, int signal) { kill(programs_.at(name)->pid, signal); }
  // The exit status, or 128 and the signal.
  int End(const std::string& name, int signal) {
    const std::unique_ptr<Program> program = std::move(programs_.extract(name).mapped());
    return program->End(signal);
  }
  void Restart(const std::string& name, int signal) {
    End(name, signal);
    Start(name);
  }

  // The exit status of the tool with these arguments of a shell, or 128 and the signal that ended
  // it; its output goes to the logs. `before` stands before its command. When it takes longer than
  // the time it is killed.
  int Tool(const std::string& arguments, const std::string& before = "",
           std::chrono::microseconds longest = std::chrono::hours(1)) const {
    Program tool("exec 2>>'" + root_ / "logs/tool" + "'",
                 before + FILEINDEX_PROGRAM + " " + arguments + " >&2");
    const auto deadline = Clock::now() + longest;
    while (!HasEnded(tool) && Clock::now() < deadline) {
      usleep(200);
    }
    return tool.End(HasEnded(tool) ? 0 : SIGKILL);
  }

  // Members of the share's entry besides name and path, each with a comma before it.
  void SetShare(const std::string& more) const {
    root_.SetShares(R"({"name":"docs","path":")" + Share() + "\"" + more + "}");
  }
  // The list of folders and the registration of the share, without the tool: those with everything,
  // and those without documents.
  static void SetFolders(const std::vector<std::string>& paths,
                         const std::vector<std::string>& without_documents = {}) {
    Json::Value list(Json::arrayValue);
    const auto add = [&list](const std::string& path, bool document) {
      Json::Value& folder = list.append(Json::objectValue);
      folder["path"] = path;
      folder["name"] = "x";
      folder["document"] = document;
      folder["audio"] = folder["video"] = folder["photo"] = true;
    };
    for (const std::string& path : paths) {
      add(path, /*document=*/true);
    }
    for (const std::string& path : without_documents) {
      add(path, /*document=*/false);
    }
    WriteText(vexlo::fileindex::kFileIndexFoldersCfgPath.Get(), vexlo::JsonToString(list));
    vexlo::fileindex::FolderMgr folders;
    vexlo::fileindex::UpsertEVNotifydCfg("docs", folders);
  }
  std::string Share() const { return root_ / "vol/docs"; }
  std::string In() const { return root_ / "vol/docs/in"; }
  std::string In(const std::string& name) const { return In() + "/" + name; }
  // Makes the file's folder, too.
  void Write(const std::string& name, const std::string& text = "text") const {
    std::filesystem::create_directories(std::filesystem::path(In(name)).parent_path());
    WriteText(In(name), text);
  }
  std::string Out() const { return root_ / "vol/out"; }
  std::string QueueFolder() const { return root_ / "var/lib/kavo/fileindex/queue"; }

  // Sends a command to the index daemon.
  Json::Value Command(const std::string& text) const {
    return Reply("fileindexd", text + std::string(1, '\0'));
  }
  // The index daemon's word on the share, and the notify daemon's on its queue; null without any.
  Json::Value Indexing() const { return Command(R"({"type":"stats","data":null})")["shares"][0]; }
  Json::Value Watching() const { return WatchedQueues()[0]; }
  Json::Value WatchedQueues() const {
    return Reply("evnotifyd", R"({"command":"stats"})")["queues"];
  }

  // Waits until it holds, for as long as a busy machine may take.
  static bool Await(const std::function<bool()>& holds,
                    std::chrono::seconds patience = std::chrono::seconds(120)) {
    const auto deadline = Clock::now() + patience;
    while (!holds()) {
      if (Clock::now() > deadline) {
        return false;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
  }

  // The end of each daemon's log.
  std::string Logs() const {
    constexpr size_t kMostBytes = 3000;
    std::string text;
    for (const auto& entry : std::filesystem::directory_iterator(root_ / "logs")) {
      const std::string log = ReadText(entry.path());
      text.append("--- ").append(entry.path().filename()).append("\n");
      text.append(log, log.size() - std::min(log.size(), kMostBytes));
    }
    return text;
  }

 private:
  static bool HasEnded(const Program& program) {
    siginfo_t info{};
    return waitid(P_PID, static_cast<id_t>(program.pid), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
           info.si_pid != 0;
  }

  std::string SocketOf(const std::string& name) const {
    return root_ / ("var/run/" + name + ".sock");
  }

  bool IsAnswering(const std::string& name) const {
    // NOLINTNEXTLINE(cppcoreguidelines-pro-type-member-init): of a C structure.
    struct sockaddr_un address {};
    address.sun_family = AF_UNIX;
    SocketOf(name).copy(address.sun_path, sizeof(address.sun_path) - 1);
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    const bool answers =
        connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0;
    close(fd);
    return answers;
  }
  Json::Value Reply(const std::string& name, const std::string& request) const {
    Json::Value reply;
    return vexlo::JsonFromString(reply, Ask(SocketOf(name), request)) ? reply : Json::Value();
  }

  const PrivateRoot& root_;
  std::map<std::string, std::string> arguments_;
  std::map<std::string, std::unique_ptr<Program>> programs_;
};

// All of them at work, with the folder "in" indexed.
class Stack : public Daemons {
 public:
  // `prepare` makes what else is to be there before the first daemon starts.
  explicit Stack(
      const PrivateRoot& root, std::map<std::string, std::string> arguments = {},
      const std::function<void()>& prepare = [] {})
      : Daemons(root, WithCycle(std::move(arguments))) {
    prepare();
    for (const char* const name : {"kavoelasticd", "kavocontentextractd", "fileindexd"}) {
      Start(name);
    }
    Start("evnotifyd");
    EXPECT_EQ(Tool("folder add '" + In() + "'"), 0) << Logs();
  }

  // Waits until all that happened before the call is in the index: until a file that is made now is
  // found, then one that is made after that, as the watcher holds a rename back for some
  // milliseconds to see where it goes, and there is nothing left to do.
  // `before_look` is called before each look at what is left.
  testing::AssertionResult AwaitQuiet(const std::function<void()>& before_look = [] {}) {
    for (int i = 0; i < 2; ++i) {
      const std::string token = "marker" + std::to_string(++markers_);
      WriteText(In() + "/marker.txt", token);
      if (!Await([&] { return IsFound(token); })) {
        return testing::AssertionFailure() << token << " is not found\n" << Logs();
      }
    }
    const auto is_idle = [&] {
      before_look();
      return IsIdle();
    };
    if (!Await(is_idle)) {
      return testing::AssertionFailure() << "no end: " << vexlo::JsonToString(Indexing()) << Logs();
    }
    return testing::AssertionSuccess();
  }
  bool IsIdle() const {
    std::error_code error;
    return Indexing()["state"] == "idle" && std::filesystem::is_empty(QueueFolder(), error);
  }
  bool IsFound(const std::string& token) const {
    Json::Value request;
    request["command"] = "search";
    request["data"]["words"] = token;
    Json::Value reply;
    try {
      vexlo::SendRequestImpl(reply, request);
    } catch (const std::exception&) {
      return false;
    }
    return !reply["data"].empty();
  }

 private:
  static std::map<std::string, std::string> WithCycle(
      std::map<std::string, std::string> arguments) {
    arguments.try_emplace("fileindexd", "--cycle 50");
    return arguments;
  }

  int markers_ = 0;
};

#endif  // SUPPORT_STACK_H_
