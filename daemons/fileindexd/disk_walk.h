// Walks a folder in the order in which an index lists it, with bounded memory.
#ifndef DAEMONS_FILEINDEXD_DISK_WALK_H_
#define DAEMONS_FILEINDEXD_DISK_WALK_H_

#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "daemons/common/unique_fd.h"

namespace vexlo::fileindexd {

struct DiskEntry {
  std::string path;
  struct stat info {};
};

// What a walk asks of a path.
struct WalkRules {
  using Question = std::function<bool(const std::string& path)>;
  Question covers;  // Whether it belongs to the index at all, with everything below it.
  Question leads;   // Whether something below it is covered.
  // Whether the policy lets it in. Asked for the root, for folders, for what is mounted, and for
  // files that HasRefusableName() is true of.
  Question allows;
  bool enters = true;  // Whether folders below the root are gone into.
};

// Whether the errno says that nothing is there, or no folder: an answer, and no failure.
bool MeansGone(int error);

// Whether the policy may refuse a file by its name in a folder that it lets in: one like those of
// recycle bins and snapshots.
bool HasRefusableName(const std::string& name);

// The order is that of full paths as bytes: "a", "a.txt", "a/b". A folder's own path so stands
// apart from what is in it, where names come between that have a byte below "/".
//
// Folders are opened by descriptor from the one above, and no symbolic link is followed or given. A
// folder's names are held as long as they are few, else read anew in portions; so memory depends on
// neither the number of files nor the size of a folder. A folder that cannot be read, and a file
// that cannot be looked at, are left out and remembered as unknown.
class DiskWalk {
 public:
  // Gives what is at and below `root` behind the path `after` ("" for all). `portion` is the most
  // names of one folder that are held.
  DiskWalk(const std::string& root, std::string after, WalkRules rules, size_t portion = 65536);

  std::optional<DiskEntry> Next();

  // Whether it is not known what is at the path. To be asked of paths in the walk's order, none
  // behind the last that was given or the walk's end.
  bool IsUnknown(const std::string& path);

  // Folders and files that could not be looked at, and why the last one.
  uint64_t UnknownCount() const { return unknown_count_; }
  int LastError() const { return last_error_; }

 private:
  struct Frame {
    std::string path;
    daemon::UniqueFd fd;
    dev_t device = 0;
    bool is_covered = false;
    bool is_above_root = false;
    // Names in order; one with "/" behind it stands for what is below.
    std::vector<std::string> keys;
    size_t next = 0;
    std::string last;  // Keys up to here are done with.
    bool is_complete = false;
    std::unordered_map<std::string, bool> may_enter;  // Of folders that were met.
  };

  std::optional<DiskEntry> Look(Frame& frame, const std::string& name);
  void Enter(Frame& frame, const std::string& name);
  bool MayEnter(Frame& frame, const std::string& name, const std::string& path);
  void Fill(Frame& frame);
  void LetGo();
  void AddUnknown(std::string path, int error);

  const std::string after_;
  const WalkRules rules_;
  const size_t portion_;
  std::vector<Frame> frames_;
  std::vector<char> buffer_;
  std::deque<std::string> unknown_;  // In order; with "/" behind it, everything below.
  uint64_t unknown_count_ = 0;
  int last_error_ = 0;
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_DISK_WALK_H_
