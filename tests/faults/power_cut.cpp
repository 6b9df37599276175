#include "faults/power_cut.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdarg>
#include <filesystem>
#include <mutex>
#include <random>
#include <utility>

#include "support/faults.h"
#include "support/temp_folder.h"

namespace {

namespace fs = std::filesystem;
using Kind = DiskOp::Kind;

std::mutex mutex;
PowerCut* current = nullptr;

bool IsKept(const std::string& path) { return !path.ends_with("-shm"); }
std::string FolderOf(const std::string& path) { return path.substr(0, path.rfind('/')); }

std::string PathOf(int fd) {
  char path[4096];
  const ssize_t length = readlink(("/proc/self/fd/" + std::to_string(fd)).c_str(), path, 4096);
  return {path, static_cast<size_t>(std::max<ssize_t>(length, 0))};
}

// Which of the operations survive; cuts the last write of kSome.
std::vector<bool> Surviving(std::vector<DiskOp>& ops, Survives survives, uint32_t seed) {
  std::vector<bool> is_there(ops.size(), survives == Survives::kAll);
  std::set<int> synced;
  std::set<std::string> synced_folders;
  std::minstd_rand random(seed);
  bool is_torn = false;
  for (size_t i = ops.size(); i-- > 0 && survives != Survives::kAll;) {
    DiskOp& op = ops[i];
    const std::string folder = FolderOf(op.path);
    if (op.kind == Kind::kSync) {
      synced.insert(op.file);
    } else if (op.kind == Kind::kSyncFolder) {
      synced_folders.insert(op.path);
    } else if (op.kind == Kind::kWrite || op.kind == Kind::kResize) {
      is_there[i] = synced.contains(op.file);
      if (!is_there[i] && survives == Survives::kSome && random() % 2 == 0) {
        is_there[i] = true;
        const size_t end = (op.at + random() % (op.bytes.size() + 1)) / 512 * 512;
        op.bytes.resize(std::exchange(is_torn, true) ? op.bytes.size()
                                                     : std::max(end, op.at) - op.at);
      }
    } else if (synced_folders.contains(folder) ||
               (op.kind == Kind::kRename && synced_folders.contains(FolderOf(op.path_old))) ||
               (survives == Survives::kSome && random() % 4 == 0)) {
      is_there[i] = true;
      synced_folders.insert(folder);  // All before it in its folder have survived, too.
    }
  }
  return is_there;
}

void Replay(const DiskOp& op, std::map<int, std::string>& contents,
            std::map<std::string, int>& names, std::set<std::string>& folders) {
  switch (op.kind) {
    case Kind::kWrite: {
      std::string& content = contents[op.file];
      content.resize(std::max(content.size(), op.at + op.bytes.size()));
      content.replace(op.at, op.bytes.size(), op.bytes);
      break;
    }
    case Kind::kResize:
      contents[op.file].resize(op.at);
      break;
    case Kind::kMake:
    case Kind::kRename:
      names[op.path] = op.file;
      names.erase(op.path_old);
      break;
    case Kind::kMakeFolder:
      folders.insert(op.path);
      break;
    case Kind::kRemove:
      names.erase(op.path);
      folders.erase(op.path);
      break;
    case Kind::kSync:
    case Kind::kSyncFolder:
      break;
  }
}

}  // namespace

// What the functions below tell; with the mutex held, and `current` set.
struct Recorder {
  static bool Knows(const std::string& path) {
    return path.starts_with(current->folder_ + "/") && IsKept(path);
  }
  static void Add(DiskOp op) { current->ops_.push_back(std::move(op)); }

  static void Opened(int fd, int flags) {
    const std::string path = PathOf(fd);
    if (!Knows(path) || (flags & (O_CREAT | O_TRUNC)) == 0) {
      return;
    }
    const int next = static_cast<int>(current->before_.size() + current->ops_.size());
    const auto [file, is_new] = current->files_.try_emplace(path, next);
    Add({is_new ? Kind::kMake : Kind::kResize, file->second, path});
    if (!is_new && (flags & O_TRUNC) == 0) {
      current->ops_.pop_back();
    }
  }
  // Of a file that has no name any more nothing is left.
  static void Changed(int fd, Kind kind, off_t at, std::string bytes = "") {
    const std::string path = PathOf(fd);
    if (const auto file = current->files_.find(path); file != current->files_.end()) {
      Add({kind, file->second, path, "", static_cast<size_t>(at), std::move(bytes)});
    } else if (kind == Kind::kSync && fs::is_directory(path)) {
      Add({Kind::kSyncFolder, 0, path});
    }
  }
  static void Wrote(int fd, off_t at, const void* data, ssize_t size) {
    Changed(fd, Kind::kWrite, at,
            std::string(static_cast<const char*>(data), static_cast<size_t>(size)));
  }
  static void Renamed(const std::string& from, const std::string& to) {
    if (current->files_.contains(from)) {
      const int file = current->files_.extract(from).mapped();
      current->files_[to] = file;
      Add({Kind::kRename, file, to, from});
    }
  }
  static void MadeFolder(const std::string& path) {
    if (Knows(path)) {
      Add({Kind::kMakeFolder, 0, path});
    }
  }
  static void Removed(const std::string& path) {
    if (Knows(path)) {
      current->files_.erase(path);
      Add({Kind::kRemove, 0, path});
    }
  }
};

DiskState ReadDisk(const std::string& folder) {
  DiskState state;
  for (const auto& entry : fs::recursive_directory_iterator(folder)) {
    if (entry.is_directory()) {
      state.folders.insert(entry.path());
    } else if (entry.is_regular_file() && IsKept(entry.path())) {
      state.files[entry.path()] = ReadText(entry.path());
    }
  }
  return state;
}

void WriteDisk(const std::string& folder, const DiskState& state) {
  for (const auto& entry : fs::directory_iterator(folder)) {
    fs::remove_all(entry);
  }
  for (const std::string& each : state.folders) {
    fs::create_directory(each);
  }
  for (const auto& [path, content] : state.files) {
    WriteText(path, content);
  }
}

PowerCut::PowerCut(std::string folder) : folder_(std::move(folder)) {
  const DiskState state = ReadDisk(folder_);
  for (const std::string& path : state.folders) {
    before_.push_back({Kind::kMakeFolder, 0, path});
  }
  for (const auto& [path, content] : state.files) {
    const int file = static_cast<int>(before_.size());
    files_[path] = file;
    before_.push_back({Kind::kMake, file, path});
    before_.push_back({Kind::kWrite, file, path, "", 0, content});
  }
  const std::lock_guard lock(mutex);
  current = this;
}

void PowerCut::Stop() {
  const std::lock_guard lock(mutex);
  current = nullptr;
}

void PowerCut::Note(int number) {
  const std::lock_guard lock(mutex);
  notes_[ops_.size()] = number;
}

int PowerCut::NoteAt(size_t count) const {
  const auto behind = notes_.upper_bound(count);
  return behind == notes_.begin() ? 0 : std::prev(behind)->second;
}

std::string PowerCut::PathAt(size_t count) const { return count == 0 ? "" : ops_[count - 1].path; }

DiskState PowerCut::After(size_t count, Survives survives, uint32_t seed) const {
  std::vector<DiskOp> ops(ops_.begin(), ops_.begin() + static_cast<ptrdiff_t>(count));
  const std::vector<bool> is_there = Surviving(ops, survives, seed);
  std::map<int, std::string> contents;
  std::map<std::string, int> names;
  DiskState state;
  std::set<std::string> folders;
  for (const DiskOp& op : before_) {
    Replay(op, contents, names, folders);
  }
  for (size_t i = 0; i < count; ++i) {
    if (is_there[i]) {
      Replay(ops[i], contents, names, folders);
    }
  }
  // From the top down: without its own entry, nothing in a folder can be reached.
  const auto is_reached = [&](const std::string& path) {
    return FolderOf(path) == folder_ || state.folders.contains(FolderOf(path));
  };
  std::copy_if(folders.begin(), folders.end(), std::inserter(state.folders, state.folders.end()),
               is_reached);
  for (const auto& [path, file] : names) {
    if (is_reached(path)) {
      state.files[path] = contents[file];
    }
  }
  return state;
}

// --- The C library's functions

// NOLINTBEGIN(bugprone-macro-parentheses): these are types.
// A function that does `after` with its `result` where it has not failed.
#define RECORDED(type, name, parameters, arguments, after)          \
  INTERPOSED type name parameters {                                 \
    static const auto real = REAL_FUNCTION(type, name, parameters); \
    const std::lock_guard lock(mutex);                              \
    const type result = real arguments;                             \
    if (result >= 0 && current != nullptr) {                        \
      after;                                                        \
    }                                                               \
    return result;                                                  \
  }
#define OPEN(name)                                                              \
  INTERPOSED int name(const char* path, int flags, ...) {                       \
    static const auto real = REAL_FUNCTION(int, name, (const char*, int, ...)); \
    va_list more;                                                               \
    va_start(more, flags);                                                      \
    const auto mode = va_arg(more, mode_t);                                     \
    va_end(more);                                                               \
    const std::lock_guard lock(mutex);                                          \
    const int fd = real(path, flags, mode);                                     \
    if (fd >= 0 && current != nullptr) {                                        \
      Recorder::Opened(fd, flags);                                              \
    }                                                                           \
    return fd;                                                                  \
  }
// NOLINTEND(bugprone-macro-parentheses)
OPEN(open)
OPEN(open64)
RECORDED(int, mkostemp, (char* path, int flags), (path, flags), Recorder::Opened(result, O_CREAT))
// The offset behind what was written tells where, with O_APPEND too.
RECORDED(ssize_t, write, (int fd, const void* data, size_t size), (fd, data, size),
         Recorder::Wrote(fd, lseek(fd, 0, SEEK_CUR) - result, data, result))
RECORDED(ssize_t, pwrite64, (int fd, const void* data, size_t size, off64_t at),
         (fd, data, size, at), Recorder::Wrote(fd, at, data, result))
RECORDED(int, ftruncate, (int fd, off_t size) noexcept, (fd, size),
         Recorder::Changed(fd, Kind::kResize, size))
RECORDED(int, ftruncate64, (int fd, off64_t size) noexcept, (fd, size),
         Recorder::Changed(fd, Kind::kResize, size))
RECORDED(int, rename, (const char* from, const char* to) noexcept, (from, to),
         Recorder::Renamed(from, to))
RECORDED(int, unlink, (const char* path) noexcept, (path), Recorder::Removed(path))
RECORDED(int, rmdir, (const char* path) noexcept, (path), Recorder::Removed(path))
RECORDED(int, mkdir, (const char* path, mode_t mode) noexcept, (path, mode),
         Recorder::MadeFolder(path))

INTERPOSED int fsync(int fd) {
  const std::lock_guard lock(mutex);
  if (current != nullptr) {
    Recorder::Changed(fd, Kind::kSync, 0);
  }
  return 0;
}
INTERPOSED int fdatasync(int fd) { return fsync(fd); }
