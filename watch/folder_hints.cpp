#include "watch/folder_hints.h"

#include <fcntl.h>
#include <sys/fanotify.h>
#include <sys/vfs.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstddef>
#include <cstring>

namespace vexlo::watch {
namespace {

constexpr uint64_t kChanges = FAN_CREATE | FAN_DELETE | FAN_MOVED_FROM | FAN_MOVED_TO |
                              FAN_CLOSE_WRITE | FAN_ATTRIB | FAN_ONDIR;
constexpr size_t kEventBytes = size_t{1} << 14;

// Where an event's information has the file system's id, and right behind it the handle.
constexpr size_t kIdAt = offsetof(fanotify_event_info_fid, fsid);
constexpr size_t kHandleAt = offsetof(fanotify_event_info_fid, handle);
static_assert(kHandleAt == kIdAt + sizeof(fsid_t));

// As an event has it, id and handle. Empty where the file system gives out none.
std::string HandleOf(int fd) {
  alignas(file_handle) std::array<char, sizeof(file_handle) + MAX_HANDLE_SZ> buffer = {};
  auto* const handle = reinterpret_cast<file_handle*>(buffer.data());
  handle->handle_bytes = MAX_HANDLE_SZ;
  int mount = 0;
  struct statfs file_system {};
  if (name_to_handle_at(fd, "", handle, &mount, AT_EMPTY_PATH) != 0 ||
      fstatfs(fd, &file_system) != 0) {
    return "";
  }
  std::string bytes(reinterpret_cast<const char*>(&file_system.f_fsid), sizeof(fsid_t));
  return bytes.append(buffer.data(), sizeof(file_handle) + handle->handle_bytes);
}

}  // namespace

FolderHints::FolderHints()
    : fd_(fanotify_init(FAN_CLASS_NOTIF | FAN_REPORT_DIR_FID | FAN_CLOEXEC | FAN_NONBLOCK, 0)) {}

bool FolderHints::Add(FolderId folder, int fd) {
  Remove(folder);
  // Marking what is marked changes nothing, and a file system that was mounted anew has no mark.
  if (!fd_ || fanotify_mark(fd_.Get(), FAN_MARK_ADD | FAN_MARK_FILESYSTEM, kChanges, fd,
                            /*pathname=*/nullptr) != 0) {
    return false;
  }
  std::string handle = HandleOf(fd);
  if (handle.empty() || !folders_.try_emplace(handle, folder).second) {
    return false;  // Two ids for one folder: it is mounted in two places.
  }
  handles_.emplace(folder, std::move(handle));
  return true;
}

void FolderHints::Remove(FolderId folder) {
  if (const auto handle = handles_.find(folder); handle != handles_.end()) {
    folders_.erase(handle->second);
    handles_.erase(handle);
  }
}

std::vector<FolderId> FolderHints::Take() {
  std::vector<FolderId> changed;
  alignas(fanotify_event_metadata) std::array<char, kEventBytes> events;
  for (;;) {
    const ssize_t length = read(fd_.Get(), events.data(), events.size());
    if (length > 0) {
      TakeEvents({events.data(), static_cast<size_t>(length)}, &changed);
    } else if (length == 0 || errno != EINTR) {
      return changed;
    }
  }
}

// Nothing in the buffer but the first event is aligned.
void FolderHints::TakeEvents(std::string_view events, std::vector<FolderId>* changed) const {
  fanotify_event_metadata event = {};
  while (events.size() >= sizeof(event)) {
    memcpy(&event, events.data(), sizeof(event));
    const std::string_view info =
        events.substr(0, event.event_len)
            .substr(std::min<size_t>(event.metadata_len, event.event_len));
    file_handle header = {};
    if (info.size() >= kHandleAt + sizeof(header)) {
      memcpy(&header, info.data() + kHandleAt, sizeof(header));
      const auto folder = folders_.find(
          std::string(info.substr(kIdAt, sizeof(fsid_t) + sizeof(header) + header.handle_bytes)));
      if (folder != folders_.end()) {
        changed->push_back(folder->second);
      }
    }
    events.remove_prefix(std::clamp<size_t>(event.event_len, sizeof(event), events.size()));
  }
}

}  // namespace vexlo::watch
