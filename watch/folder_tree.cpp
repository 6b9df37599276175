#include "watch/folder_tree.h"

namespace vexlo::watch {

size_t FolderTree::ByPlace::operator()(const Place& place) const {
  return std::hash<std::string_view>()(place.name) ^ (place.parent * size_t{0x9e3779b97f4a7c15});
}

FolderTree::FolderTree() : by_name_(16, ByPlace{&folders_}, ByPlace{&folders_}) {}

FolderId FolderTree::Add(FolderId parent, std::string_view name, const FolderIdentity& identity) {
  FolderId id;
  if (free_.empty()) {
    id = static_cast<FolderId>(folders_.size());
    folders_.emplace_back();
  } else {
    id = free_.back();
    free_.pop_back();
  }
  folders_[id].alive = true;
  folders_[id].identity = identity;
  Link(id, parent, name);
  return id;
}

FolderId FolderTree::Find(FolderId parent, std::string_view name) const {
  const auto found = by_name_.find(Place{parent, name});
  return found == by_name_.end() ? kNoFolder : *found;
}

void FolderTree::Move(FolderId id, FolderId parent, std::string_view name) {
  Unlink(id);
  Link(id, parent, name);
}

void FolderTree::Remove(FolderId id, const std::function<void(FolderId)>& leaving) {
  FolderId at = id;
  for (;;) {
    while (folders_[at].first_child != kNoFolder) {
      at = folders_[at].first_child;
    }
    leaving(at);
    SetWatch(at, -1);
    const FolderId parent = folders_[at].parent;
    Unlink(at);
    folders_[at] = Folder();
    removed_.push_back(at);
    if (at == id) {
      return;
    }
    at = parent;
  }
}

void FolderTree::Reclaim() {
  free_.insert(free_.end(), removed_.begin(), removed_.end());
  removed_.clear();
}

void FolderTree::SetWatch(FolderId id, int wd) {
  Folder& folder = folders_[id];
  if (folder.wd == wd) {
    return;
  }
  if (folder.wd >= 0) {
    by_watch_.erase(folder.wd);
  }
  folder.wd = wd;
  if (wd >= 0) {
    const auto [entry, added] = by_watch_.try_emplace(wd, id);
    if (!added) {
      folders_[entry->second].wd = -1;
      entry->second = id;
    }
  }
}

FolderId FolderTree::FolderOf(int wd) const {
  const auto found = by_watch_.find(wd);
  return found == by_watch_.end() ? kNoFolder : found->second;
}

std::vector<FolderId> FolderTree::Children(FolderId id) const {
  std::vector<FolderId> children;
  for (FolderId at = folders_[id].first_child; at != kNoFolder; at = folders_[at].next) {
    children.push_back(at);
  }
  return children;
}

bool FolderTree::IsWithin(FolderId id, FolderId ancestor) const {
  while (id != kNoFolder && id != ancestor) {
    id = folders_[id].parent;
  }
  return id == ancestor;
}

std::string FolderTree::Path(FolderId id) const {
  size_t length = 0;
  for (FolderId at = id; at != kNoFolder; at = folders_[at].parent) {
    length += folders_[at].name.size() + 1;
  }
  std::string path(length, '/');
  while (folders_[id].parent != kNoFolder) {
    const std::string& name = folders_[id].name;
    length -= name.size() + 1;
    path.replace(length + 1, name.size(), name);
    id = folders_[id].parent;
  }
  // A root's name begins with its slash; below "/" that would be one too many.
  const std::string& root = folders_[id].name;
  path.replace(0, length, root.size() == 1 && path.size() > length ? "" : root);
  return path;
}

void FolderTree::Link(FolderId id, FolderId parent, std::string_view name) {
  Folder& folder = folders_[id];
  folder.name = name;
  folder.parent = parent;
  folder.previous = kNoFolder;
  folder.next = kNoFolder;
  if (parent != kNoFolder) {
    folder.next = folders_[parent].first_child;
    if (folder.next != kNoFolder) {
      folders_[folder.next].previous = id;
    }
    folders_[parent].first_child = id;
  }
  by_name_.insert(id);
}

void FolderTree::Unlink(FolderId id) {
  Folder& folder = folders_[id];
  by_name_.erase(id);
  if (folder.previous != kNoFolder) {
    folders_[folder.previous].next = folder.next;
  } else if (folder.parent != kNoFolder) {
    folders_[folder.parent].first_child = folder.next;
  }
  if (folder.next != kNoFolder) {
    folders_[folder.next].previous = folder.previous;
  }
}

}  // namespace vexlo::watch
