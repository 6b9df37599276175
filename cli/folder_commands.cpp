// "fileindex folder ...": the indexed folders.
#include <json/value.h>

#include <algorithm>
#include <charconv>
#include <functional>
#include <map>
#include <set>

#include "cli/command.h"
#include "cli/engine.h"
#include "cli/folder_change.h"
#include "cli/folder_paths.h"
#include "cli/service.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/lock.h"
#include "common/sdk/share.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/index_mgr/folder_ops.h"
#include "fileindex/paths.h"
#include "fileindex/status_mgr.h"
#include "fileindex/util/share_path.h"
#include "kavo/local/monitor_queues.h"
#include "kavo/monitor_queue.h"

namespace vexlo::cli {
namespace {

using fileindex::FolderMgr;

const Option kJson = {"--json", nullptr, "the library's own JSON"};

// What the options say of a record.
void ApplyOptions(Json::Value& record, const Arguments& arguments) {
  for (const char* const key : {"name", "group", "owner"}) {
    const std::string option = std::string("--") + key;
    if (arguments.Has(option)) {
      record[key] = arguments.Get(option);
    }
  }
  if (arguments.Has("--types")) {
    std::set<std::string> wanted;
    for (const std::string& type : Split(arguments.Get("--types"), ',')) {
      wanted.insert(type);
    }
    wanted.erase("none");
    for (const char* const type : kFolderTypes) {
      record[type] = wanted.erase(type) > 0;
    }
    if (!wanted.empty()) {
      throw UsageError("'" + *wanted.begin() +
                       "' is no type: document, audio, video, photo, or none");
    }
  }
}

std::string TypesOf(const Json::Value& record) {
  std::string types;
  for (const char* const type : kFolderTypes) {
    if (record[type].asBool()) {
      types.append(types.empty() ? "" : ",").append(type);
    }
  }
  return types.empty() ? "none" : types;
}

ExitStatus Add(const Arguments& arguments, const Console& console) {
  Json::Value checked;
  ApplyOptions(checked, arguments);  // Wrong usage is told before a share is made.
  const Json::Value record = AddFolder(arguments.positional[0], console, [&](Json::Value& wanted) {
    ApplyOptions(wanted, arguments);
    return true;
  });
  console.out << "added: " << ForTerminal(record["path"].asString()) << " (" << TypesOf(record)
              << ")\n";
  return kDone;
}

// Nobody is to watch folders in the name of a share that is gone, or elsewhere by now. `paths` are
// the share paths of its folders.
void ForgetQueues(const std::vector<std::string>& paths) {
  const auto was_its = [&paths](const kavo::local::MonitoredFolder& folder) {
    return SharePathOf(folder.path).empty() &&
           std::any_of(paths.begin(), paths.end(),
                       [&folder](const std::string& path) { return folder.path.ends_with(path); });
  };
  for (const kavo::local::RegisteredQueue& queue : kavo::local::ReadMonitorQueues().queues) {
    if (!queue.folders.empty() &&
        std::all_of(queue.folders.begin(), queue.folders.end(), was_its)) {
      if (!EVNOTIFYD::MonitorQueue::Delete(queue.queue, queue.app,
                                           EVNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION)) {
        throw Failure("the folders stay watched: the registration of '" + ForTerminal(queue.app) +
                      "' cannot be changed");
      }
      Unlink(queue.queue);
      Unlink(queue.queue + ".tmp");
    }
  }
}

// The share paths of the indexed folders of the share that the folder is in.
std::vector<std::string> FoldersBeside(const std::string& path) {
  std::vector<std::string> paths;
  WithFolders([&] {
    const FolderMgr folders;
    std::shared_ptr<fileindex::Folder> folder;
    folders.Get(folder, path);
    for (const auto& each : folders.GetFolders()) {
      if (each->GetShare() == folder->GetShare()) {
        paths.push_back(each->GetPath());
      }
    }
  });
  return paths;
}

ExitStatus Set(const Arguments& arguments, const Console& console) {
  const std::string path = ToSharePath(arguments.positional[0]);
  Json::Value record;
  WithFolders([&] { fileindex::FolderGet(record, path); });
  const Json::Value before = record;
  ApplyOptions(record, arguments);
  if (record == before && !arguments.options.empty()) {
    console.err << "nothing to change\n";
    return kNothingFound;
  }
  Json::Value records(Json::arrayValue);
  records.append(record);
  Json::Value paths(Json::arrayValue);
  paths.append(path);
  ChangeFolders(
      console, paths, [&] { fileindex::FolderSet(records, /*updater_mode=*/false); }, [] {},
      /*mendable=*/-1);
  if (record == before) {
    ForgetQueues(FoldersBeside(path));
  }
  console.out << (record == before ? "renewed: " : "changed: ") << ForTerminal(path) << " ("
              << TypesOf(record) << ")\n";
  return kDone;
}

// The folders that are to go; all of them are there.
Json::Value FoldersToDelete(const Arguments& arguments, const FolderMgr& folders) {
  Json::Value paths(Json::arrayValue);
  for (const std::string& named : arguments.positional) {
    const std::string path = ToSharePath(named);
    std::shared_ptr<fileindex::Folder> folder;
    folders.Get(folder, path);
    paths.append(path);
  }
  for (const auto& folder : folders.GetFolders()) {
    if (arguments.Has("--share") && folder->GetShare() == arguments.Get("--share")) {
      paths.append(folder->GetPath());
    }
  }
  return paths;
}

ExitStatus Delete(const Arguments& arguments, const Console& console) {
  if (arguments.positional.empty() && !arguments.Has("--share")) {
    throw UsageError("wants FOLDER, or the option --share NAME");
  }
  Json::Value paths;
  std::set<std::string> ending;  // Shares that keep no folder.
  WithFolders([&] {
    FolderMgr folders;
    paths = FoldersToDelete(arguments, folders);
    std::shared_ptr<fileindex::Folder> diff;
    for (const Json::Value& path : paths) {
      folders.Delete(diff, path.asString());
    }
    for (const Json::Value& path : paths) {
      const std::string share = fileindex::GetShareNameByPath(path.asString());
      if (!folders.IsShareIndexed(share)) {
        ending.insert(share);
      }
    }
  });
  if (paths.empty()) {
    throw Failure("no folder of the share '" + ForTerminal(arguments.Get("--share")) +
                  "' is indexed; 'fileindex folder list' lists them");
  }
  if (!ending.empty()) {
    RequireEngine();
  }
  ChangeFolders(
      console, paths, [&] { fileindex::FolderDelete(paths); },
      [&] {
        for (const std::string& share : ending) {
          try {
            fileindex::elastic::ShareIndexCreate(share);
          } catch (const Error& error) {
            if (static_cast<int>(error.GetErrorCode()) != kIndexExists) {
              throw;
            }
          }
        }
      },
      kNoIndex);
  for (const Json::Value& path : paths) {
    console.out << "deleted: " << ForTerminal(path.asString()) << "\n";
  }
  return kDone;
}

ExitStatus Reindex(const Arguments& arguments, const Console& console) {
  Json::Value paths(Json::arrayValue);
  WithFolders([&] {
    const FolderMgr folders;
    for (const std::string& named : arguments.positional) {
      const std::string path = ToSharePath(named);
      if (!folders.IsShareIndexed(fileindex::GetShareNameByPath(path))) {
        throw Failure("no folder of the share of '" + ForTerminal(path) + "' is indexed");
      }
      paths.append(path);
    }
    fileindex::FolderReindex(paths);
  });
  for (const Json::Value& path : paths) {
    console.out << "to be indexed again: " << ForTerminal(path.asString()) << "\n";
  }
  if (!IsIndexDaemonListening()) {
    console.err << NoIndexDaemon() << "; this waits for it\n";
  }
  return kDone;
}

ExitStatus Get(const Arguments& arguments, const Console& console) {
  Json::Value record;
  WithFolders([&] { fileindex::FolderGet(record, ToSharePath(arguments.positional[0])); });
  if (arguments.Has("--json")) {
    console.out << JsonToString(record) << "\n";
    return kDone;
  }
  std::vector<std::vector<std::string>> rows;
  for (const char* const key : {"path", "name", "owner", "group"}) {
    rows.push_back({key, ForTerminal(record[key].asString())});
  }
  rows.push_back({"types", TypesOf(record)});
  console.out << Table(rows);
  return kDone;
}

unsigned long ReadCount(const Arguments& arguments, const std::string& option) {
  const std::string text = arguments.Get(option);
  unsigned long number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (arguments.Has(option) && (error != std::errc() || end != text.data() + text.size())) {
    throw UsageError("the value of " + option + ", '" + text + "', is no number");
  }
  return number;
}

ExitStatus ListFolders(const Arguments& arguments, const Console& console) {
  Json::Value additional(Json::arrayValue);
  additional.append("status");
  std::string sort_by = arguments.Get("--sort");
  const bool descending = sort_by.starts_with('-');
  sort_by.erase(0, descending ? 1 : 0);
  const unsigned long offset = ReadCount(arguments, "--offset");
  const unsigned long limit = ReadCount(arguments, "--limit");
  if (!std::set<std::string>{"", "name", "path", "owner", "group"}.contains(sort_by)) {
    throw UsageError("'" + sort_by + "' is no order: name, path, owner or group");
  }
  Json::Value result;
  WithFolders([&] {
    fileindex::FolderList(result, offset, limit, sort_by, descending ? "DESC" : "ASC",
                          arguments.Get("--group"), arguments.Get("--find"), additional);
  });
  if (arguments.Has("--json")) {
    console.out << JsonToString(result) << "\n";
    return result["folder"].empty() ? kNothingFound : kDone;
  }
  std::vector<std::vector<std::string>> rows = {{"PATH", "NAME", "GROUP", "TYPES", "STATUS"}};
  for (const Json::Value& folder : result["folder"]) {
    const Json::Value& status = folder["additional"]["status"];
    rows.push_back({ForTerminal(folder["path"].asString()), ForTerminal(folder["name"].asString()),
                    ForTerminal(folder["group"].asString()), TypesOf(folder),
                    status["text"].asString() +
                        (status.isMember("desc") ? ": " + status["desc"].asString() : "")});
  }
  if (rows.size() > 1) {
    console.out << Table(rows);
  }
  const std::string shown = Counted(rows.size() - 1, "folder");
  console.err << shown << " of " << Grouped(result["total"].asUInt64()) << "\n";
  return rows.size() > 1 ? kDone : kNothingFound;
}

ExitStatus ListGroups(const Arguments& arguments, const Console& console) {
  Json::Value groups;
  WithFolders([&] { fileindex::FolderListGroups(groups); });
  if (arguments.Has("--json")) {
    console.out << JsonToString(groups) << "\n";
  } else {
    for (const Json::Value& group : groups) {
      console.out << ForTerminal(group.asString()) << "\n";
    }
  }
  return groups.empty() ? kNothingFound : kDone;
}

// Whatever else a share left that is gone: its index, its registration with its queue, its status.
// `paths` are those of the folders that it had.
void ForgetShare(const std::string& share, const std::vector<std::string>& paths,
                 const Console& console) {
  try {
    RequireEngine();
    fileindex::elastic::ShareIndexDelete(share);
  } catch (const std::exception& error) {
    console.err << "the index of '" << ForTerminal(share)
                << "' stays: " << ForTerminal(error.what()) << "\n";
  }
  ForgetQueues(paths);
  fileindex::StatusMgr().ClearShareStatus(share);
}

ExitStatus Prune(const Arguments& /*arguments*/, const Console& console) {
  CheckSharesFile();
  std::map<std::string, std::vector<std::string>> gone;  // Shares, and the paths of their folders.
  WithFolders([&] {
    const LockFile lock(fileindex::kFileIndexFoldersLockPath.Get(), /*exclusive=*/true);
    FolderMgr folders;
    const std::set<std::string> shares = ShareNames();
    for (const auto& folder : folders.GetFolders()) {
      if (!shares.contains(folder->GetShare())) {
        gone[folder->GetShare()].push_back(folder->GetPath());
        console.out << "pruned: " << ForTerminal(folder->GetPath()) << "\n";
      }
    }
    // The list last: what is interrupted is found there and done again.
    for (const auto& [share, paths] : gone) {
      ForgetShare(share, paths, console);
      folders.DeleteByShare(share);
    }
    if (!gone.empty()) {
      folders.Save();
    }
  });
  if (gone.empty()) {
    console.err << "the share of every folder is there\n";
  }
  return gone.empty() ? kNothingFound : kDone;
}

std::vector<Option> RecordOptions() {
  return {{"--name", "NAME", "what people call the folder"},
          {"--group", "GROUP", "folders of one group are reported as one"},
          {"--owner", "USER", "whose folder it is"},
          {"--types", "LIST",
           "the types whose contents are indexed: document,audio,video,photo, or none"}};
}

}  // namespace

std::vector<Command> FolderCommands() {
  return {
      {"folder add",
       "DIR",
       "indexes a folder",
       "Adds DIR to the indexed folders: its files become searchable, and stay so as they change.\n"
       "A folder that no share holds is made a share of its own. The name is that of the folder\n"
       "and the owner you, unless an option says otherwise. All four types of files are indexed\n"
       "with their contents unless --types names some; the others are found by name only.\n"
       "\n"
       "  fileindex folder add ~/Documents\n"
       "  fileindex folder add /volume1/photo/2019 --types photo,video --group holidays\n",
       RecordOptions(),
       {},
       1,
       1,
       Add},
      {"folder set",
       "FOLDER",
       "changes how a folder is indexed",
       "Changes what the options name and nothing else. FOLDER is a full path or a share path.\n"
       "What is indexed otherwise now is indexed again. Exit status 1 when nothing changes.\n"
       "Without options the folder is set as it is: the daemons are told of it once more, which a\n"
       "share that has moved wants.\n"
       "\n"
       "  fileindex folder set /photo/2019 --types photo\n",
       RecordOptions(),
       {},
       1,
       1,
       Set},
      {"folder delete",
       "[FOLDER...]",
       "indexes folders no longer",
       "Takes the folders out of the index; their files stay. FOLDER is a full path or a share\n"
       "path. With the last folder of a share go the share's index and queue.\n"
       "\n"
       "  fileindex folder delete /photo/2019\n"
       "  fileindex folder delete --share photo\n",
       {{"--share", "NAME", "all folders of this share"}},
       {},
       0,
       1000,
       Delete},
      {"folder reindex",
       "PATH...",
       "indexes folders, or anything in them, again",
       "What is gone leaves the index, and what is new or changed enters it. A share that was\n"
       "marked because something went wrong is made good by this.\n"
       "\n"
       "  fileindex folder reindex /photo\n",
       {},
       {},
       1,
       1000,
       Reindex},
      {"folder get",
       "FOLDER",
       "shows how a folder is indexed",
       "  fileindex folder get --json /photo/2019 | jq .photo\n",
       {kJson},
       {},
       1,
       1,
       Get},
      {"folder list",
       "",
       "lists the indexed folders and how far they are",
       "Prints path, name, group, types and status of each folder. Exit status 1 when there are\n"
       "none.\n"
       "\n"
       "  finished      all of it can be found\n"
       "  processing    changes wait to be indexed\n"
       "  paused        changes wait for the end of a pause\n"
       "  need_reindex  something was missed: 'fileindex folder reindex' makes up for it\n"
       "  error         it cannot be indexed: 'fileindex explain' says why\n"
       "\n"
       "  fileindex folder list --sort -name --group holidays\n",
       {kJson,
        {"--sort", "FIELD", "name, path, owner or group; '-name' for the other direction"},
        {"--group", "GROUP", "those of this group only"},
        {"--find", "TEXT", "those with TEXT in their name or path"},
        {"--offset", "N", "leave out the first N"},
        {"--limit", "N", "at most N"}},
       {},
       0,
       0,
       ListFolders},
      {"folder groups",
       "",
       "lists the groups of folders",
       "Exit status 1 when there are none.\n",
       {kJson},
       {},
       0,
       0,
       ListGroups},
      {"folder prune",
       "",
       "forgets the folders of shares that are gone",
       "While a folder of a share is listed that is no share any more, no other folder can be\n"
       "changed. This takes such folders off the list, with the index, the queue and the status "
       "of\n"
       "their shares. Exit status 1 when there are none.\n",
       {},
       {},
       0,
       0,
       Prune},
  };
}

}  // namespace vexlo::cli
