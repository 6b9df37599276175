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

std::recursive_mutex mutex;
PowerCut* current = nullptr;

bool IsKept(const std::string& path) { return !path.ends_with("-shm"); }
std::string FolderOf(const std::string& path) { return path.substr(0, path.rfind('/')); }

std::string PathOf(int fd) {
  char path[4096];
  const ssize_t length = readlink(("/proc/self/fd/" + std::to_string(fd)).c_str(), path, 4096);
  return {path, static_cast<size_t>(std::max<ssize_t>(length, 0))};
}

bool IsOfFolder(Kind kind) {
  return kind == Kind::kMake || kind == Kind::kMakeFolder || kind == Kind::kRename ||
         kind == Kind::kRemove;
}

void Put(std::string& content, const DiskOp& op) {
  if (op.kind == Kind::kResize) {
    content.resize(op.at);
    return;
  }
  content.resize(std::max(content.size(), op.at + op.bytes.size()));
  content.replace(op.at, op.bytes.size(), op.bytes);
}

}  // namespace

// What the functions below tell; with the mutex held, and `current` set.
struct Recorder {
  static bool Knows(const std::string& path) {
    return current != nullptr && path.starts_with(current->folder_ + "/") && IsKept(path);
  }
  static int FileAt(const std::string& path) {
    const auto found = current->files_.find(path);
    return found == current->files_.end() ? -1 : found->second;
  }
  static void Add(DiskOp op) { current->ops_.push_back(std::move(op)); }

  static void Opened(int fd, int flags) {
    const std::string path = PathOf(fd);
    if (!Knows(path) || (flags & (O_CREAT | O_TRUNC)) == 0) {
      return;
    }
    if (FileAt(path) < 0) {
      const int file = static_cast<int>(current->contents_.size());
      current->contents_[file];
      current->files_[path] = file;
      Add({Kind::kMake, file, 0, "", path});
    } else if ((flags & O_TRUNC) != 0) {
      Add({Kind::kResize, FileAt(path)});
    }
  }
  // Of a file that has no name any more nothing is left.
  static void Changed(int fd, Kind kind, size_t at, std::string bytes = "") {
    const std::string path = PathOf(fd);
    if (Knows(path) && FileAt(path) >= 0) {
      Add({kind, FileAt(path), at, std::move(bytes)});
    } else if (kind == Kind::kSync && current != nullptr && fs::is_directory(path)) {
      Add({Kind::kSyncFolder, 0, 0, "", path});
    }
  }
  static void Wrote(int fd, off_t at, const void* data, ssize_t size) {
    Changed(fd, Kind::kWrite, static_cast<size_t>(at),
            std::string(static_cast<const char*>(data), static_cast<size_t>(size)));
  }
  static void Renamed(const std::string& from, const std::string& to) {
    if (Knows(from) && FileAt(from) >= 0) {
      const int file = current->files_.extract(from).mapped();
      current->files_[to] = file;
      Add({Kind::kRename, file, 0, "", to, from});
    }
  }
  static void Removed(const std::string& path) {
    if (Knows(path)) {
      current->files_.erase(path);
      Add({Kind::kRemove, 0, 0, "", path});
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

PowerCut::PowerCut(std::string folder) : folder_(std::move(folder)), before_(ReadDisk(folder_)) {
  for (const auto& [path, content] : before_.files) {
    const int file = static_cast<int>(contents_.size());
    contents_[file] = content;
    files_[path] = file;
  }
  const std::lock_guard lock(mutex);
  current = this;
}

PowerCut::~PowerCut() { Stop(); }

void PowerCut::Stop() {
  const std::lock_guard lock(mutex);
  current = nullptr;
}

void PowerCut::Note(int number) {
  const std::lock_guard lock(mutex);
  ops_.push_back({Kind::kNote, number});
}

namespace {

// Which of the operations survive; cuts the last write of kSome.
std::vector<bool> Surviving(std::vector<DiskOp>& ops, Survives survives, uint32_t seed) {
  const size_t count = ops.size();
  std::vector<bool> is_there(count, survives == Survives::kAll);
  std::set<int> synced;
  std::set<std::string> synced_folders;
  std::minstd_rand random(seed);
  std::map<std::string, bool> ends;  // Whether later entries of a folder are gone.
  size_t torn = count;
  for (size_t i = count; i-- > 0 && survives != Survives::kAll;) {
    const DiskOp& op = ops[i];
    if (op.kind == Kind::kSync) {
      synced.insert(op.file);
    } else if (op.kind == Kind::kSyncFolder) {
      synced_folders.insert(op.path);
    } else if (IsOfFolder(op.kind)) {
      // Backwards: once an entry has survived, all before it in its folder have.
      bool& survived = ends[FolderOf(op.path)];
      survived = survived || synced_folders.contains(FolderOf(op.path)) ||
                 (!op.path_old.empty() && synced_folders.contains(FolderOf(op.path_old))) ||
                 (survives == Survives::kSome && random() % 4 == 0);
      is_there[i] = survived;
    } else {
      const bool is_synced = synced.contains(op.file);
      is_there[i] = is_synced || (survives == Survives::kSome && random() % 2 == 0);
      torn = is_there[i] && !is_synced && torn == count ? i : torn;
    }
  }
  if (torn < count) {
    DiskOp& op = ops[torn];
    const size_t end = (op.at + random() % (op.bytes.size() + 1)) / 512 * 512;
    op.bytes.resize(op.kind == Kind::kWrite ? std::max(end, op.at) - op.at : 0);
  }
  return is_there;
}

}  // namespace

DiskState PowerCut::After(size_t count, Survives survives, uint32_t seed) const {
  std::vector<DiskOp> ops(ops_.begin(), ops_.begin() + static_cast<ptrdiff_t>(count));
  const std::vector<bool> is_there = Surviving(ops, survives, seed);
  std::map<int, std::string> contents = contents_;
  std::map<std::string, int> names;
  for (const auto& [path, content] : before_.files) {
    names[path] = static_cast<int>(names.size());
  }
  DiskState state;
  std::set<std::string> folders = before_.folders;
  for (size_t i = 0; i < count; ++i) {
    const DiskOp& op = ops[i];
    if (!is_there[i]) {
      continue;
    }
    if (op.kind == Kind::kWrite || op.kind == Kind::kResize) {
      Put(contents[op.file], op);
    } else if (op.kind == Kind::kMake || op.kind == Kind::kRename) {
      names[op.path] = op.file;
      names.erase(op.path_old);
    } else if (op.kind == Kind::kMakeFolder) {
      folders.insert(op.path);
    } else if (op.kind == Kind::kRemove) {
      names.erase(op.path);
      folders.erase(op.path);
    }
  }
  // From the top down: without its own entry, nothing in a folder can be reached.
  for (const std::string& folder : folders) {
    if (FolderOf(folder) == folder_ || state.folders.contains(FolderOf(folder))) {
      state.folders.insert(folder);
    }
  }
  for (const auto& [path, file] : names) {
    if (FolderOf(path) == folder_ || state.folders.contains(FolderOf(path))) {
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
         Recorder::Changed(fd, Kind::kResize, static_cast<size_t>(size)))
RECORDED(int, ftruncate64, (int fd, off64_t size) noexcept, (fd, size),
         Recorder::Changed(fd, Kind::kResize, static_cast<size_t>(size)))
RECORDED(int, rename, (const char* from, const char* to) noexcept, (from, to),
         Recorder::Renamed(from, to))
RECORDED(int, unlink, (const char* path) noexcept, (path), Recorder::Removed(path))
RECORDED(int, rmdir, (const char* path) noexcept, (path), Recorder::Removed(path))
RECORDED(int, mkdir, (const char* path, mode_t mode) noexcept, (path, mode),
         Recorder::Knows(path) ? Recorder::Add({Kind::kMakeFolder, 0, 0, "", path}) : void())

INTERPOSED int fsync(int fd) {
  const std::lock_guard lock(mutex);
  if (current != nullptr) {
    Recorder::Changed(fd, Kind::kSync, 0);
  }
  return 0;
}
INTERPOSED int fdatasync(int fd) { return fsync(fd); }
