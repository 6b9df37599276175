// The list of indexed folders: loading, saving, and which folder's settings a path goes by.
#ifndef FILEINDEX_FOLDER_MGR_H_
#define FILEINDEX_FOLDER_MGR_H_

#include <cstddef>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "common/export.h"
#include "fileindex/folder.h"

namespace vexlo::fileindex {

class PathIndex;

// The folders file as it was when the object was made, and changes to it in memory, which Save()
// writes.
//
// - A folder *covers* its full path and everything below it. The questions about full paths are
//   answered through an index that the first of them builds, so each costs what its path's
//   components cost, however many folders there are. Building it looks up every folder's share:
//   while one of them is unknown, those questions throw Error 800, whatever they are about. A list
//   that holds such a folder can still be loaded, changed by DeleteByShare(), and saved.
// - Readers take no lock: the file is replaced whole. Who changes it holds the folders' lock file
//   (kFileIndexFoldersLockPath) from before the object is made until after Save().
// - For one thread at a time; after a first question has been answered, several threads may ask as
//   long as nobody changes the list.
class VEXLO_EXPORT FolderMgr {
 public:
  // A missing file, or one that holds null, is an empty list. Throws Error 504 when the file cannot
  // be read, is no JSON or no array, and what Folder's constructor throws for any of its elements:
  // none is skipped.
  FolderMgr();

  // Writes the file, mode 0644, as root (see SDKCredentials). Throws Error 505 when it cannot be
  // written, 502 when its mode cannot be set, each with the file's path, and 503 for want of root.
  void Save() const;

  // In the order of the file, which is the order in which they were added or last changed.
  const std::vector<std::shared_ptr<Folder>>& GetFolders() const { return folders_; }

  // The folder of exactly this share path. Throws Error 902 with the path when there is none.
  void Get(std::shared_ptr<Folder>& out, const std::string& path) const;
  bool HasFolder(const std::string& path) const;

  // Adds a folder at the end, in place of any that has its path. `diff` becomes
  // DiffCfg(folder, the folder that covered its full path before).
  void Upsert(std::shared_ptr<Folder>& diff, std::shared_ptr<Folder> folder);

  // Removes what has exactly this path. `diff` becomes DiffCfg(the folder that covered the path
  // before, the one that does now): null when none did. Throws Error 120 and 800 as GetFullPath()
  // does.
  void Delete(std::shared_ptr<Folder>& diff, const std::string& path);

  // Removes the folders of a share, be it unknown by now.
  void DeleteByShare(const std::string& share);

  // What has to be indexed anew at a's path when it goes by `a` and went by `b` before, or the
  // other way round: a folder of a's path and name whose types are true where the two differ, all
  // four when `b` is null. Null when `a` is.
  std::shared_ptr<Folder> DiffCfg(std::shared_ptr<Folder> a, std::shared_ptr<Folder> b) const;

  // The folder whose settings hold for a path: the deepest that covers it, the first of several at
  // one place; null when none does.
  std::shared_ptr<Folder> GetMostSuitableCfg(const std::string& full_path) const;
  bool IsFullPathIndexed(const std::string& full_path) const;

  // Whether the path is itself a folder's.
  bool IsFullPathHasOwnCfg(const std::string& full_path) const;

  // Whether a file is to be indexed with what stands in it, which is the covering folder's setting
  // for the file's type. A file of no type is whenever it is covered.
  bool IsFullPathNeedMeta(const std::string& full_path) const;

  // Whether a folder lies in the share.
  bool IsShareIndexed(const std::string& share) const;
  std::set<std::string> GetIndexedShares() const;

  // The groups that folders are in.
  std::set<std::string> GetGroups() const;

  // One page of the list.
  //   group           only folders of this group; "" and "all" mean every folder
  //   keyword         only folders whose name or path holds it, ASCII letters in either case; ""
  //                   means every folder
  //   sort_by         "name", "path", "owner" or "group", by bytes; "" is the order of the file
  //   sort_direction  "ASC" (or "") or "DESC", in any case; of equals the file's order holds in
  //                   both directions, and without `sort_by` it changes nothing
  //   offset, limit   folders to leave out and the most to give; a limit of 0 is none
  // `out` becomes the page and `total` the number of folders that pass both filters. Throws Error
  // 120 for any other `sort_by` or `sort_direction`.
  void List(std::vector<std::shared_ptr<Folder>>& out, size_t& total, unsigned long offset,
            unsigned long limit, const std::string& sort_by, const std::string& sort_direction,
            const std::string& group, const std::string& keyword) const;

 private:
  const PathIndex& GetIndex() const;
  std::shared_ptr<Folder> At(size_t place) const;
  template <typename Matches>
  void Erase(Matches matches);

  std::vector<std::shared_ptr<Folder>> folders_;
  mutable std::shared_ptr<const PathIndex>
      index_;  // Of the full paths of folders_; null until asked for.
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_FOLDER_MGR_H_
