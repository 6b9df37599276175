#include "cli/folder_change.h"

#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <optional>

#include "cli/engine.h"
#include "cli/folder_paths.h"
#include "cli/service.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/file.h"
#include "common/string.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/index_mgr/folder_ops.h"
#include "fileindex/util/share_path.h"
#include "kavo/local/monitor_queues.h"
#include "kavo/local/shares.h"

namespace vexlo::cli {
namespace {

using fileindex::FolderMgr;

[[noreturn]] void Explain(const Error& error) {
  const std::string reason = error.what();
  if (error.GetErrorCode() == ERR_SHARE_NOT_FOUND && FolderMgr().IsShareIndexed(reason)) {
    CheckSharesFile();
    throw Failure("the share '" + ForTerminal(reason) +
                  "' of an indexed folder is gone; 'fileindex folder prune' forgets its folders");
  }
  ExplainEngineError(error);
  switch (static_cast<int>(error.GetErrorCode())) {
    case ERR_FOLDER_DUPLICATED:
      throw Failure("the folder is indexed already; 'fileindex folder set' changes how");
    case ERR_FOLDER_NOT_FOUND:
      throw Failure("'" + ForTerminal(reason) +
                    "' is no indexed folder; 'fileindex folder list' lists them");
    case ERR_PATH_CANNOT_INDEX:
      throw Failure(ForTerminal(reason.substr(reason.find('/'))) +
                    " cannot be indexed; 'fileindex explain' with its full path says why");
    case ERR_LOAD:
      throw Failure(ForTerminal(reason) + "; 'fileindex config check' says more");
    case ERR_LOCK:
      throw Failure("another command is changing the folders at present (" + ForTerminal(reason) +
                    ")");
    default:
      throw error;
  }
}

std::string UserName() {
  const passwd* const user = getpwuid(getuid());  // NOLINT(concurrency-mt-unsafe): one thread.
  return user == nullptr ? "" : user->pw_name;
}

}  // namespace

void WithFolders(const std::function<void()>& work) {
  try {
    work();
  } catch (const Error& error) {
    Explain(error);
  }
}

void ChangeFolders(const Console& console, const Json::Value& paths,
                   const std::function<void()>& work, const std::function<void()>& mend_index,
                   int mendable) {
  const auto once = [&] {
    try {
      work();
    } catch (const Error& error) {
      if (error.GetErrorCode() != ERR_SYSTEM || IsIndexDaemonListening() ||
          !std::string_view(error.what()).starts_with("write failed")) {
        throw;
      }
      console.err << NoIndexDaemon() << "; the change is saved and waits for it\n";
      fileindex::FolderReindex(paths);
    }
  };
  WithFolders([&] {
    try {
      once();
    } catch (const Error& error) {
      if (static_cast<int>(error.GetErrorCode()) != mendable) {
        throw;
      }
      mend_index();
      once();
    }
  });
}

namespace {

// Whether anything stands on the share: a folder in the list, or a queue that is fed from it.
bool IsInUse(const kavo::local::Share& share) {
  const auto queues = kavo::local::ReadMonitorQueues().queues;
  return FolderMgr().IsShareIndexed(share.name) ||
         std::any_of(queues.begin(), queues.end(), [&share](const auto& queue) {
           return std::any_of(
               queue.folders.begin(), queue.folders.end(),
               [&share](const auto& folder) { return IsSameOrBelow(folder.path, share.path); });
         });
}

// The folder's share path. `made` becomes the share that it was made for the lack of another.
std::string ShareFor(const std::string& folder, std::optional<kavo::local::Share>& made,
                     const Console& console) {
  const std::string path = RealPath(folder);
  if (path.empty() || !IsDirExist(path, /*follow_link=*/false)) {
    throw Failure("'" + ForTerminal(folder) + "' is no folder");
  }
  if (path == "/") {
    throw Failure("the root folder has no name, so it cannot be a share");
  }
  std::string share_path = SharePathOf(path);
  if (!share_path.empty()) {
    return share_path;
  }
  RequireEngine();  // Before anything is changed.
  kavo::local::Share share;
  share.name = Basename(path);
  share.path = path;
  try {
    kavo::local::AddShare(kavo::local::SharesFile(), share);
  } catch (const kavo::local::SharesError& error) {
    throw Failure(error.what());
  }
  console.err << "no share held it, so it was made the share '" << ForTerminal(share.name) << "'\n";
  made = share;
  return "/" + share.name;
}

// A record for the folder of this share path, with everything indexed.
Json::Value NewFolder(const std::string& path) {
  Json::Value record;
  record["path"] = path;
  record["name"] = Basename(path);
  record["owner"] = UserName();
  for (const char* const type : kFolderTypes) {
    record[type] = true;
  }
  return record;
}

// Adds the folder of a record.
void AddRecord(const Json::Value& record, const Console& console) {
  const std::string path = record["path"].asString();
  const std::string share = fileindex::GetShareNameByPath(path);
  WithFolders([&] {
    if (!FolderMgr().IsShareIndexed(share)) {
      RequireEngine();
    }
  });
  Json::Value records(Json::arrayValue);
  records.append(record);
  Json::Value paths(Json::arrayValue);
  paths.append(path);
  ChangeFolders(
      console, paths, [&] { fileindex::FolderAdd(records, /*updater_mode=*/false); },
      [&] { fileindex::elastic::ShareIndexDelete(share); }, kIndexExists);
}

void TakeBack(const kavo::local::Share& share, const Console& console) {
  try {
    if (!IsInUse(share)) {
      kavo::local::RemoveShare(kavo::local::SharesFile(), share.name);
      console.err << "the share '" << ForTerminal(share.name) << "' was taken out again\n";
    }
  } catch (const std::exception& error) {
    console.err << "the share '" << ForTerminal(share.name)
                << "' stays: " << ForTerminal(error.what()) << "\n";
  }
}

}  // namespace

Json::Value AddFolder(const std::string& folder, const Console& console,
                      const std::function<bool(Json::Value&)>& is_wanted) {
  std::optional<kavo::local::Share> made;
  const std::string path = ShareFor(folder, made, console);
  try {
    Json::Value record = NewFolder(path);
    if (is_wanted(record)) {
      AddRecord(record, console);
    }
    return record;
  } catch (...) {
    if (made) {
      TakeBack(*made, console);
    }
    throw;
  }
}

}  // namespace vexlo::cli
