#include "platform/local/share_table.h"

#include <sys/stat.h>
#include <syslog.h>

#include <algorithm>
#include <cerrno>
#include <ctime>
#include <string>
#include <utility>

#include "kavo/local/mutex.h"
#include "platform/local/boundary.h"
#include "platform/local/shares_file.h"

namespace kavo::local {
namespace {

// Time stamps advance in ticks: some milliseconds on most file systems, up to two seconds on a few.
// A file that was changed no longer ago may change once more without a trace in its version.
constexpr int64_t kTickNs = 2'000'000'000;

bool IsSettled(const SharesText& read) {
  struct timespec now {};
  clock_gettime(CLOCK_REALTIME, &now);
  const int64_t now_ns = now.tv_sec * int64_t{1'000'000'000} + now.tv_nsec;
  return !read.exists || now_ns - read.version.changed_ns >= kTickNs;
}

// The table of one file. Failures to read the file are not kept: the next caller may be another
// user, or find memory and descriptors again.
class ShareCache {
 public:
  explicit ShareCache(std::string file) : file_(std::move(file)) {}

  // The table, or null with `error` set to an errno.
  std::shared_ptr<const ShareTable> Get(int& error) {
    const MutexLock lock(mutex_);
    struct stat info {};
    FileVersion version;
    if (stat(file_.c_str(), &info) == 0) {
      version = VersionOf(info);
    } else if (errno != ENOENT) {
      error = errno;
      Log(version, UnreadableMessage(file_, error));
      return nullptr;
    }
    if (!is_settled_ || version != read_.version) {
      SharesText read;
      error = ReadSharesText(file_, read);
      if (error != 0) {
        Log(version, UnreadableMessage(file_, error));
        return nullptr;
      }
      Take(std::move(read));
    }
    error = table_ == nullptr ? EINVAL : 0;
    return table_;
  }

 private:
  void Take(SharesText read) KAVO_REQUIRES(mutex_) {
    const bool is_settled = IsSettled(read);
    // The text is kept until the file has settled, and only so long.
    const bool is_known =
        is_loaded_ && !is_settled_ && read.exists == read_.exists && read.text == read_.text;
    if (!is_known) {
      is_loaded_ = false;
      try {
        table_ = std::make_shared<const ShareTable>(ParseShares(file_, read));
        logged_.clear();
      } catch (const SharesError& fault) {
        table_ = nullptr;
        Log(read.version, fault.what());
      }
    }
    read_ = std::move(read);
    if (is_settled) {
      read_.text = std::string();
    }
    is_settled_ = is_settled;
    is_loaded_ = true;
  }

  void Log(const FileVersion& version, const std::string& message) KAVO_REQUIRES(mutex_) {
    if (message != logged_ || version != logged_version_) {
      syslog(LOG_ERR, "kavoplatform: %s", message.c_str());
      logged_ = message;
      logged_version_ = version;
    }
  }

  const std::string file_;
  Mutex mutex_;
  SharesText read_ KAVO_GUARDED_BY(mutex_);  // What the table was made from.
  std::shared_ptr<const ShareTable> table_ KAVO_GUARDED_BY(mutex_);  // Null when that is bad.
  bool is_loaded_ KAVO_GUARDED_BY(mutex_) = false;
  bool is_settled_ KAVO_GUARDED_BY(mutex_) = false;
  std::string logged_ KAVO_GUARDED_BY(mutex_);
  FileVersion logged_version_ KAVO_GUARDED_BY(mutex_);
};

}  // namespace

ShareTable::ShareTable(std::vector<Share> shares) : shares_(std::move(shares)) {
  by_name_.reserve(shares_.size());
  by_path_.reserve(shares_.size());
  for (const Share& share : shares_) {
    by_name_.emplace(share.name, &share);
    by_path_.emplace(share.path, &share);
    longest_path_ = std::max(longest_path_, share.path.size());
  }
}

const Share* ShareTable::FindName(std::string_view name) const {
  const auto found = by_name_.find(name);
  return found == by_name_.end() ? nullptr : found->second;
}

const Share* ShareTable::FindHolder(std::string_view full_path) const {
  size_t end = full_path.size();
  if (end > longest_path_) {
    end = full_path.rfind('/', longest_path_);
  }
  while (end != std::string_view::npos && end != 0) {
    if (const auto found = by_path_.find(full_path.substr(0, end)); found != by_path_.end()) {
      return found->second;
    }
    end = full_path.rfind('/', end - 1);
  }
  return nullptr;
}

std::shared_ptr<const ShareTable> PresentShares() noexcept {
  std::shared_ptr<const ShareTable> table;
  Guarded([&table] {
    static ShareCache cache(SharesFile());
    int error = 0;
    table = cache.Get(error);
    return table == nullptr ? Fail(KAVO_ERR_BAD_CONFIG, error) : 0;
  });
  return table;
}

}  // namespace kavo::local
