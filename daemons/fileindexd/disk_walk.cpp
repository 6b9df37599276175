#include "daemons/fileindexd/disk_walk.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <string_view>
#include <utility>

#include "common/string.h"
#include "fileindex/util/path_policy.h"
#include "watch/directory.h"

namespace vexlo::fileindexd {
namespace {

constexpr size_t kBufferBytes = 65536;
// Of all folders from the root down; those above give theirs up first.
constexpr size_t kMostHeld = 200000;
constexpr int kOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;

// Keeps the least `count` keys; true when others were dropped.
bool KeepLeast(std::vector<std::string>* keys, size_t count) {
  if (keys->size() <= count) {
    return false;
  }
  const auto end = keys->begin() + static_cast<ptrdiff_t>(count);
  std::nth_element(keys->begin(), end, keys->end());
  keys->erase(end, keys->end());
  return true;
}

}  // namespace

bool MeansGone(int error) { return error == ENOENT || error == ENOTDIR || error == ELOOP; }

bool HasRefusableName(const std::string& name) {
  return name.find("#recycle") != std::string::npos || name.find("#snapshot") != std::string::npos;
}

DiskWalk::DiskWalk(const std::string& root, std::string after, WalkRules rules, size_t portion)
    : after_(std::move(after)), rules_(std::move(rules)), portion_(portion), buffer_(kBufferBytes) {
  // A frame above the root, of which only the root is seen.
  Frame above;
  above.path = Dirname(root);
  const std::string folder = above.path.empty() ? "/" : above.path;
  above.fd = daemon::UniqueFd(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  struct stat info {};
  if (above.fd.Get() < 0 || fstat(above.fd.Get(), &info) != 0) {
    if (const int error = errno; !MeansGone(error)) {
      AddUnknown(root, error);
      AddUnknown(root + "/", error);
    }
    return;
  }
  above.device = info.st_dev;
  above.keys = {Basename(root), Basename(root) + "/"};
  above.is_complete = true;
  above.is_above_root = true;
  frames_.push_back(std::move(above));
}

std::optional<DiskEntry> DiskWalk::Next() {
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
    std::string key = std::move(frame.keys[frame.next++]);
    frame.last = key;
    if (!key.ends_with('/')) {
      if (auto entry = Look(frame, key)) {
        return entry;
      }
      continue;
    }
    key.pop_back();
    Enter(frame, key);
  }
  return std::nullopt;
}

std::optional<DiskEntry> DiskWalk::Look(Frame& frame, const std::string& name) {
  DiskEntry entry;
  entry.path = frame.path + "/" + name;
  if (entry.path <= after_ || entry.path.size() >= PATH_MAX) {
    return std::nullopt;
  }
  if (fstatat(frame.fd.Get(), name.c_str(), &entry.info, AT_SYMLINK_NOFOLLOW) != 0) {
    if (const int error = errno; !MeansGone(error)) {
      AddUnknown(std::move(entry.path), error);
    }
    return std::nullopt;
  }
  if (S_ISLNK(entry.info.st_mode)) {
    return std::nullopt;  // As the policy has it: a link is another name.
  }
  if (S_ISDIR(entry.info.st_mode)) {
    if (!MayEnter(frame, name, entry.path)) {
      return std::nullopt;
    }
  } else if ((frame.is_above_root || entry.info.st_dev != frame.device || HasRefusableName(name)) &&
             !rules_.allows(entry.path)) {
    return std::nullopt;
  }
  return frame.is_covered || rules_.covers(entry.path) ? std::optional(std::move(entry))
                                                       : std::nullopt;
}

bool DiskWalk::MayEnter(Frame& frame, const std::string& name, const std::string& path) {
  const auto [known, is_new] = frame.may_enter.try_emplace(name, false);
  if (is_new) {
    known->second =
        (frame.is_covered || rules_.covers(path) || rules_.leads(path)) && rules_.allows(path);
  }
  return known->second;
}

void DiskWalk::Enter(Frame& frame, const std::string& name) {
  Frame below;
  below.path = frame.path + "/" + name;
  const std::string prefix = below.path + "/";
  const bool is_behind =
      (prefix > after_ || after_.starts_with(prefix)) && (rules_.enters || frame.is_above_root);
  // A link would be met as a folder that the policy is asked about, and is none.
  if (!is_behind || prefix.size() >= PATH_MAX || !MayEnter(frame, name, below.path)) {
    frame.may_enter.erase(name);
    return;
  }
  frame.may_enter.erase(name);
  below.is_covered = frame.is_covered || rules_.covers(below.path);
  below.fd = daemon::UniqueFd(openat(frame.fd.Get(), name.c_str(), kOpenFlags));
  struct stat info {};
  if (below.fd.Get() < 0 || fstat(below.fd.Get(), &info) != 0) {
    if (const int error = errno; !MeansGone(error)) {
      AddUnknown(prefix, error);
    }
    return;
  }
  below.device = info.st_dev;
  LetGo();
  frames_.push_back(std::move(below));
}

// Reads the next portion of a folder's names.
void DiskWalk::Fill(Frame& frame) {
  frame.keys.clear();
  frame.next = 0;
  frame.is_complete = true;
  const auto add = [&](std::string key) {
    if (key > frame.last) {
      frame.keys.push_back(std::move(key));
      if (frame.keys.size() >= 2 * portion_ && KeepLeast(&frame.keys, portion_)) {
        frame.is_complete = false;
      }
    }
  };
  const bool is_read =
      lseek(frame.fd.Get(), 0, SEEK_SET) == 0 &&
      watch::ReadDirectory(frame.fd.Get(), buffer_, [&](std::string_view text, unsigned type) {
        std::string name(text);
        if (fileindex::IsSystemPreservedFileName(name)) {
          return;
        }
        if (type == DT_DIR || type == DT_UNKNOWN) {
          add(name + "/");
        }
        add(std::move(name));
      });
  if (!is_read) {
    AddUnknown(frame.path + "/", errno);
    frame.keys.clear();
    frame.is_complete = true;
    return;
  }
  if (KeepLeast(&frame.keys, portion_)) {
    frame.is_complete = false;
  }
  std::sort(frame.keys.begin(), frame.keys.end());
}

// Makes room where many names wait: they are read again when their turn comes.
void DiskWalk::LetGo() {
  size_t held = 0;
  for (const Frame& frame : frames_) {
    held += frame.keys.size() - frame.next;
  }
  // The first frame's cannot be read again.
  for (size_t i = 1; i < frames_.size() && held > kMostHeld; ++i) {
    Frame& frame = frames_[i];
    held -= frame.keys.size() - frame.next;
    frame.keys = {};
    frame.next = 0;
    frame.is_complete = false;
  }
}

void DiskWalk::AddUnknown(std::string path, int error) {
  ++unknown_count_;
  last_error_ = error;
  unknown_.push_back(std::move(path));
}

bool DiskWalk::IsUnknown(const std::string& path) {
  while (!unknown_.empty()) {
    const std::string& first = unknown_.front();
    if (first.ends_with('/') ? path.starts_with(first) : path == first) {
      return true;
    }
    if (path < first) {
      return false;
    }
    unknown_.pop_front();
  }
  return false;
}

}  // namespace vexlo::fileindexd
