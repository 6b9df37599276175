#include "daemons/fileindexd/queue_tail.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <string_view>

#include "daemons/common/unique_fd.h"

namespace vexlo::fileindexd {
namespace {

constexpr uint64_t kMostBytes = uint64_t{64} << 10;

}  // namespace

std::vector<std::string> QueueTail::Next() {
  std::vector<std::string> lines;
  const daemon::UniqueFd file(open(path_.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  struct stat info {};
  if (file.Get() < 0 || fstat(file.Get(), &info) != 0 || !S_ISREG(info.st_mode)) {
    return lines;
  }
  const auto size = static_cast<uint64_t>(info.st_size);
  if (info.st_ino != inode_ || size < seen_) {
    inode_ = info.st_ino;
    seen_ = 0;
  }
  const uint64_t from = std::max(seen_, size - std::min(size, kMostBytes));
  std::string text(size - from, '\0');
  const ssize_t count = pread(file.Get(), text.data(), text.size(), static_cast<off_t>(from));
  text.resize(static_cast<size_t>(std::max<ssize_t>(count, 0)));
  size_t begin = 0;
  if (from > seen_) {  // In the middle of a line.
    begin = std::min(text.find('\n'), text.size() - 1) + 1;
  }
  for (size_t end = 0; (end = text.find('\n', begin)) != std::string::npos; begin = end + 1) {
    lines.push_back(text.substr(begin, end - begin));
    seen_ = from + end + 1;
  }
  return lines;
}

}  // namespace vexlo::fileindexd
