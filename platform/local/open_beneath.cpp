#include "platform/local/open_beneath.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>

#include <algorithm>
#include <cerrno>
#include <memory>
#include <utility>

#include "kavo/local/open.h"
#include "platform/local/boundary.h"
#include "platform/local/fd.h"
#include "platform/local/share_table.h"

namespace kavo::local {
namespace {

constexpr int kStepFlags = O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

bool HasOpenat2() {
  struct open_how how {};
  how.flags = O_PATH | O_CLOEXEC;
  const ScopedFd root(static_cast<int>(syscall(SYS_openat2, AT_FDCWD, "/", &how, sizeof(how))));
  return root.Get() >= 0;
}

// The path of the outermost share that holds it: in those within it the users of the outer one may
// have put a link in the inner one's place. "" when there is none.
std::string OutermostShare(const std::string& path, const ShareTable& table) {
  std::string found;
  for (const Share& share : table.Shares()) {
    if (path.starts_with(share.path + "/") && (found.empty() || share.path.size() < found.size())) {
      found = share.path;
    }
  }
  return found;
}

// Of a path that is known to hold a link somewhere.
int OpenBehindLink(const std::string& path, int flags) {
  const std::shared_ptr<const ShareTable> table = PresentShares();
  if (table == nullptr) {
    return -1;
  }
  const std::string share = OutermostShare(path, *table);
  if (share.empty()) {
    return open(path.c_str(), flags);
  }
  const ScopedFd base(open(share.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  return base.Get() < 0 ? -1 : OpenWithoutLinks(base.Get(), path.substr(share.size() + 1), flags);
}

}  // namespace

int OpenStepwise(int base, const std::string& path, int flags) {
  const bool is_absolute = path.starts_with('/');
  ScopedFd root(is_absolute ? open("/", kStepFlags) : -1);
  int at = is_absolute ? root.Get() : base;
  std::unique_ptr<ScopedFd> folder;
  size_t begin = is_absolute ? 1 : 0;
  for (size_t slash = path.find('/', begin); slash != std::string::npos;
       begin = slash + 1, slash = path.find('/', begin)) {
    const std::string name = path.substr(begin, slash - begin);
    auto next = std::make_unique<ScopedFd>(openat(at, name.c_str(), kStepFlags));
    if (next->Get() < 0) {
      // With O_DIRECTORY a link is said to be no folder.
      const int error = errno;
      const ScopedFd link(
          error == ENOTDIR ? openat(at, name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC) : -1);
      char first = 0;
      errno = link.Get() >= 0 && readlinkat(link.Get(), "", &first, 1) >= 0 ? ELOOP : error;
      return -1;
    }
    folder = std::move(next);
    at = folder->Get();
  }
  return openat(at, path.c_str() + begin, flags | O_NOFOLLOW);
}

int OpenWithoutLinks(int base, const std::string& path, int flags) {
  // A kernel before 5.6 does not know it, and neither do filters of system calls of that time.
  static const bool kIsThere = HasOpenat2();
  struct open_how how {};
  how.flags = static_cast<unsigned>(flags);
  how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS |
                (path.starts_with('/') ? 0U : static_cast<unsigned>(RESOLVE_BENEATH));
  return kIsThere ? static_cast<int>(syscall(SYS_openat2, base, path.c_str(), &how, sizeof(how)))
                  : OpenStepwise(base, path, flags);
}

int OpenInShare(const std::string& full_path, int flags) noexcept {
  flags |= O_NOFOLLOW | O_CLOEXEC;
  return Guarded([&] {
    int fd = OpenWithoutLinks(AT_FDCWD, full_path, flags);
    if (fd < 0 && errno == ELOOP) {
      fd = OpenBehindLink(full_path, flags);
    }
    if (fd < 0 && errno == ELOOP && (flags & O_PATH) != 0) {
      errno = ENOTDIR;  // The last component would have been opened.
    }
    return fd;
  });
}

}  // namespace kavo::local
