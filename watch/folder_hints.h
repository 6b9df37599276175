// Changes in folders that have no watch of their own.
#ifndef WATCH_FOLDER_HINTS_H_
#define WATCH_FOLDER_HINTS_H_

#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "watch/directory.h"
#include "watch/folder_tree.h"

namespace vexlo::watch {

// A mark on a file system (fanotify) needs no memory for each folder and has no limit, but the
// kernel may tell of it out of order: it joins events on one name. So it says where to look, not
// what has happened. It wants CAP_SYS_ADMIN, and a file system that gives out handles; elsewhere
// every call is as if nothing ever changed.
class FolderHints {
 public:
  FolderHints();

  // Tells of changes in the folder that is open as `fd` from now on; what was told of this id
  // before is forgotten. False when that cannot be.
  bool Add(FolderId folder, int fd);
  void Remove(FolderId folder);

  // Readable when there is something to take; -1 when there never is.
  int fd() const { return fd_.Get(); }

  // The folders whose entries have changed since the last call, some of them several times. When
  // the kernel has lost events of a busy file system, some are missing: who takes hints looks at
  // all folders from time to time.
  std::vector<FolderId> Take();

  size_t size() const { return handles_.size(); }

 private:
  void TakeEvents(std::string_view events, std::vector<FolderId>* changed) const;

  const Fd fd_;
  // A handle is the file system's id and what name_to_handle_at() gives, as bytes.
  std::unordered_map<FolderId, std::string> handles_;
  std::unordered_map<std::string, FolderId> folders_;
};

}  // namespace vexlo::watch

#endif  // WATCH_FOLDER_HINTS_H_
