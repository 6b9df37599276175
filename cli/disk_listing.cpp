#include "cli/disk_listing.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <utility>

#include "common/string.h"
#include "watch/directory.h"

namespace vexlo::cli {
namespace {

constexpr size_t kBufferBytes = 65536;

// Drops all but the least `count` keys; whether there were more.
bool KeepLeast(std::vector<std::string>& keys, size_t count) {
  if (keys.size() <= count) {
    return false;
  }
  const auto end = keys.begin() + static_cast<ptrdiff_t>(count);
  std::nth_element(keys.begin(), end, keys.end());
  keys.erase(end, keys.end());
  return true;
}

}  // namespace

DiskListing::DiskListing(const AuditScope& scope, const std::string& root, OnUnknown on_unknown,
                         size_t portion)
    : scope_(scope), on_unknown_(std::move(on_unknown)), portion_(portion), buffer_(kBufferBytes) {
  if (root != scope.SharePath() && !scope.LeadsTo(root)) {
    return;
  }
  Frame above;
  above.path = Dirname(root);
  above.keys = {Basename(root), Basename(root) + "/"};
  above.is_complete = true;
  frames_.push_back(std::move(above));
}

std::optional<DiskFile> DiskListing::Next() {
  while (!frames_.empty()) {
    Frame& frame = frames_.back();
    if (frame.next == frame.keys.size()) {
      if (frame.is_complete) {
        frames_.pop_back();
      } else {
        Fill(frame);
      }
      continue;
    }
    frame.last = std::move(frame.keys[frame.next++]);
    std::string path = frame.path + "/" + frame.last;
    if (path.ends_with('/')) {
      path.pop_back();
      Enter(path);
    } else if (auto file = Look(path)) {
      return file;
    }
  }
  return std::nullopt;
}

bool DiskListing::IsUnknown(const std::string& path) const {
  if (unknown_.empty()) {
    return false;
  }
  for (size_t end = path.size(); end != std::string::npos && end > 0;
       end = path.rfind('/', end - 1)) {
    if (unknown_.contains(path.substr(0, end))) {
      return true;
    }
  }
  return false;
}

std::optional<DiskFile> DiskListing::Look(const std::string& path) {
  // A path that is too long for the system has no document.
  if (path.size() >= PATH_MAX) {
    return std::nullopt;
  }
  DiskFile file{path, {}};
  if (lstat(path.c_str(), &file.info) != 0) {
    if (const int error = errno; !watch::MeansNoDirectory(error)) {
      AddUnknown(path, error);
    }
    return std::nullopt;
  }
  const bool is_wanted = S_ISDIR(file.info.st_mode)   ? scope_.IsFolderWanted(path)
                         : S_ISLNK(file.info.st_mode) ? false
                                                      : scope_.IsFileWanted(path);
  return is_wanted ? std::optional(std::move(file)) : std::nullopt;
}

void DiskListing::Enter(const std::string& path) {
  if (path.size() + 1 >= PATH_MAX || !scope_.MayEnter(path)) {
    return;
  }
  // Those above are read anew when their turn comes, where they hold much. The first one's two keys
  // cannot be.
  size_t held = 0;
  for (const Frame& frame : frames_) {
    held += frame.keys.size() - frame.next;
  }
  for (size_t i = 1; i < frames_.size() && held > 2 * portion_; ++i) {
    Frame& frame = frames_[i];
    held -= frame.keys.size() - frame.next;
    frame.keys = {};
    frame.next = 0;
    frame.is_complete = false;
  }
  Frame below;
  below.path = path;
  frames_.push_back(std::move(below));
}

void DiskListing::Fill(Frame& frame) {
  frame.keys.clear();
  frame.next = 0;
  frame.is_complete = true;
  const auto add = [&](std::string key) {
    if (key > frame.last) {
      frame.keys.push_back(std::move(key));
      if (frame.keys.size() >= 2 * portion_ && KeepLeast(frame.keys, portion_)) {
        frame.is_complete = false;
      }
    }
  };
  const watch::Fd folder = watch::OpenDirectory(frame.path);
  const bool is_read = folder && watch::ReadDirectory(folder.Get(), buffer_,
                                                      [&](std::string_view name, unsigned type) {
                                                        if (type == DT_LNK) {
                                                          return;
                                                        }
                                                        if (type == DT_DIR || type == DT_UNKNOWN) {
                                                          add(std::string(name) + "/");
                                                        }
                                                        add(std::string(name));
                                                      });
  if (!is_read) {
    if (const int error = errno; !watch::MeansNoDirectory(error)) {
      AddUnknown(frame.path, error);
    }
    frame.keys.clear();
    frame.is_complete = true;
    return;
  }
  if (KeepLeast(frame.keys, portion_)) {
    frame.is_complete = false;
  }
  std::sort(frame.keys.begin(), frame.keys.end());
}

void DiskListing::AddUnknown(const std::string& path, int error) {
  if (unknown_.insert(path).second) {
    on_unknown_(path, error);
  }
}

}  // namespace vexlo::cli
