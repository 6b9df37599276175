// What commands share that change the indexed folders.
#ifndef CLI_FOLDER_CHANGE_H_
#define CLI_FOLDER_CHANGE_H_

#include <json/value.h>

#include <functional>
#include <string>

#include "cli/command.h"

namespace vexlo::cli {

// The engine's answers to the making of an index that is there, and the deleting of one that is
// not.
constexpr int kIndexExists = 2003;
constexpr int kNoIndex = 2002;

constexpr const char* kFolderTypes[] = {"document", "audio", "video", "photo"};

// Calls `work` and puts into words for people what can go wrong with the list of folders.
void WithFolders(const std::function<void()>& work);

// Runs an operation on the folders of `paths`. Two things that the library takes for failures are
// made good: an index that an interrupted run made or deleted before (the engine's answer is
// `mendable`, and `mend_index` sees to it), and an index daemon that does not run. By then all is
// saved, and what the daemon would be told is put into the queues.
void ChangeFolders(const Console& console, const Json::Value& paths,
                   const std::function<void()>& work, const std::function<void()>& mend_index,
                   int mendable);

// Adds a folder, which is made a share when none holds it; that is said. `is_wanted` gets its
// record, with everything indexed and the share path as "path", may change it, and is asked whether
// to add it at all. The record as it left that. When it fails, a share that was made is taken out
// again.
Json::Value AddFolder(const std::string& folder, const Console& console,
                      const std::function<bool(Json::Value&)>& is_wanted);

}  // namespace vexlo::cli

#endif  // CLI_FOLDER_CHANGE_H_
