#include "daemons/fileindexd/disk_scan.h"

#include <dirent.h>
#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <utility>

#include "common/string.h"
#include "daemons/fileindexd/stamp.h"
#include "fileindex/util/file_type.h"
#include "fileindex/util/path_policy.h"
#include "watch/directory.h"

namespace vexlo::fileindexd {
namespace {

constexpr size_t kBufferBytes = 65536;
constexpr size_t kNamesOfBatch = 256;
constexpr size_t kMostBatches = 32;
constexpr size_t kMostAhead = 64;  // Each keeps a descriptor open.
constexpr size_t kMostWaiting = 200000;
constexpr int kOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;

// What the name of a batch is expected to be.
constexpr char kFile = 'f';
constexpr char kFolder = 'd';
constexpr char kFolderWithContent = 'D';

daemon::EntryFacts FactsOf(const struct stat& info, bool content) {
  const Stamp stamp = StampOf(info, content, timespec{});
  return {stamp.size, stamp.mtime_ns, stamp.ctime_ns, content};
}

}  // namespace

struct DiskScan::Folder {
  std::string path;
  daemon::UniqueFd fd;
  dev_t device = 0;
  bool is_covered = false;
  std::optional<ContentByType> contents;
  int error = 0;
  // Guarded by mutex_ once batches are handed over:
  daemon::FolderDigest digest;
  bool is_whole = true;
  unsigned batches = 0;
};

// Names of one folder, each behind one of these bytes and before a NUL.
struct DiskScan::Batch {
  FolderPtr folder;
  std::string names = {};
  size_t count = 0;

  void Add(char expected, std::string_view name) {
    names += expected;
    names.append(name);
    names += '\0';
    ++count;
  }
};

// An opened folder, and the names of those in it with "/" behind them, which are in order.
struct DiskScan::Level {
  FolderPtr folder;
  std::vector<std::string> below = {};
  size_t next = 0;
};

DiskScan::DiskScan(std::string root, WalkRules rules, ContentRules content, uint64_t seed,
                   std::function<void()> check)
    : root_(std::move(root)),
      rules_(std::move(rules)),
      content_(std::move(content)),
      seed_(seed),
      check_(std::move(check)),
      buffer_(kBufferBytes),
      thread_([this] { Work(); }) {}

DiskScan::~DiskScan() {
  {
    const kavo::local::MutexLock lock(mutex_);
    ending_ = true;
    batches_.clear();
  }
  has_batch_.NotifyOne();
  thread_.join();
}

std::optional<ScannedFolder> DiskScan::Next() {
  for (;;) {
    if (ahead_.size() < kMostAhead && WalkOn()) {
      continue;
    }
    if (ahead_.empty()) {
      return std::nullopt;
    }
    ScannedFolder folder = Finished(*ahead_.front());
    ahead_.pop_front();
    return folder;
  }
}

// The folder once all in it is looked at, which may be done here.
ScannedFolder DiskScan::Finished(const Folder& folder) {
  for (;;) {
    kavo::local::MutexLock lock(mutex_);
    is_done_.Wait(lock,
                  [&]() KAVO_REQUIRES(mutex_) { return folder.batches == 0 || !batches_.empty(); });
    if (folder.batches == 0) {
      return {folder.path + "/", folder.digest, folder.is_whole, folder.error};
    }
    const Batch batch = TakeBatch();
    lock.Unlock();
    LookAt(batch);
  }
}

void DiskScan::OpenRoot() {
  if ((!rules_.covers(root_) && !rules_.leads(root_)) || !rules_.allows(root_)) {
    return;
  }
  const std::string above = Dirname(root_);
  const daemon::UniqueFd parent(
      open(above.empty() ? "/" : above.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  Open(parent.Get(), Basename(root_), root_);
}

// False when nothing is left to be opened.
bool DiskScan::WalkOn() {
  if (!std::exchange(has_begun_, true)) {
    OpenRoot();
    return true;
  }
  while (!levels_.empty()) {
    Level& level = levels_.back();
    if (level.next == level.below.size()) {
      levels_.pop_back();
      continue;
    }
    std::string name = std::move(level.below[level.next++]);
    --waiting_below_;
    name.pop_back();
    Open(level.folder->fd.Get(), name, level.folder->path + "/" + name);
    return true;
  }
  return false;
}

void DiskScan::Open(int parent, const std::string& name, std::string path) {
  auto folder = std::make_shared<Folder>();
  folder->path = std::move(path);
  folder->fd = daemon::UniqueFd(openat(parent, name.c_str(), kOpenFlags));
  struct stat info {};
  if (folder->fd.Get() < 0 || fstat(folder->fd.Get(), &info) != 0) {
    folder->error = errno;
    if (!MeansGone(folder->error)) {
      ahead_.push_back(std::move(folder));
    }
    return;
  }
  folder->device = info.st_dev;
  folder->is_covered = rules_.covers(folder->path);
  folder->contents = content_.in(folder->path);
  // Where only some of what is in it counts, or each by settings of its own, that is looked up one
  // by one.
  folder->is_whole = folder->is_covered && folder->contents;
  ahead_.push_back(folder);
  Read(folder);
}

void DiskScan::Read(const FolderPtr& folder) {
  Level level = {folder};
  Batch batch = {folder};
  const bool is_read =
      watch::ReadDirectory(folder->fd.Get(), buffer_, [&](std::string_view name, unsigned type) {
        Meet(folder, name, type, &level, &batch);
        if (batch.count == kNamesOfBatch) {
          Hand(std::exchange(batch, {folder}));
        }
      });
  if (!is_read) {
    folder->error = errno;
    return;
  }
  Hand(std::move(batch));
  std::sort(level.below.begin(), level.below.end());
  level.below.erase(std::unique(level.below.begin(), level.below.end()), level.below.end());
  waiting_below_ += level.below.size();
  levels_.push_back(std::move(level));
  if (waiting_below_ > kMostWaiting) {
    has_given_up_ = true;
    levels_.clear();
  }
}

void DiskScan::Meet(const FolderPtr& folder, std::string_view name, unsigned type, Level* level,
                    Batch* batch) {
  name_.assign(name);
  if (type == DT_LNK || fileindex::IsSystemPreservedFileName(name_) ||
      folder->path.size() + 1 + name.size() >= PATH_MAX) {
    return;
  }
  if (type == DT_UNKNOWN) {
    struct stat info {};
    const bool is_known = fstatat(folder->fd.Get(), name_.c_str(), &info, AT_SYMLINK_NOFOLLOW) == 0;
    type = is_known && S_ISDIR(info.st_mode) ? DT_DIR : DT_REG;
  }
  if (type == DT_DIR) {
    MeetFolder(folder, folder->path + "/" + name_, level, batch);
  } else if (folder->contents &&
             (!HasRefusableName(name_) || rules_.allows(folder->path + "/" + name_))) {
    batch->Add(kFile, name);
  }
}

void DiskScan::MeetFolder(const FolderPtr& folder, std::string path, Level* level, Batch* batch) {
  const bool is_covered = folder->is_covered || rules_.covers(path);
  if (level->below.size() > kMostWaiting || !(is_covered || rules_.leads(path)) ||
      !rules_.allows(path)) {
    return;
  }
  if (is_covered && folder->contents) {
    batch->Add(content_.wants(path) ? kFolderWithContent : kFolder, name_);
  }
  if (path.size() + 1 < PATH_MAX) {
    level->below.push_back(name_ + "/");
  }
}

// To whoever has time.
void DiskScan::Hand(Batch batch) {
  check_();
  if (batch.count == 0) {
    return;
  }
  {
    const kavo::local::MutexLock lock(mutex_);
    ++batch.folder->batches;
    if (batches_.size() < kMostBatches) {
      batches_.push_back(std::move(batch));
      if (batches_.size() == 1) {
        has_batch_.NotifyOne();
      }
      return;
    }
  }
  LookAt(batch);
}

DiskScan::Batch DiskScan::TakeBatch() {
  Batch batch = std::move(batches_.front());
  batches_.pop_front();
  return batch;
}

void DiskScan::LookAt(const Batch& batch) {
  Folder& folder = *batch.folder;
  daemon::FolderDigest digest;
  bool is_whole = true;
  std::string name;
  for (std::string_view rest = batch.names; !rest.empty(); rest.remove_prefix(name.size() + 2)) {
    name.assign(rest.substr(1, rest.find('\0') - 1));
    struct stat info {};
    if (fstatat(folder.fd.Get(), name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) {
      is_whole = is_whole && MeansGone(errno);
      continue;
    }
    if (S_ISLNK(info.st_mode)) {
      continue;
    }
    const bool is_folder = S_ISDIR(info.st_mode);
    // Whether what is mounted here belongs to the index is a question of its own.
    if (is_folder != (rest[0] != kFile) || (!is_folder && info.st_dev != folder.device)) {
      is_whole = false;
      continue;
    }
    const bool content =
        is_folder
            ? rest[0] == kFolderWithContent
            : folder.contents->at(static_cast<size_t>(fileindex::GetFileTypeByFullPath(name)));
    digest.Add(daemon::EntryHash(seed_, name, FactsOf(info, content)));
  }
  const kavo::local::MutexLock lock(mutex_);
  folder.digest.Add(digest);
  folder.is_whole = folder.is_whole && is_whole;
  if (--folder.batches == 0) {
    is_done_.NotifyOne();
  }
}

void DiskScan::Work() {
  for (;;) {
    kavo::local::MutexLock lock(mutex_);
    has_batch_.Wait(lock, [this]() KAVO_REQUIRES(mutex_) { return ending_ || !batches_.empty(); });
    if (ending_) {
      return;
    }
    const Batch batch = TakeBatch();
    lock.Unlock();
    LookAt(batch);
  }
}

}  // namespace vexlo::fileindexd
