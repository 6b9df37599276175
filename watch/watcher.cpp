#include "watch/watcher.h"

#include <fcntl.h>
#include <mntent.h>
#include <sys/inotify.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <system_error>

#include "common/check.h"
#include "common/error.h"

namespace vexlo::watch {
namespace {

constexpr uint32_t kKernelMask = IN_CREATE | IN_CLOSE_WRITE | IN_ATTRIB | IN_DELETE |
                                 IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF |
                                 IN_ONLYDIR | IN_EXCL_UNLINK;
constexpr char kWatchLimitFile[] = "/proc/sys/fs/inotify/max_user_watches";

// Events are taken out of the kernel's queue also while folders are walked, lest it overflow: it
// holds 16,384 by default. So many are kept here at most.
constexpr size_t kMaxWaiting = size_t{1} << 20;
constexpr size_t kFoldersBetweenPulls = 256;
constexpr size_t kMaxOpenFolders = 32;
constexpr std::chrono::milliseconds kHintWait(2000);
constexpr std::chrono::milliseconds kRetryPause(1000);
constexpr size_t kRescanAtOnce = 1024;  // Folders, so that events are not kept waiting for longer.

Fd StartInotify() {
  Fd fd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  VEXLO_CHECK(!fd, ERR_SYSTEM,
              errno == EMFILE
                  ? std::string("no inotify instance left for this user (fs.inotify."
                                "max_user_instances) or no file descriptor for this process")
              : errno == ENFILE ? std::string("the system has no file left to open (fs.file-max)")
                                : std::string("inotify cannot be used, reason=") + strerror(errno));
  return fd;
}

bool IsAmong(const std::vector<std::string>& names, std::string_view name) {
  return std::find(names.begin(), names.end(), name) != names.end();
}

bool IsNormalised(const std::string& path) {
  if (path == "/") {
    return true;
  }
  if (path.empty() || path[0] != '/' || path.find('\0') != std::string::npos) {
    return false;
  }
  for (size_t at = 1; at <= path.size();) {
    const size_t slash = std::min(path.find('/', at), path.size());
    const std::string_view name = std::string_view(path).substr(at, slash - at);
    if (name.empty() || name == "." || name == "..") {
      return false;
    }
    at = slash + 1;
  }
  return true;
}

bool IsBelow(const std::string& path, const std::string& folder) {
  return path.size() > folder.size() && path.starts_with(folder) &&
         (folder.size() == 1 || path[folder.size()] == '/');
}

FolderIdentity IdentityOf(const struct stat& attributes) {
  return {attributes.st_dev, attributes.st_ino};
}

// What is mounted, each as its folder, a NUL, what is mounted there, and how often that came
// before.
std::set<std::string> MountsNow() {
  std::set<std::string> mounts;
  const std::unique_ptr<FILE, decltype(&endmntent)> table(setmntent("/proc/self/mounts", "re"),
                                                          &endmntent);
  struct mntent entry {};
  std::vector<char> buffer(size_t{1} << 16);
  while (table != nullptr && getmntent_r(table.get(), &entry, buffer.data(),
                                         static_cast<int>(buffer.size())) != nullptr) {
    const std::string mount = entry.mnt_dir + std::string(1, '\0') + entry.mnt_fsname + '\0';
    for (size_t before = 0; !mounts.insert(mount + std::to_string(before)).second;) {
      ++before;
    }
  }
  return mounts;
}

// Otherwise descriptors or memory were short, or a disk failed, which may be over in a moment.
bool MeansNoPermission(int error) { return error == EACCES || error == EPERM; }

// Whether the way down from `folder` leads over a symbolic link to what is below it; `path` itself
// is not looked at.
bool HasLinkBetween(const std::string& folder, const std::string& path) {
  for (size_t slash = path.find('/', folder.size() + 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    struct stat attributes = {};
    if (lstat(path.substr(0, slash).c_str(), &attributes) == 0 && S_ISLNK(attributes.st_mode)) {
      return true;
    }
  }
  return false;
}

std::string Count(size_t count, const char* what) {
  return std::to_string(count) + " " + what + (count == 1 ? "" : "s");
}

}  // namespace

// The folders on the way to the one that is visited, open. A walk goes down and up along it, so
// that each folder is opened from its parent; only coming back from greater depth than is kept open
// costs the whole way from the root.
class Watcher::Chain {
 public:
  explicit Chain(const Watcher& watcher) : watcher_(watcher) {}

  // -1 when the folder does not stand where the tree has it.
  int Open(FolderId folder) {
    while (!open_.empty() && open_.back().first != folder) {
      open_.pop_back();
    }
    if (open_.empty()) {
      Fd fd = watcher_.OpenFolder(folder);
      if (!fd) {
        return -1;
      }
      open_.emplace_back(folder, std::move(fd));
    }
    return open_.back().second.Get();
  }

  void Push(FolderId folder, Fd fd) {
    if (open_.size() == kMaxOpenFolders) {
      open_.erase(open_.begin());
    }
    open_.emplace_back(folder, std::move(fd));
  }

 private:
  const Watcher& watcher_;
  std::vector<std::pair<FolderId, Fd>> open_;
};

Watcher::Watcher(const std::vector<std::string>& roots, WatchOptions options, Sink sink,
                 TimePoint now)
    : options_(std::move(options)),
      ignored_(options_.ignored.begin(), options_.ignored.end()),
      sink_(std::move(sink)),
      fd_(StartInotify()),
      now_(now),
      buffer_(size_t{1} << 16),
      changes_(options_.move_wait),
      next_rescan_(now + options_.rescan_interval),
      mounts_(MountsNow()) {
  for (const std::string& path : roots) {
    CheckPath(path);
    if (std::none_of(roots_.begin(), roots_.end(),
                     [&](const Root& root) { return root.path == path; })) {
      roots_.push_back({path});
    }
  }
  for (Root& root : roots_) {
    root.covered = IsCovered(root.path);
    if (!root.covered) {
      Walk({{kNoFolder, root.path, true}}, {});
      root.folder = tree_.Find(kNoFolder, root.path);
    }
  }
  LogChangedState();
}

// --- What the kernel reports

void Watcher::Pull() {
  drained_ = false;
  while (changes_.size() < kMaxWaiting) {
    alignas(inotify_event) char events[1 << 14];
    const ssize_t length = read(fd_.Get(), events, sizeof(events));
    if (length < 0 && errno == EINTR) {
      continue;
    }
    if (length <= 0) {
      drained_ = true;
      return;
    }
    for (ssize_t at = 0; at < length;) {
      const auto* event = reinterpret_cast<const inotify_event*>(events + at);
      changes_.Push({event->wd, event->mask, event->cookie,
                     event->len == 0 ? std::string() : std::string(event->name)},
                    now_);
      at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
    }
  }
}

void Watcher::Poll(TimePoint now) {
  now_ = now;
  Pull();
  while (const std::optional<Change> change = changes_.Next(now)) {
    Apply(*change);
  }
  if (drained_ && changes_.empty() && !unsettled_.empty()) {
    Settle();
  }
  // What a root's end was told of may have been made anew long since, and even with its inode: who
  // looked before the end was read took the new folder for the old one.
  if (drained_ && changes_.empty() && std::exchange(root_ended_, false)) {
    CheckRoots();
  }
  if (now >= next_rescan_) {
    next_rescan_ = now + options_.rescan_interval;
    CheckMounts();
    CheckRoots();
    if (rescan_.empty()) {
      rescan_.assign(unreadable_.begin(), unreadable_.end());
      for (const auto& [folder, hash] : unwatched_) {
        rescan_.push_back(folder);
      }
    }
  }
  if (now >= next_retry_) {
    next_retry_ = TimePoint::max();
    rescan_.insert(rescan_.end(), unreadable_.begin(), unreadable_.end());
  }
  TakeHints();
  Rescan();
  if (unreadable_.empty()) {
    retry_pause_ = {};
  }
  LogChangedState();
  tree_.Reclaim();
}

TimePoint Watcher::NextDeadline() const {
  if (!rescan_.empty() || !drained_) {
    return TimePoint::min();
  }
  return std::min({IsAtRest() ? TimePoint::max() : next_rescan_, next_retry_,
                   hinted_.empty() ? TimePoint::max() : next_hinted_,
                   changes_.NextDeadline().value_or(TimePoint::max())});
}

// Nothing is there that only time will tell.
bool Watcher::IsAtRest() const {
  return !options_.polls_roots && unwatched_.empty() && unreadable_.empty() &&
         std::none_of(roots_.begin(), roots_.end(),
                      [](const Root& root) { return root.folder == kNoFolder && !root.covered; });
}

FolderId Watcher::FolderOf(int wd) const {
  return leaving_.count(wd) != 0 ? kNoFolder : tree_.FolderOf(wd);
}

void Watcher::Apply(const Change& change) {
  if (change.kind == ChangeKind::kOverflow) {
    ApplyOverflow();
    return;
  }
  if (change.kind == ChangeKind::kRenamed) {
    ApplyRenamed(change);
    return;
  }
  const FolderId folder = FolderOf(change.wd);
  if (change.kind == ChangeKind::kUnwatched) {
    leaving_.erase(change.wd);
  }
  if (folder == kNoFolder) {
    return;
  }
  if (change.name.empty()) {
    ApplyToSelf(change, folder);
  } else {
    ApplyToEntry(change, folder);
  }
}

// The parent's watch reports what happens to a folder itself, and in its order among the rest; so
// it counts here only where no parent is watched.
void Watcher::ApplyToSelf(const Change& change, FolderId folder) {
  const FolderId parent = tree_.Parent(folder);
  Root* root = RootOf(folder);
  const bool told_by_parent = root == nullptr && tree_.Watch(parent) >= 0;
  switch (change.kind) {
    case ChangeKind::kSelfAttributes:
      if (!told_by_parent) {
        Emit(kMaskAttrib, true, tree_.Path(folder));
      }
      break;
    case ChangeKind::kSelfDeleted:
    case ChangeKind::kUnmounted:
      if (root != nullptr) {
        RootGone(*root);
      } else if (change.kind == ChangeKind::kUnmounted) {
        unsettled_.insert(parent);
      } else if (!told_by_parent) {
        Emit(kMaskDelete, true, tree_.Path(folder));
        Drop(folder);
      }
      break;
    case ChangeKind::kSelfMoved:
      if (root != nullptr && !Stands(*root)) {
        RootGone(*root);
      } else if (!told_by_parent && root == nullptr) {
        unsettled_.insert(parent);
      }
      break;
    case ChangeKind::kUnwatched:
      tree_.SetWatch(folder, -1);
      break;
    default:
      break;
  }
}

void Watcher::ApplyToEntry(const Change& change, FolderId parent) {
  std::string path = PathOf(parent, change.name);
  if (IsHidden(path, change.name)) {
    return;
  }
  const FolderId known = change.is_dir ? tree_.Find(parent, change.name) : kNoFolder;
  switch (change.kind) {
    case ChangeKind::kCreated:
      Emit(kMaskCreate, change.is_dir, std::move(path));
      if (change.is_dir) {
        Walk({{parent, change.name, true}}, {.report = true});
      }
      break;
    case ChangeKind::kWritten:
      Emit(kMaskCloseWrite, change.is_dir, std::move(path));
      break;
    case ChangeKind::kAttributes:
      Emit(kMaskAttrib, change.is_dir, std::move(path));
      if (known != kNoFolder && unreadable_.count(known) != 0) {
        Walk({{parent, change.name, true}}, {.deep = true});
      }
      break;
    case ChangeKind::kDeleted:
      Emit(kMaskDelete, change.is_dir, std::move(path));
      if (known != kNoFolder) {
        Drop(known);
      }
      if (change.reverses) {
        ApplyRecreated(parent, change.name);
      }
      break;
    default:
      break;
  }
}

// After a delete that may be the second half of an exchange.
void Watcher::ApplyRecreated(FolderId parent, const std::string& name) {
  const Standing standing = WhatStands(parent, name);
  if (standing == Standing::kUnreachable) {
    unsettled_.insert(parent);
  } else if (standing != Standing::kNothing) {
    Emit(kMaskCreate, standing == Standing::kFolder, PathOf(parent, name));
    Walk({{parent, name, true}}, {.report = true});
  }
}

void Watcher::ApplyRenamed(const Change& change) {
  const FolderId from = FolderOf(change.wd_old);
  const FolderId to = FolderOf(change.wd);
  const bool from_seen =
      from != kNoFolder && !IsHidden(PathOf(from, change.name_old), change.name_old);
  const bool to_seen = to != kNoFolder && !IsHidden(PathOf(to, change.name), change.name);
  if (!from_seen || !to_seen) {
    Change half = change;
    if (to_seen) {
      half.kind = ChangeKind::kCreated;
      ApplyToEntry(half, to);
    } else if (from_seen) {
      half.kind = ChangeKind::kDeleted;
      half.name = change.name_old;
      ApplyToEntry(half, from);
    }
    return;
  }
  Emit(kMaskRename, change.is_dir, PathOf(to, change.name), PathOf(from, change.name_old));
  if (change.is_dir) {
    ApplyFolderRenamed(from, to, change);
  }
  if (change.reverses) {
    ReportExchanged(from, to, change);
  }
}

// A rename there and back looks the same when the exchanged thing has been deleted since; reporting
// it once more does no harm.
void Watcher::ReportExchanged(FolderId from, FolderId to, const Change& change) {
  const std::pair<FolderId, const std::string&> places[] = {{from, change.name_old},
                                                            {to, change.name}};
  // Where a file stands for a folder now, what was known below it must go too.
  const bool only_files = std::all_of(std::begin(places), std::end(places), [&](const auto& place) {
    const Standing standing = WhatStands(place.first, place.second);
    return standing == Standing::kFile || standing == Standing::kNothing;
  });
  for (const auto& [folder, name] : places) {
    const Standing standing = WhatStands(folder, name);
    if (standing == Standing::kFile || standing == Standing::kFolder) {
      Walk({{folder, name, true}}, {.report = true});
      Emit(only_files ? kMaskCreate : kMaskReindex, standing == Standing::kFolder,
           PathOf(folder, name));
    } else if (standing == Standing::kUnreachable && tree_.Contains(folder)) {
      unsettled_.insert(folder);
    }
  }
}

// The tree follows the events, the disk may be ahead of them: a folder that was made and renamed
// before we saw it was never entered, or another one that took its name was entered in its place.
// So what stands at the new name is compared with what the tree moved there.
void Watcher::ApplyFolderRenamed(FolderId from, FolderId to, const Change& change) {
  FolderId moved = tree_.Find(from, change.name_old);
  const FolderId occupant = tree_.Find(to, change.name);
  if (moved != kNoFolder && tree_.IsWithin(to, moved)) {
    Drop(moved);  // The tree is wrong here; `to` goes with it and is found again.
    unsettled_.insert(from);
    return;
  }
  if (moved != kNoFolder && moved != occupant) {
    if (occupant != kNoFolder) {
      Drop(occupant);
    }
    if (tree_.Contains(moved)) {
      tree_.Move(moved, to, change.name);
    } else {
      moved = kNoFolder;
    }
  }
  if (Walk({{to, change.name, true}}, {.report = true}) || moved == kNoFolder) {
    Emit(kMaskReindex, true, PathOf(to, change.name));
    Walk({{from, change.name_old}}, {.report = true});
  }
}

void Watcher::ApplyOverflow() {
  leaving_.clear();  // Their last events may be among the lost ones.
  for (Root& root : roots_) {
    if (root.folder != kNoFolder) {
      if (!Stands(root)) {
        RootGone(root);
        continue;
      }
      Walk({{kNoFolder, root.path, true}}, {.deep = true});
    }
  }
  for (const Root& root : roots_) {
    Emit(kMaskCrashed, true, root.path);
  }
}

// --- What is on disk

bool Watcher::Walk(std::vector<Visit> visits, VisitMode mode) {
  Chain chain(*this);
  bool replaced = false;
  for (size_t count = 1; !visits.empty(); ++count) {
    if (options_.stop.stop_requested()) {
      break;
    }
    const Visit visit = std::move(visits.back());
    visits.pop_back();
    if (count % kFoldersBetweenPulls == 0) {
      Pull();
    }
    int parent_fd = AT_FDCWD;
    if (visit.parent != kNoFolder) {
      if (!tree_.Contains(visit.parent)) {
        continue;
      }
      parent_fd = chain.Open(visit.parent);
      if (parent_fd < 0) {
        // Of an unwatched folder the look at its own parent tells.
        if (tree_.Watch(visit.parent) >= 0) {
          unsettled_.insert(visit.parent);
        }
        continue;
      }
    }
    Entered entered = Enter(visit, parent_fd, mode.deep);
    replaced |= entered.replaced;
    if (entered.appeared && mode.report && !visit.announced) {
      Emit(kMaskCreate, true, PathOf(visit.parent, visit.name));
    }
    if (entered.fd) {
      List(entered.folder, entered.fd.Get(), mode, entered.before, &visits);
      chain.Push(entered.folder, std::move(entered.fd));
    }
  }
  for (std::string& path : std::exchange(changed_, {})) {
    Emit(kMaskReindex, true, std::move(path));
  }
  for (Root& root : roots_) {
    if (root.folder != kNoFolder && !tree_.Contains(root.folder)) {
      root.folder = tree_.Find(kNoFolder, root.path);
    }
  }
  return replaced;
}

Watcher::Entered Watcher::Enter(const Visit& visit, int parent_fd, bool deep) {
  Fd fd =
      visit.parent == kNoFolder ? OpenDirectory(visit.name) : OpenDirectory(parent_fd, visit.name);
  struct stat attributes = {};
  if (!fd || fstat(fd.Get(), &attributes) != 0) {
    return EnterUnopened(visit, parent_fd, deep, errno);
  }
  Entered entered;
  FolderId known = tree_.Find(visit.parent, visit.name);
  if (known != kNoFolder && !(tree_.Identity(known) == IdentityOf(attributes))) {
    Drop(known);
    known = kNoFolder;
    entered.replaced = true;
  }
  int wd = -1;
  const bool at_limit = options_.max_watches != 0 && tree_.Watched() >= options_.max_watches;
  if (!at_limit || unwatched_.count(known) == 0) {
    wd = AddWatch(fd.Get());
  }
  const FolderId placed = PlaceHolder(visit, known, fd.Get(), &wd);
  bool read = deep;
  entered.appeared = placed != known || placed == kNoFolder;
  entered.folder = placed;
  if (placed == kNoFolder) {
    entered.folder = tree_.Add(visit.parent, visit.name, IdentityOf(attributes));
    read = true;
  }
  tree_.SetWatch(entered.folder, wd);
  if (const auto unwatched = unwatched_.find(entered.folder); unwatched != unwatched_.end()) {
    entered.before = unwatched->second;
    unwatched_.erase(unwatched);
  } else if (unreadable_.erase(entered.folder) != 0) {
    entered.before = 0;
  }
  if (wd < 0) {
    unwatched_[entered.folder] = 0;
    if (options_.takes_hints) {
      (hints_ ? *hints_ : hints_.emplace()).Add(entered.folder, fd.Get());  // Before it is read.
    }
  } else if (hints_) {
    hints_->Remove(entered.folder);
  }
  if (read || wd < 0 || entered.before) {
    entered.fd = std::move(fd);
  }
  return entered;
}

Watcher::Entered Watcher::EnterUnopened(const Visit& visit, int parent_fd, bool deep, int error) {
  FolderId known = tree_.Find(visit.parent, visit.name);
  if (MeansNoDirectory(error)) {
    // Where a parent is watched its events tell, in their order.
    if (known != kNoFolder && visit.parent != kNoFolder &&
        (deep || (tree_.Watch(known) < 0 && tree_.Watch(visit.parent) < 0))) {
      Drop(known);
    }
    return {};
  }
  Entered entered;
  if (known == kNoFolder) {
    struct stat attributes = {};
    if (fstatat(parent_fd, visit.name.c_str(), &attributes, AT_SYMLINK_NOFOLLOW) != 0 ||
        !S_ISDIR(attributes.st_mode)) {
      return {};
    }
    known = tree_.Add(visit.parent, visit.name, IdentityOf(attributes));
    entered.appeared = true;
  }
  // With a watch, too: what was made in it meanwhile has not been read.
  unwatched_.erase(known);
  unreadable_.insert(known);
  if (!MeansNoPermission(error) && next_retry_ == TimePoint::max()) {
    retry_pause_ = std::clamp<std::chrono::milliseconds>(
        2 * retry_pause_, std::min(kRetryPause, options_.rescan_interval),
        options_.rescan_interval);
    next_retry_ = now_ + retry_pause_;
  }
  entered.folder = known;
  return entered;
}

// The kernel knows a folder by its inode, so the watch it gave may be the one of a folder that the
// tree has elsewhere: one that has moved here, which the events have not told yet or never will
// (from a folder that is not watched). Then all of it is moved here. Or one that is mounted in two
// places: it stays in the first, and the second is looked at like a folder that has no watch.
FolderId Watcher::PlaceHolder(const Visit& visit, FolderId known, int fd, int* wd) {
  const FolderId holder = *wd < 0 ? kNoFolder : tree_.FolderOf(*wd);
  if (holder == kNoFolder || holder == known) {
    return known;
  }
  const bool stands = static_cast<bool>(OpenFolder(holder));
  if (stands || tree_.IsWithin(visit.parent, holder)) {
    if (!stands) {
      unsettled_.insert(visit.parent);  // It cannot be moved into itself: the tree is behind.
    }
    *wd = -1;
    return known;
  }
  if (known != kNoFolder) {
    Drop(known);
  }
  if (Root* root = RootOf(holder); root != nullptr) {
    RootGone(*root);
  } else if (visit.parent == kNoFolder && tree_.Contains(holder)) {
    Drop(holder);
  }
  if (!tree_.Contains(holder)) {
    *wd = AddWatch(fd);
    return kNoFolder;
  }
  tree_.Move(holder, visit.parent, visit.name);
  return holder;
}

void Watcher::List(FolderId folder, int fd, VisitMode mode, std::optional<uint64_t> before,
                   std::vector<Visit>* visits) {
  const auto unwatched = unwatched_.find(folder);
  const bool hashed = before || unwatched != unwatched_.end();
  const std::vector<FolderId> children = tree_.Children(folder);
  std::unordered_set<FolderId> found;
  uint64_t hash = 0;
  const bool complete = ReadDirectory(fd, buffer_, [&](std::string_view view, unsigned char type) {
    const std::string name(view);
    if (IsHidden(ignored_.empty() ? name : PathOf(folder, name), name)) {
      return;
    }
    if (hashed || type == DT_UNKNOWN) {
      struct stat attributes = {};
      if (fstatat(fd, name.c_str(), &attributes, AT_SYMLINK_NOFOLLOW) != 0) {
        return;
      }
      type = IFTODT(attributes.st_mode);
      hash += EntryHash(name, attributes);
    }
    if (type == DT_DIR) {
      const FolderId child = tree_.Find(folder, name);
      found.insert(child);
      if (mode.deep || child == kNoFolder) {
        visits->push_back({folder, name});
      }
    } else if (mode.report) {
      Emit(kMaskCreate, false, PathOf(folder, name));
    }
  });
  if (complete) {
    for (const FolderId child : children) {
      if (found.count(child) == 0) {
        Drop(child);
      }
    }
  }
  if (unwatched != unwatched_.end()) {
    unwatched->second = hash;
  }
  if (before && *before != hash) {
    changed_.push_back(tree_.Path(folder));
  }
}

// Opens the folder where the tree has it; false when another one or none stands there.
Fd Watcher::OpenFolder(FolderId folder) const {
  std::vector<FolderId> way;
  for (FolderId at = folder; at != kNoFolder; at = tree_.Parent(at)) {
    way.push_back(at);
  }
  Fd fd = OpenDirectory(tree_.Name(way.back()));
  for (size_t i = way.size() - 1; i > 0 && fd; --i) {
    fd = OpenDirectory(fd.Get(), tree_.Name(way[i - 1]));
  }
  struct stat attributes = {};
  if (fd &&
      (fstat(fd.Get(), &attributes) != 0 || !(IdentityOf(attributes) == tree_.Identity(folder)))) {
    return Fd();
  }
  return fd;
}

int Watcher::AddWatch(int fd) {
  const std::string path = "/proc/self/fd/" + std::to_string(fd);
  const int wd = inotify_add_watch(fd_.Get(), path.c_str(), kKernelMask);
  if (wd >= 0 && options_.max_watches != 0 && tree_.Watched() >= options_.max_watches &&
      tree_.FolderOf(wd) == kNoFolder) {
    if (inotify_rm_watch(fd_.Get(), wd) == 0) {
      leaving_.insert(wd);
    }
    return -1;
  }
  return wd;
}

void Watcher::Drop(FolderId folder) {
  tree_.Remove(folder, [this](FolderId id) {
    const int wd = tree_.Watch(id);
    if (wd >= 0 && inotify_rm_watch(fd_.Get(), wd) == 0) {
      leaving_.insert(wd);
      if (++removed_watches_ % kFoldersBetweenPulls == 0) {
        Pull();  // Each makes an event.
      }
    }
    unwatched_.erase(id);
    unreadable_.erase(id);
    unsettled_.erase(id);
    hinted_.erase(id);
    if (hints_) {
      hints_->Remove(id);
    }
  });
}

// --- Repair

void Watcher::Settle() {
  for (FolderId folder : std::exchange(unsettled_, {})) {
    while (tree_.Contains(folder) && tree_.Parent(folder) != kNoFolder && !OpenFolder(folder)) {
      folder = tree_.Parent(folder);
    }
    if (!tree_.Contains(folder)) {
      continue;
    }
    if (Root* root = RootOf(folder); root != nullptr && !Stands(*root)) {
      RootGone(*root);
      continue;
    }
    std::string path = tree_.Path(folder);
    Walk({{tree_.Parent(folder), tree_.Name(folder), true}}, {.deep = true});
    Emit(kMaskReindex, true, std::move(path));
  }
}

bool Watcher::Stands(const Root& root) const {
  const Fd fd = OpenDirectory(root.path);
  struct stat attributes = {};
  if (!fd || fstat(fd.Get(), &attributes) != 0) {
    return !MeansNoDirectory(errno);
  }
  return IdentityOf(attributes) == tree_.Identity(root.folder);
}

Watcher::Root* Watcher::RootOf(FolderId folder) {
  for (Root& root : roots_) {
    if (root.folder == folder) {
      return &root;
    }
  }
  return nullptr;
}

void Watcher::RootGone(Root& root) {
  root_ended_ = true;
  Emit(kMaskDelete, true, root.path);
  Drop(std::exchange(root.folder, kNoFolder));
}

void Watcher::CheckPath(const std::string& path) const {
  VEXLO_CHECK(!IsNormalised(path), ERR_BAD_PARAMETER,
              "not an absolute, normalised path, path=" + path);
  const Fd fd = options_.takes_missing_roots ? Fd() : OpenDirectory(path);
  VEXLO_CHECK(!fd && !options_.takes_missing_roots, ERR_SYSTEM,
              "cannot be watched as a folder, path=" + path + ", reason=" + strerror(errno));
}

// Whether a walk from the root comes to the path by its name; it follows no link.
bool Watcher::Covers(const std::string& root, const std::string& path) const {
  if (!IsBelow(path, root)) {
    return false;
  }
  const std::string way = path.substr(root.size() == 1 ? 0 : root.size()) + "/";
  return std::none_of(
      options_.ignored_names.begin(), options_.ignored_names.end(),
      [&](const std::string& name) { return way.find("/" + name + "/") != std::string::npos; });
}

bool Watcher::IsCovered(const std::string& path) const {
  return std::any_of(roots_.begin(), roots_.end(), [&](const Root& root) {
    return Covers(root.path, path) && !HasLinkBetween(root.path, path);
  });
}

bool Watcher::CoversARoot(const std::string& path) const {
  return std::any_of(roots_.begin(), roots_.end(),
                     [&](const Root& root) { return Covers(path, root.path); });
}

bool Watcher::AddRoot(const std::string& path, TimePoint now) {
  CheckPath(path);
  const bool known = std::any_of(roots_.begin(), roots_.end(),
                                 [&](const Root& root) { return root.path == path; });
  if (known || CoversARoot(path)) {
    return false;
  }
  now_ = now;
  roots_.push_back({path, kNoFolder, IsCovered(path)});
  if (!roots_.back().covered) {
    Walk({{kNoFolder, path, true}}, {});
    roots_.back().folder = tree_.Find(kNoFolder, path);
  }
  LogChangedState();
  return true;
}

bool Watcher::RemoveRoot(const std::string& path) {
  const auto found = std::find_if(roots_.begin(), roots_.end(),
                                  [&](const Root& root) { return root.path == path; });
  if (found == roots_.end() || (!found->covered && CoversARoot(path))) {
    return false;
  }
  const FolderId folder = found->folder;
  roots_.erase(found);
  if (folder != kNoFolder) {
    Drop(folder);
  }
  LogChangedState();
  return true;
}

void Watcher::CheckRoots(TimePoint now) {
  now_ = now;
  CheckMounts();
  CheckRoots();
  LogChangedState();
}

// A folder that something is mounted on, or no longer, is another one from then on, and no event
// says so: it is looked at from the innermost folder that is known on its way.
void Watcher::CheckMounts() {
  std::set<std::string> mounts = MountsNow();
  std::vector<std::string> changed;
  std::set_symmetric_difference(mounts.begin(), mounts.end(), mounts_.begin(), mounts_.end(),
                                std::back_inserter(changed));
  mounts_ = std::move(mounts);
  if (changed.empty()) {
    return;
  }
  for (const Root& root : roots_) {
    if (root.folder == kNoFolder) {
      continue;
    }
    // The table has no links in its paths, the root may.
    std::error_code error;
    std::string real = std::filesystem::canonical(root.path, error).string();
    real = error ? root.path : real;
    for (const std::string& mount : changed) {
      const std::string path = mount.substr(0, mount.find('\0'));
      if (IsBelow(path, real)) {
        FolderId folder = root.folder;
        size_t at = real.size() == 1 ? 0 : real.size();
        for (FolderId next = folder; next != kNoFolder && at < path.size();) {
          const size_t slash = std::min(path.find('/', at + 1), path.size());
          next = tree_.Find(folder, std::string_view(path).substr(at + 1, slash - at - 1));
          folder = next == kNoFolder ? folder : next;
          at = slash;
        }
        unsettled_.insert(folder);
      }
    }
  }
}

void Watcher::CheckRoots() {
  for (Root& root : roots_) {
    if (root.folder != kNoFolder && !Stands(root)) {
      RootGone(root);
    }
    if (root.folder == kNoFolder && !root.covered) {
      Walk({{kNoFolder, root.path, true}}, {});
      root.folder = tree_.Find(kNoFolder, root.path);
      if (root.folder != kNoFolder) {
        Emit(kMaskCreate, true, root.path);
      }
    }
  }
}

// A folder that is written to all the time is looked at once in a while.
void Watcher::TakeHints() {
  if (hints_ && unwatched_.empty()) {
    hints_.reset();  // The mark comes to much for a busy file system.
  }
  if (hints_) {
    for (const FolderId folder : hints_->Take()) {
      if (hinted_.empty()) {
        next_hinted_ = now_ + kHintWait;
      }
      hinted_.insert(folder);
    }
  }
  if (!hinted_.empty() && now_ >= next_hinted_) {
    rescan_.insert(rescan_.end(), hinted_.begin(), hinted_.end());
    hinted_.clear();
  }
}

void Watcher::Rescan() {
  for (size_t i = 0; i < kRescanAtOnce && !rescan_.empty(); ++i) {
    const FolderId folder = rescan_.back();
    rescan_.pop_back();
    const bool unreadable = unreadable_.count(folder) != 0;
    if (unreadable || unwatched_.count(folder) != 0) {
      Walk({{tree_.Parent(folder), tree_.Name(folder), true}}, {.deep = unreadable});
    }
  }
}

WatchState Watcher::State() const {
  WatchState state;
  state.watched = tree_.Watched();
  state.unwatched = unwatched_.size();
  state.unreadable = unreadable_.size();
  for (const Root& root : roots_) {
    if (root.folder == kNoFolder && !root.covered) {
      state.gone.push_back(root.path);
      state.text += root.path + " is gone; ";
    }
  }
  if (state.unwatched != 0) {
    std::string allowed = "?";
    std::ifstream(kWatchLimitFile) >> allowed;
    const size_t needed = state.watched + state.unwatched;
    state.text +=
        Count(state.unwatched, "folder") + " of " + std::to_string(needed) +
        " not watched, but looked at " +
        (hints_ && hints_->size() == state.unwatched ? "after changes in them and " : "") +
        "every " + std::to_string(options_.rescan_interval.count() / 1000) +
        " s: " + std::to_string(needed) + " watches are needed, " +
        (options_.max_watches != 0
             ? std::to_string(options_.max_watches) + " allowed to this watcher and "
             : std::string()) +
        allowed +
        " allowed by the system (fs.inotify.max_user_watches, which all programs of the "
        "user share); ";
  }
  if (state.unreadable != 0) {
    state.text += Count(state.unreadable, "folder") + " cannot be read; ";
  }
  if (!state.text.empty()) {
    state.text.resize(state.text.size() - 2);
  }
  state.live = state.gone.empty() && state.unwatched == 0;
  return state;
}

void Watcher::LogChangedState() {
  std::string now = unwatched_.empty() ? "live" : "degraded";
  for (const Root& root : roots_) {
    now += root.folder == kNoFolder && !root.covered ? " -" : " +";
  }
  if (logged_ == now) {
    return;
  }
  const bool first = logged_.empty();
  logged_ = now;
  const std::string text = State().text;
  if (!first || !text.empty()) {
    LogLine(VEXLO_SOURCE, __LINE__, text.empty() ? "every folder is watched" : text);
  }
}

// --- Reporting

bool Watcher::IsHidden(const std::string& path, std::string_view name) const {
  return IsAmong(options_.ignored_names, name) || ignored_.count(path) != 0;
}

Watcher::Standing Watcher::WhatStands(FolderId parent, const std::string& name) const {
  const Fd fd = tree_.Contains(parent) ? OpenFolder(parent) : Fd();
  if (!fd) {
    return Standing::kUnreachable;
  }
  struct stat attributes = {};
  if (fstatat(fd.Get(), name.c_str(), &attributes, AT_SYMLINK_NOFOLLOW) != 0) {
    return Standing::kNothing;
  }
  return S_ISDIR(attributes.st_mode) ? Standing::kFolder : Standing::kFile;
}

std::string Watcher::PathOf(FolderId parent, std::string_view name) const {
  if (parent == kNoFolder) {
    return std::string(name);
  }
  std::string path = tree_.Path(parent);
  if (path.size() > 1) {
    path += '/';
  }
  return path.append(name);
}

void Watcher::Emit(QueueMask mask, bool is_dir, std::string path, std::string path_old) {
  sink_({mask, is_dir, std::move(path), std::move(path_old)});
}

}  // namespace vexlo::watch
