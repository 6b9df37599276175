#include "platform/local/mount_info.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>

#include "platform/local/fd.h"

namespace kavo::local {
namespace {

constexpr char kMountInfo[] = "/proc/self/mountinfo";
constexpr size_t kReadBytes = size_t{16} * 1024;

// Cuts the text up to the separator, or all of it, off the front.
std::string_view Cut(std::string_view& text, char separator) {
  const size_t end = std::min(text.find(separator), text.size());
  const std::string_view front = text.substr(0, end);
  text.remove_prefix(std::min(end + 1, text.size()));
  return front;
}

std::optional<uint64_t> ToNumber(std::string_view text) {
  uint64_t number = 0;
  const char* const end = text.data() + text.size();
  const auto result = std::from_chars(text.data(), end, number);
  return result.ec == std::errc() && result.ptr == end ? std::optional(number) : std::nullopt;
}

// Blanks, backslashes and "#" are written as three octal digits behind a backslash.
std::string Unescape(std::string_view text) {
  std::string plain;
  plain.reserve(text.size());
  while (!text.empty()) {
    const bool escaped = text.size() >= 4 && text[0] == '\\' && text[1] >= '0' && text[1] <= '3' &&
                         text[2] >= '0' && text[2] <= '7' && text[3] >= '0' && text[3] <= '7';
    plain += escaped
                 ? static_cast<char>((text[1] - '0') * 64 + (text[2] - '0') * 8 + (text[3] - '0'))
                 : text[0];
    text.remove_prefix(escaped ? 4 : 1);
  }
  return plain;
}

// ID PARENT MAJOR:MINOR ROOT PLACE OPTIONS [OPTIONAL...] - TYPE SOURCE SUPER_OPTIONS
std::optional<Mount> MatchLine(std::string_view line, std::optional<uint64_t> id, dev_t device) {
  const std::optional<uint64_t> line_id = ToNumber(Cut(line, ' '));
  Cut(line, ' ');
  std::string_view numbers = Cut(line, ' ');
  const std::optional<uint64_t> line_major = ToNumber(Cut(numbers, ':'));
  const std::optional<uint64_t> line_minor = ToNumber(numbers);
  const bool matches =
      id.has_value() ? line_id == id : line_major == major(device) && line_minor == minor(device);
  if (!matches) {
    return std::nullopt;
  }
  for (int field = 0; field < 3; ++field) {
    Cut(line, ' ');
  }
  while (!line.empty()) {
    if (Cut(line, ' ') == "-") {
      const std::string_view type = Cut(line, ' ');
      return Mount{Unescape(type), Unescape(Cut(line, ' '))};
    }
  }
  return std::nullopt;
}

bool ReadMountInfo(std::string& text) {
  const ScopedFd fd(open(kMountInfo, O_RDONLY | O_CLOEXEC));
  ssize_t count = fd.Get() < 0 ? -1 : 1;
  while (count > 0) {
    const size_t filled = text.size();
    text.resize(filled + kReadBytes);
    do {
      count = read(fd.Get(), text.data() + filled, kReadBytes);
    } while (count < 0 && errno == EINTR);
    text.resize(filled + static_cast<size_t>(std::max<ssize_t>(count, 0)));
  }
  return count == 0;
}

}  // namespace

std::optional<Mount> FindMount(std::string_view text, std::optional<uint64_t> id, dev_t device) {
  while (!text.empty()) {
    std::optional<Mount> mount = MatchLine(Cut(text, '\n'), id, device);
    if (mount.has_value()) {
      return mount;
    }
  }
  return std::nullopt;
}

std::optional<Mount> FindMountOf(const char* path) {
  // The kernel adds mount and device to any answer. When asked for nothing else, FUSE gives one to
  // users, root among them, to whom it refuses the file's own data.
  struct statx info {};
  std::string text;
  if (statx(AT_FDCWD, path, AT_NO_AUTOMOUNT | AT_STATX_DONT_SYNC, 0, &info) != 0 ||
      !ReadMountInfo(text)) {
    return std::nullopt;
  }
  const bool has_id = (info.stx_mask & STATX_MNT_ID) != 0;
  errno = 0;
  return FindMount(text, has_id ? std::optional<uint64_t>(info.stx_mnt_id) : std::nullopt,
                   makedev(info.stx_dev_major, info.stx_dev_minor));
}

}  // namespace kavo::local
