// The folders that a watcher knows, as names below names.
#ifndef WATCH_FOLDER_TREE_H_
#define WATCH_FOLDER_TREE_H_

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace vexlo::watch {

using FolderId = uint32_t;
inline constexpr FolderId kNoFolder = UINT32_MAX;

// What tells a folder from another one that stands at its path later.
struct FolderIdentity {
  dev_t device = 0;
  ino_t inode = 0;
  friend bool operator==(const FolderIdentity&, const FolderIdentity&) = default;
};

// No path is stored: a folder holds its name and its parent, so that a rename of a folder with a
// million others below it is one step. About 180 bytes a folder (beside some 1,100 of the kernel's
// for a watch). The root folders have no parent and their whole path as their name.
//
// - Names are unique among the children of a folder, and among the roots.
// - A watch descriptor belongs to at most one folder, and a folder has at most one.
// - The id of a removed folder is not given out again before Reclaim().
class FolderTree {
 public:
  FolderTree();
  ~FolderTree() = default;
  FolderTree(const FolderTree&) = delete;
  FolderTree& operator=(const FolderTree&) = delete;

  // There must be no such child yet; `parent` is kNoFolder for a root.
  FolderId Add(FolderId parent, std::string_view name, const FolderIdentity& identity);

  // kNoFolder when there is none.
  FolderId Find(FolderId parent, std::string_view name) const;

  // Gives the folder, and so all below it, a new place, which must be free and not below it.
  void Move(FolderId id, FolderId parent, std::string_view name);

  // Removes the folder and all below it, deepest first; `leaving` is called for each while it still
  // stands.
  void Remove(FolderId id, const std::function<void(FolderId)>& leaving);

  // Lets the ids of removed folders be used again.
  void Reclaim();

  // wd -1 for none. A folder that had the wd loses it.
  void SetWatch(FolderId id, int wd);
  FolderId FolderOf(int wd) const;

  bool Contains(FolderId id) const { return id < folders_.size() && folders_[id].alive; }
  FolderId Parent(FolderId id) const { return folders_[id].parent; }
  const std::string& Name(FolderId id) const { return folders_[id].name; }
  const FolderIdentity& Identity(FolderId id) const { return folders_[id].identity; }
  int Watch(FolderId id) const { return folders_[id].wd; }
  std::vector<FolderId> Children(FolderId id) const;
  bool IsWithin(FolderId id, FolderId ancestor) const;  // True for the folder itself too.
  std::string Path(FolderId id) const;

  size_t size() const { return by_name_.size(); }
  size_t Watched() const { return by_watch_.size(); }

 private:
  struct Folder {
    std::string name;
    FolderIdentity identity;
    FolderId parent = kNoFolder;
    FolderId first_child = kNoFolder;
    FolderId next = kNoFolder;      // Siblings, in no order.
    FolderId previous = kNoFolder;  // kNoFolder for a first child.
    int wd = -1;
    bool alive = false;
  };
  struct Place {
    FolderId parent;
    std::string_view name;
  };
  // Hashes and compares ids by the place that the folder has.
  struct ByPlace {
    using is_transparent = void;  // NOLINT(readability-identifier-naming): the library's name.
    const std::vector<Folder>* folders;
    Place PlaceOf(FolderId id) const { return {(*folders)[id].parent, (*folders)[id].name}; }
    static Place PlaceOf(const Place& place) { return place; }
    size_t operator()(FolderId id) const { return (*this)(PlaceOf(id)); }
    size_t operator()(const Place& place) const;
    template <typename A, typename B>
    bool operator()(const A& a, const B& b) const {
      const Place left = PlaceOf(a);
      const Place right = PlaceOf(b);
      return left.parent == right.parent && left.name == right.name;
    }
  };

  void Link(FolderId id, FolderId parent, std::string_view name);
  void Unlink(FolderId id);

  std::vector<Folder> folders_;
  std::vector<FolderId> removed_;
  std::vector<FolderId> free_;
  std::unordered_set<FolderId, ByPlace, ByPlace> by_name_;
  std::unordered_map<int, FolderId> by_watch_;
};

}  // namespace vexlo::watch

#endif  // WATCH_FOLDER_TREE_H_
