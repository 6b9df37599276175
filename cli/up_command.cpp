// "fileindex up DIR...": the whole local stack in the foreground.
#include <json/value.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdint>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <map>
#include <optional>
#include <thread>

#include "cli/command.h"
#include "cli/folder_change.h"
#include "cli/service.h"
#include "cli/stack.h"
#include "cli/stop_signals.h"
#include "cli/text.h"
#include "common/file.h"
#include "common/json.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/paths.h"

namespace vexlo::cli {
namespace {

using Clock = std::chrono::steady_clock;

constexpr auto kProgressInterval = std::chrono::milliseconds(100);
constexpr auto kLineInterval = std::chrono::seconds(2);  // Where there is no terminal.
constexpr auto kFollowInterval = std::chrono::seconds(1);
constexpr size_t kBarWidth = 30;

// What ends the command, blocked as long as it lives.
class StopSignals {
 public:
  StopSignals() { sigprocmask(SIG_BLOCK, &signals_, &before_); }
  ~StopSignals() {
    // A second Ctrl-C, while all was ending, asked for nothing new.
    constexpr timespec kNoTime = {0, 0};
    while (sigtimedwait(&signals_, nullptr, &kNoTime) > 0) {
    }
    sigprocmask(SIG_SETMASK, &before_, nullptr);
  }
  StopSignals(const StopSignals&) = delete;
  StopSignals& operator=(const StopSignals&) = delete;

  // Whether one has come by now, or comes within the time.
  bool Await(std::chrono::milliseconds time) {
    const timespec wait = {time.count() / 1000, time.count() % 1000 * 1000000};
    stopped_ = stopped_ || sigtimedwait(&signals_, nullptr, &wait) > 0;
    return stopped_;
  }

 private:
  const sigset_t signals_ = StopSignalSet();
  sigset_t before_{};
  bool stopped_ = false;
};

// Counts what is in folders, on a thread of its own.
class Count {
 public:
  explicit Count(std::vector<std::string> folders)
      : thread_([this, folders = std::move(folders)] { Run(folders); }) {}
  ~Count() {
    ending_ = true;
    thread_.join();
  }
  Count(const Count&) = delete;
  Count& operator=(const Count&) = delete;

  uint64_t Get() const { return count_; }
  bool IsDone() const { return done_; }

 private:
  void Run(const std::vector<std::string>& folders) {
    for (const std::string& folder : folders) {
      ++count_;
      std::error_code error;
      const auto options = std::filesystem::directory_options::skip_permission_denied;
      for (std::filesystem::recursive_directory_iterator entry(folder, options, error), end;
           !error && entry != end && !ending_; entry.increment(error)) {
        ++count_;
      }
    }
    done_ = true;
  }

  std::atomic<uint64_t> count_ = 0;
  std::atomic<bool> done_ = false;
  std::atomic<bool> ending_ = false;
  std::thread thread_;
};

// What the terminal shows without going on to another line, at its present size.
size_t WidestLine() {
  winsize size{};
  return ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) != 0 || size.ws_col == 0 ? std::string::npos
                                                                          : size.ws_col - 1U;
}

// Says things to people, or in JSON to programs: an object a line, with "event".
class Voice {
 public:
  Voice(const Console& console, bool as_json)
      : console_(console), as_json_(as_json), has_bar_(console.out_is_terminal && !as_json) {}

  void Say(const char* event, const std::string& text, Json::Value fields = Json::objectValue) {
    Wipe();
    if (as_json_) {
      fields["event"] = event;
      fields["text"] = text;
      console_.out << JsonToString(fields) << "\n" << std::flush;
    } else {
      console_.out << ForTerminal(text) << "\n" << std::flush;
    }
  }

  // Drawn over the last one on a terminal, no wider than that; elsewhere a line every other second
  // in which something was done.
  void ShowProgress(uint64_t done, const Count& total, double seconds) {
    const auto rate = static_cast<uint64_t>(static_cast<double>(done) / std::max(seconds, 0.001));
    std::string text = Counted(done, "file");
    if (total.IsDone()) {
      text += " of about " + Grouped(std::max(total.Get(), done));
    }
    text += ", " + Grouped(rate) + " a second";
    if (total.IsDone() && rate > 0 && total.Get() > done) {
      text += ", " + Counted((total.Get() - done) / rate + 1, "second") + " left";
    }
    if (has_bar_) {
      const size_t most = std::max<uint64_t>({total.Get(), done, 1});
      const size_t filled = total.IsDone() ? done * kBarWidth / most : 0;
      std::string bar = "[" + std::string(filled, '#');
      bar.append(kBarWidth - filled, '.').append("] ").append(text);
      console_.out << "\r\033[K" << bar.substr(0, WidestLine()) << std::flush;
      drawn_ = true;
    } else if (Clock::now() >= next_ && done != done_said_) {
      next_ = Clock::now() + kLineInterval;
      done_said_ = done;
      Json::Value fields;
      fields["done"] = Json::UInt64{done};
      fields["total"] = total.IsDone() ? Json::Value(Json::UInt64{total.Get()}) : Json::Value();
      fields["rate"] = Json::UInt64{rate};
      Say("progress", "indexing: " + text, fields);
    }
  }

 private:
  void Wipe() {
    if (drawn_) {
      console_.out << "\r\033[K";
      drawn_ = false;
    }
  }

  const Console& console_;
  const bool as_json_;
  const bool has_bar_;
  bool drawn_ = false;
  uint64_t done_said_ = UINT64_MAX;
  Clock::time_point next_ = Clock::now() + kLineInterval;
};

uint64_t FilesTaken(const Json::Value& shares) {
  uint64_t files = 0;
  for (const Json::Value& share : shares) {
    files += share["files"].asUInt64();
  }
  return files;
}

// Whether every share has a worker that has nothing left to do or does nothing at present, and
// every queue is fed.
bool IsQuiet(const Json::Value& shares) {
  const size_t wanted = fileindex::FolderMgr().GetIndexedShares().size();
  const bool are_idle = std::all_of(shares.begin(), shares.end(), [](const Json::Value& share) {
    const std::string state = share["state"].asString();
    return (state == "idle" && share["queue_bytes"].asUInt64() == 0) || state == "unavailable" ||
           state == "paused";
  });
  if (!are_idle || shares.size() < wanted) {
    return false;
  }
  const Json::Value monitor = AskStats(LocalDaemons().back().socket);
  const Json::Value& queues = monitor["queues"];
  return queues.size() >= wanted &&
         std::none_of(queues.begin(), queues.end(), [](const Json::Value& queue) {
           return queue["state"] == "degraded" &&
                  queue["reason"].asString().find("being read") != std::string::npos;
         });
}

// The folders that are indexed already are left as they are. The full paths of all.
std::vector<std::string> AddFolders(const std::vector<std::string>& folders, Voice& voice,
                                    const Console& console) {
  std::vector<std::string> full_paths;
  for (const std::string& folder : folders) {
    bool is_new = false;
    AddFolder(folder, console, [&is_new](const Json::Value& record) {
      is_new = !fileindex::FolderMgr().HasFolder(record["path"].asString());
      return is_new;
    });
    full_paths.push_back(RealPath(folder));
    Json::Value fields;
    fields["path"] = full_paths.back();
    voice.Say("folder", (is_new ? "indexing " : "indexed already: ") + full_paths.back(), fields);
  }
  return full_paths;
}

// How a person calls this very program.
std::string OwnCall() {
  std::error_code error;
  const char* const root = getenv("FILEINDEX_ROOT");  // NOLINT(concurrency-mt-unsafe)
  return (root == nullptr ? "" : "FILEINDEX_ROOT=" + ForShell(root) + " ") +
         ForShell(std::filesystem::read_symlink("/proc/self/exe", error).string());
}

std::string TimeOfDay() {
  const time_t now = time(nullptr);
  tm local{};
  char text[16];
  return {text, strftime(text, sizeof(text), "%H:%M:%S", localtime_r(&now, &local))};
}

// Says what each share's worker has done since the last time.
void SayWhatIsNew(const Json::Value& shares, std::map<std::string, uint64_t>& operations,
                  Voice& voice) {
  for (const Json::Value& share : shares) {
    const uint64_t now = share["operations"].asUInt64();
    uint64_t& before = operations[share["share"].asString()];
    if (now > before && share["state"] == "idle") {
      Json::Value fields;
      fields["share"] = share["share"];
      fields["operations"] = Json::UInt64{now - before};
      voice.Say("changes",
                TimeOfDay() + "  " + share["share"].asString() + ": " +
                    Counted(now - before, "change") + " indexed",
                fields);
    }
    if (now < before || share["state"] == "idle") {  // Less: the daemon was started anew.
      before = now;
    }
  }
}

// Says why shares fail, each reason once until they are done with what failed.
class FailureNotes {
 public:
  explicit FailureNotes(Voice& voice) : voice_(voice) {}

  void Say(const Json::Value& shares) {
    for (const Json::Value& share : shares) {
      const std::string name = share["share"].asString();
      const std::string state = share["state"].asString();
      const std::string error = share["last_error"].asString();
      if (state == "idle") {
        said_.erase(name);
      } else if (state == "failing" && said_[name] != error) {
        said_[name] = error;
        Json::Value fields;
        fields["share"] = name;
        std::string text = TimeOfDay();
        text.append("  ").append(name).append(": fails, and is tried again: ").append(error);
        voice_.Say("failing", text, fields);
      }
    }
  }

 private:
  Voice& voice_;
  std::map<std::string, std::string> said_;  // By share.
};

// Says which shares nothing is done for at present. Whether there are some.
bool SayWhatRests(const Json::Value& shares, Voice& voice) {
  bool is_some = false;
  for (const Json::Value& share : shares) {
    const std::string name = share["share"].asString();
    const std::string state = share["state"].asString();
    if (state != "paused" && state != "unavailable") {
      continue;
    }
    is_some = true;
    const std::string error = share["last_error"].asString();
    Json::Value fields;
    fields["share"] = name;
    voice.Say(state.c_str(),
              name + ": " +
                  (state == "paused" ? "indexing is paused; 'fileindex resume' goes on"
                   : error.empty()   ? "is unavailable; 'fileindex doctor' says more"
                                     : "is unavailable: " + error),
              fields);
  }
  return is_some;
}

// False when a signal came before all of it was found.
bool AwaitFirstCrawl(const std::vector<std::string>& folders, StopSignals& signals, Stack& stack,
                     Voice& voice, FailureNotes& failures) {
  const Count total(folders);
  const Clock::time_point began = Clock::now();
  for (;;) {
    const Json::Value shares = AskShares();
    const uint64_t done = FilesTaken(shares);
    const double seconds = std::chrono::duration<double>(Clock::now() - began).count();
    if (IsQuiet(shares)) {
      Json::Value fields;
      fields["files"] = Json::UInt64{done};
      fields["seconds"] = seconds;
      char text[32];
      snprintf(text, sizeof(text), "%.1f", seconds);
      const bool is_all = !SayWhatRests(shares, voice);
      voice.Say(is_all ? "ready" : "resting",
                (is_all ? "everything can be found: " : "the rest can be found: ") +
                    Counted(done, "file") + " and folders indexed in " + text + " s",
                fields);
      return true;
    }
    failures.Say(shares);
    voice.ShowProgress(done, total, seconds);
    if (signals.Await(kProgressInterval)) {
      return false;
    }
    stack.Tend();
  }
}

// A root of its own may be new; a system's folders are the package's.
void MakeRootFolders() {
  const std::string& root = fileindex::GetFileIndexRoot();
  for (const char* const folder : {"etc/kavo", "tmp", "var/run", "var/lib/kavo/fileindex/queue",
                                   "var/lib/kavo/fileindex/db", "var/packages/Vexlo/etc"}) {
    if (!root.empty()) {
      std::filesystem::create_directories(root + "/" + folder);
    }
  }
}

ExitStatus Up(const Arguments& arguments, const Console& console) {
  for (const std::string& folder : arguments.positional) {
    if (!IsDirExist(RealPath(folder), /*follow_link=*/false)) {
      throw Failure("'" + ForTerminal(folder) + "' is no folder");
    }
  }
  MakeRootFolders();
  StopSignals signals;
  Voice voice(console, arguments.Has("--json"));
  Stack stack([&voice](const std::string& sentence) { voice.Say("daemon", sentence); });
  if (!stack.Start([&signals] { return signals.Await(std::chrono::milliseconds(0)); })) {
    return kDone;
  }
  std::vector<std::string> folders = AddFolders(arguments.positional, voice, console);
  if (folders.empty()) {
    const fileindex::FolderMgr configured;
    for (const auto& folder : configured.GetFolders()) {
      folders.push_back(folder->GetFullPath());
    }
  }
  if (folders.empty()) {
    throw Failure("no folder is indexed; name one: fileindex up DIR");
  }
  FailureNotes failures(voice);
  if (!AwaitFirstCrawl(folders, signals, stack, voice, failures)) {
    return kDone;
  }
  Json::Value fields;
  fields["call"] = OwnCall() + " search WORD...";
  voice.Say("search", "search with: " + fields["call"].asString(), fields);
  fields["call"] = OwnCall() + " web";
  voice.Say("web", "or with a browser: " + fields["call"].asString(), fields);
  voice.Say("following", "following changes; Ctrl-C ends it");
  std::map<std::string, uint64_t> operations;
  const Json::Value shares_now = AskShares();
  for (const Json::Value& share : shares_now) {
    operations[share["share"].asString()] = share["operations"].asUInt64();
  }
  while (!signals.Await(kFollowInterval)) {
    stack.Tend();
    const Json::Value shares = AskShares();
    failures.Say(shares);
    SayWhatIsNew(shares, operations, voice);
  }
  voice.Say("stopping", "stopping");
  stack.Stop();
  return kDone;
}

}  // namespace

std::vector<Command> UpCommands() {
  return {
      {"up",
       "[DIR...]",
       "starts everything, indexes folders and follows their changes until Ctrl-C",
       "Starts the daemons that do not run yet, adds the folders (a folder that no share holds is\n"
       "made a share), shows how far the first crawl is, and says so when everything can be\n"
       "found, or which shares are paused or unavailable, and why one fails. Then it goes on\n"
       "following changes. Without DIR it goes on with the folders that are indexed. A daemon "
       "that\n"
       "ran already is left alone, and started when it ends. Ctrl-C stops what it started within\n"
       "five seconds; the index stays. What the daemons say is in var/log/fileindex below the\n"
       "root.\n"
       "\n"
       "  fileindex up ~/Documents\n",
       {{"--json", nullptr, "one JSON object a line: event, text, and what belongs to it"}},
       {},
       0,
       1000,
       Up},
  };
}

}  // namespace vexlo::cli
