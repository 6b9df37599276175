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

// The share path of a folder; it is made a share, and that is said, when none holds it.
std::string ShareFor(const std::string& folder, const Console& console);

// A record for the folder of this share path, with everything indexed.
Json::Value NewFolder(const std::string& path);

// Adds the folder of a record.
void AddFolder(const Json::Value& record, const Console& console);

}  // namespace vexlo::cli

#endif  // CLI_FOLDER_CHANGE_H_
