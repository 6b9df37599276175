// The files of lists and state, each beside its own writer: what is read comes back when it was
// written. The input's first byte says which file it is.
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <map>

#include "common/error.h"
#include "common/json.h"
#include "daemons/fileindexd/share_state.h"
#include "daemons/kavocontentextractd/quarantine.h"
#include "daemons/kavoelasticd/registry.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/paths.h"
#include "fileindex/status_mgr.h"
#include "fuzz/target.h"
#include "kavo/local/monitor_queues.h"
#include "kavo/local/shares.h"
#include "kavo/monitor_queue.h"

namespace {

namespace index = vexlo::fileindex;
using vexlo::fileindex::FolderMgr;

std::string Show(const FolderMgr& folders) {
  Json::Value list(Json::arrayValue);
  for (const auto& folder : folders.GetFolders()) {
    list.append(folder->GetData());
  }
  return vexlo::JsonToString(list);
}

void ReadFolders(std::string_view text) {
  const std::string file = index::kFileIndexFoldersCfgPath.Get();
  fuzz::WriteFile(file, text);
  const FolderMgr folders;
  fuzz::WriteFile(file, Show(folders));
  fuzz::RequireEqual(Show(FolderMgr()), Show(folders), "folders read otherwise when written");
  for (const auto& folder : folders.GetFolders()) {
    fuzz::Require(folders.HasFolder(folder->GetPath()), "a folder of the list is not in it");
  }
}

void ReadStatus(std::string_view text) {
  fuzz::WriteFile(index::kFileIndexStatusCfgPath.Get(), text);
  index::StatusMgr status;
  const long pause = status.GetPauseInfo();
  const unsigned bits = status.GetShareStatus("photo");
  if (geteuid() != 0) {
    return;  // Only a superuser saves.
  }
  status.SetShareStatus("photo", index::SS_NEED_REINDEX);
  const index::StatusMgr again;
  fuzz::Require(again.GetPauseInfo() == pause, "the pause changes with a share's bits");
  fuzz::Require(again.GetShareStatus("photo") == (bits | index::SS_NEED_REINDEX),
                "bits of a share are lost");
}

void ReadShareState(std::string_view text) {
  const std::string file = fuzz::Folder() + "/state.json";
  fuzz::WriteFile(file, text);
  const vexlo::fileindexd::ShareState state = vexlo::fileindexd::LoadShareState(file);
  vexlo::fileindexd::SaveShareState(file, state);
  fuzz::Require(vexlo::fileindexd::LoadShareState(file) == state,
                "a share's state is another one when it was written");
}

void ReadQuarantine(std::string_view text) {
  constexpr size_t kMost = 5;
  const std::string file = fuzz::Folder() + "/extract/quarantine.json";
  std::filesystem::create_directories(fuzz::Folder() + "/extract");
  fuzz::WriteFile(file, text);
  vexlo::extractd::Quarantine list(file, kMost);
  const vexlo::extractd::ContentKey key = {1, 2, 3, 4, 5};
  list.Add(key, vexlo::extractd::Fault("damaged", "the target's own"), "/v/a");
  fuzz::Require(list.Size() >= 1 && list.Size() <= kMost, "the list keeps no bound");
  vexlo::extractd::Quarantine again(file, kMost);
  fuzz::Require(again.Size() == list.Size(), "the list is another one when it was written");
  const auto found = again.Find(key);
  fuzz::Require(found && found->Reason() == "damaged", "an entry is lost");
}

std::string Show(const vexlo::elasticd::Registry& registry) {
  std::string shown;
  for (const auto& [id, entry] : registry.Entries()) {
    shown.append(id).append("\n").append(entry.path).append("\n").append(entry.token).append("\n");
    shown.append(vexlo::elasticd::NameOf(entry.state)).append("\n").append(entry.move_to);
  }
  return shown;
}

void ReadRegistry(std::string_view text) {
  const std::string folder = fuzz::Folder() + "/registry";
  std::filesystem::remove_all(folder);
  std::filesystem::create_directories(folder);
  fuzz::WriteFile(folder + "/registry.json", text);
  vexlo::elasticd::Registry registry(folder + "/registry.json");
  registry.Put("added", {"/v/added", "token", vexlo::elasticd::State::kActive, ""});
  fuzz::RequireEqual(Show(vexlo::elasticd::Registry(folder + "/registry.json")), Show(registry),
                     "the registry is another one when it was written");
}

void ReadRegistrations(std::string_view text) {
  fuzz::WriteFile(kavo::local::MonitorQueuesFolder() + "/app.json", text);
  kavo::local::MonitorQueues read = kavo::local::ReadMonitorQueues();
  fuzz::Require(read.unreadable.empty() || read.queues.empty(), "half of a bad file is read");
  if (read.queues.empty()) {
    return;
  }
  const kavo::local::RegisteredQueue first = read.queues.front();
  fuzz::Require(EVNOTIFYD::MonitorQueue::Delete(
                    first.queue, "app", static_cast<EVNOTIFYD::MonitorQueueType>(first.type)),
                "a registration cannot be taken back");
  read.queues.erase(read.queues.begin());
  fuzz::Require(kavo::local::ReadMonitorQueues().queues == read.queues,
                "other registrations change with the first");
}

void Prepare() {
  const std::string& root = fuzz::Folder();
  for (const char* folder : {"/etc/kavo", "/var/packages/Vexlo/etc", "/tmp"}) {
    std::filesystem::create_directories(root + folder);
  }
  std::filesystem::create_directories(kavo::local::MonitorQueuesFolder());
  fuzz::WriteFile(kavo::local::SharesFile(),
                  R"({"shares": [{"name": "photo", "path": "/volume1/photo"}]})");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const bool is_prepared = (Prepare(), true);
  static const std::map<uint8_t, void (*)(std::string_view)> kReaders = {
      {'f', ReadFolders},    {'s', ReadStatus},   {'c', ReadShareState},
      {'q', ReadQuarantine}, {'i', ReadRegistry}, {'e', ReadRegistrations}};
  if (!is_prepared || size == 0 || !kReaders.contains(*data)) {
    return 0;
  }
  try {
    kReaders.at (*data)(fuzz::TextOf(data + 1, size - 1));
  } catch (const vexlo::Error& error) {
    fuzz::Require(
        error.GetErrorCode() == 120 || error.GetErrorCode() == 504 || error.GetErrorCode() == 800,
        "a bad file fails with another code");
  }
  return 0;
}
