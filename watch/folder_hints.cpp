#include "watch/folder_hints.h"

#include <fcntl.h>
#include <sys/fanotify.h>
#include <sys/vfs.h>

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstring>

namespace vexlo::watch {
namespace {

constexpr uint64_t kChanges = FAN_CREATE | FAN_DELETE | FAN_MOVED_FROM | FAN_MOVED_TO |
                              FAN_CLOSE_WRITE | FAN_ATTRIB | FAN_ONDIR;
constexpr size_t kEventBytes = size_t{1} << 14;

// The handle as events have it, without its length, which the bytes show.
std::string HandleBytes(const void* file_system, const file_handle& handle) {
  std::string bytes(static_cast<const char*>(file_system), sizeof(fsid_t));
  bytes.append(reinterpret_cast<const char*>(&handle.handle_type), sizeof(handle.handle_type));
  return bytes.append(reinterpret_cast<const char*>(handle.f_handle), handle.handle_bytes);
}

// Empty where the file system has none.
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
  return HandleBytes(&file_system.f_fsid, *handle);
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
      TakeEvents(events.data(), static_cast<size_t>(length), &changed);
    } else if (length == 0 || errno != EINTR) {
      return changed;
    }
  }
}

void FolderHints::TakeEvents(const char* events, size_t length,
                             std::vector<FolderId>* changed) const {
  for (size_t at = 0; at + sizeof(fanotify_event_metadata) <= length;) {
    const auto* event = reinterpret_cast<const fanotify_event_metadata*>(events + at);
    if (event->event_len >=
        event->metadata_len + sizeof(fanotify_event_info_fid) + sizeof(file_handle)) {
      const auto* info =
          reinterpret_cast<const fanotify_event_info_fid*>(events + at + event->metadata_len);
      const auto* handle = reinterpret_cast<const file_handle*>(
          reinterpret_cast<const char*>(info) + offsetof(fanotify_event_info_fid, handle));
      const auto folder = folders_.find(HandleBytes(&info->fsid, *handle));
      if (folder != folders_.end()) {
        changed->push_back(folder->second);
      }
    }
    at += event->event_len;
  }
}

}  // namespace vexlo::watch
