#include "daemons/fileindexd/service.h"

#include <linux/capability.h>

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "daemons/common/frame_server.h"
#include "daemons/common/log.h"
#include "daemons/fileindexd/consequence.h"
#include "daemons/fileindexd/file_version.h"
#include "daemons/fileindexd/settle.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/paths.h"

namespace vexlo::fileindexd {
namespace {

constexpr fileindex::FixedPath kPidFile("/var/run/fileindexd.pid");
constexpr uint64_t kMostCommandBytes = uint64_t{64} << 10;
constexpr int kLongestCoalescing = 3'600'000;
constexpr std::chrono::milliseconds kStopTime{1500};
constexpr std::chrono::milliseconds kLookForEnd{100};

Json::Value Refusal(const std::string& reason) {
  Json::Value answer(Json::objectValue);
  answer["success"] = false;
  answer["error"]["code"] = static_cast<int>(ERR_BAD_PARAMETER);
  answer["error"]["msg"] = reason;
  return answer;
}

Json::Value Success() {
  Json::Value answer(Json::objectValue);
  answer["success"] = true;
  return answer;
}

// A worker keeps its state in a file of the share's name, which must lead to no other folder.
std::string ShareOf(const Json::Value& data) {
  std::string share;
  GetJsonValue(share, data, "share_name", /*required=*/true);
  VEXLO_CHECK(share.empty() || share == "." || share == ".." ||
                  share.find_first_of(std::string_view("/\0", 2)) != std::string::npos,
              ERR_BAD_PARAMETER, "no name of a share: " + JsonToString(share));
  return share;
}

// Another text after each change of the list of folders, which is replaced.
std::string StampOfFolders() {
  const std::string path = fileindex::kFileIndexFoldersCfgPath.Get();
  const std::string version = FileVersion(path);
  VEXLO_CHECK(version.empty() && errno != ENOENT && errno != ENOTDIR, ERR_LOAD,
              "lstat failed, path=" + path);
  return version.empty() ? "none" : version;
}

}  // namespace

bool ReadArguments(const std::vector<std::string>& arguments, ServiceOptions* options) {
  if (arguments.empty()) {
    return true;
  }
  if (arguments.size() != 2 || arguments[0] != "--cycle") {
    return false;
  }
  const std::string& text = arguments[1];
  int milliseconds = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), milliseconds);
  options->coalescing = std::chrono::milliseconds(milliseconds);
  return error == std::errc() && end == text.data() + text.size() && milliseconds >= 0 &&
         milliseconds <= kLongestCoalescing;
}

Service::Service(ServiceOptions options) : options_(options), thread_([this] { Run(); }) {
  folders_watch_.emplace(fileindex::kFileIndexFoldersLockPath.Get(), [this] {
    Post([this] {
      if (!settle_again_) {  // Which waits for a while, as settling itself takes the lock.
        Settle();
      }
    });
  });
}

Service::~Service() {
  folders_watch_.reset();
  Stop(std::chrono::milliseconds(0));
  thread_.join();
}

std::string Service::Answer(const std::string& request) {
  std::string text = request;
  if (text.ends_with('\0')) {
    text.pop_back();
  }
  Json::Value answer;
  try {
    Json::Value command;
    std::string type;
    if (!JsonFromString(command, text) || !command.isObject()) {
      answer = Refusal("the command is no JSON object");
    } else {
      GetJsonValue(type, command, "type", /*required=*/true);
      answer = Carry(type, command["data"]);
    }
  } catch (const Error& error) {
    answer = Refusal(error.what());
  }
  return JsonToString(answer);
}

Json::Value Service::Carry(const std::string& type, const Json::Value& data) {
  if (type == "stats") {
    return Describe();
  }
  if (type == "pause" || type == "resume") {
    long resume_time = -1;
    if (type == "pause") {
      GetJsonValue(resume_time, data, "resume_time", /*required=*/true);
    }
    pause_.Set(resume_time);
    KickAll();
  } else if (type == "worker_create") {
    Post([this, share = ShareOf(data)] { Create(share); });
  } else if (type == "worker_delete") {
    Post([this, share = ShareOf(data)] { Delete(share, /*unless_indexed=*/false); });
  } else if (type == "notify_setting_changed") {
    bool is_upsert = false;
    GetJsonValue(is_upsert, data, "is_upsert", /*required=*/false);
    Post([this, share = ShareOf(data), is_upsert] {
      if (is_upsert) {
        Create(share);
      } else {
        Delete(share, /*unless_indexed=*/true);
      }
    });
  } else {
    daemon::Log(daemon::Level::kNotice, VEXLO_SOURCE, __LINE__,
                "an unknown command is ignored: " + JsonToString(type));
    return Refusal("the command is not known: " + type);
  }
  return Success();
}

Json::Value Service::Describe() {
  Json::Value answer = Success();
  answer["shares"] = Json::Value(Json::arrayValue);
  const kavo::local::MutexLock lock(mutex_);
  for (const auto& [share, worker] : workers_) {
    answer["shares"].append(worker->Describe());
  }
  return answer;
}

void Service::Post(Task task) {
  {
    const kavo::local::MutexLock lock(mutex_);
    tasks_.push_back(std::move(task));
  }
  changed_.NotifyAll();
}

void Service::Run() {
  kavo::local::MutexLock lock(mutex_);
  for (;;) {
    const auto is_called = [this]() KAVO_REQUIRES(mutex_) { return ending_ || !tasks_.empty(); };
    if (!settle_again_) {
      changed_.Wait(lock, is_called);
    } else if (!changed_.WaitUntil(lock, *settle_again_, is_called)) {
      tasks_.push_back([this] { Settle(); });
    }
    if (ending_) {
      return;
    }
    const Task task = std::move(tasks_.front());
    tasks_.pop_front();
    lock.Unlock();
    try {
      task();
    } catch (const std::exception& error) {
      daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                  std::string("a command failed, reason=") + error.what());
      SettleLater();  // All that commands are about follows from the list.
    }
    lock.Lock();
  }
}

void Service::Settle() {
  try {
    StartWorkers();
    SettleFolders();
    settle_again_.reset();
    settle_wait_ = std::chrono::seconds(0);
  } catch (const std::exception& error) {
    SettleLater();
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                std::string("the folders are not known or not settled, reason=") + error.what());
  }
}

void Service::SettleLater() {
  folders_stamp_.clear();
  settle_wait_ = NextWait(settle_wait_);
  settle_again_ = std::chrono::steady_clock::now() + settle_wait_;
}

void Service::StartWorkers() {
  const std::string stamp = StampOfFolders();
  if (stamp == folders_stamp_) {
    return;
  }
  try {
    pause_.Reload();
  } catch (const Error& error) {
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                std::string("the pause is not known, reason=") + error.what());
  }
  const std::set<std::string> indexed = fileindex::FolderMgr().GetIndexedShares();
  for (const std::string& share : WorkingShares()) {
    if (!indexed.contains(share)) {
      Delete(share, /*unless_indexed=*/true);
    }
  }
  for (const std::string& share : indexed) {
    Create(share);
    Find(share)->KickSettled();
  }
  folders_stamp_ = stamp;
}

void Service::Create(const std::string& share) {
  if (const auto worker = Find(share)) {
    worker->Kick();
    return;
  }
  auto worker = std::make_shared<Worker>(share, pause_, options_.coalescing);
  const kavo::local::MutexLock lock(mutex_);
  if (ending_) {
    worker->Stop();
  }
  workers_.emplace(share, std::move(worker));
}

void Service::Delete(const std::string& share, bool unless_indexed) {
  const bool is_indexed = fileindex::FolderMgr().IsShareIndexed(share);
  std::shared_ptr<Worker> worker;
  {
    const kavo::local::MutexLock lock(mutex_);
    const auto found = workers_.find(share);
    if (found == workers_.end()) {
      return;
    }
    if (is_indexed && unless_indexed) {
      found->second->Kick();
      return;
    }
    worker = std::move(found->second);
    workers_.erase(found);
    leaving_ = worker;
  }
  worker->Stop();
  // What it waits for, such as an engine that hangs, may last for ever; the end of the daemon does
  // not wait for that.
  while (!worker->AwaitEnd(std::chrono::steady_clock::now() + kLookForEnd)) {
    const kavo::local::MutexLock lock(mutex_);
    if (ending_) {
      return;
    }
  }
  {
    const kavo::local::MutexLock lock(mutex_);
    leaving_.reset();
  }
  worker.reset();
  // A share that is indexed no more starts from nothing when it comes back.
  if (!is_indexed) {
    (void)remove(ShareStateFile(share).c_str());
  }
}

std::set<std::string> Service::WorkingShares() {
  std::set<std::string> shares;
  const kavo::local::MutexLock lock(mutex_);
  for (const auto& [share, worker] : workers_) {
    shares.insert(share);
  }
  return shares;
}

void Service::KickAll() {
  const kavo::local::MutexLock lock(mutex_);
  for (const auto& [share, worker] : workers_) {
    worker->Kick();
  }
}

std::shared_ptr<Worker> Service::Find(const std::string& share) {
  const kavo::local::MutexLock lock(mutex_);
  const auto found = workers_.find(share);
  return found == workers_.end() ? nullptr : found->second;
}

bool Service::Stop(std::chrono::milliseconds time) {
  const auto until = std::chrono::steady_clock::now() + time;
  Workers workers;
  {
    const kavo::local::MutexLock lock(mutex_);
    ending_ = true;
    workers = workers_;
    if (leaving_ != nullptr) {
      workers.emplace("", leaving_);  // No share has this name.
    }
  }
  changed_.NotifyAll();
  for (const auto& [share, worker] : workers) {
    worker->Stop();
  }
  bool all_ended = true;
  for (const auto& [share, worker] : workers) {
    all_ended = worker->AwaitEnd(until) && all_ended;
  }
  return all_ended;
}

void Serve(daemon::Daemon& daemon, const ServiceOptions& options) {
  Service service(options);
  daemon::FrameServerOptions server_options;
  server_options.socket_path = fileindex::kFileIndexDaemonSocketPath.Get();
  server_options.handler = [&service](const std::string& request) {
    return service.Answer(request);
  };
  // A client waits for an answer for ever, also where its connection is closed.
  server_options.refusal = [](daemon::Refusal refusal) {
    return JsonToString(Refusal(RefusalSentence(refusal, "the daemon")));
  };
  server_options.workers = 2;
  server_options.max_request_bytes = kMostCommandBytes;
  server_options.max_total_bytes = size_t{16} << 20;
  server_options.stop_timeout = std::chrono::milliseconds(200);
  daemon::FrameServer server(std::move(server_options));
  daemon.Ready();
  const bool all_answered = server.Run(daemon.StopFd());
  if (!service.Stop(kStopTime) || !all_answered) {
    daemon.EndAtOnce("work is under way, and is done again by the next start", daemon::kEnded);
  }
}

daemon::DaemonOptions FileindexdOptions(ServiceOptions* options) {
  daemon::DaemonOptions daemon_options;
  daemon_options.name = "fileindexd";
  daemon_options.capabilities = {CAP_DAC_READ_SEARCH};
  daemon_options.pid_file = kPidFile.Get();
  daemon_options.usage =
      "[--cycle MILLISECONDS]\n\nKeeps the indexes of the shares up to date with what is queued "
      "for "
      "them. Runs in the\nforeground until SIGTERM or SIGINT and takes commands on " +
      fileindex::kFileIndexDaemonSocketPath.Get() +
      ".\n\n  --cycle MILLISECONDS  from the first new line of a queue to its work (1000)";
  daemon_options.arguments = [options](const std::vector<std::string>& arguments) {
    return ReadArguments(arguments, options);
  };
  return daemon_options;
}

}  // namespace vexlo::fileindexd
