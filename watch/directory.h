// Opening and reading directories by descriptor, so that no path limit applies.
#ifndef WATCH_DIRECTORY_H_
#define WATCH_DIRECTORY_H_

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <utility>

namespace vexlo::watch {

// Owns a descriptor.
class Fd {
 public:
  Fd() = default;
  explicit Fd(int fd) : fd_(fd) {}
  ~Fd() {
    if (fd_ >= 0) {
      close(fd_);
    }
  }
  Fd(Fd&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  Fd& operator=(Fd&& other) noexcept {
    std::swap(fd_, other.fd_);
    return *this;
  }
  Fd(const Fd&) = delete;
  Fd& operator=(const Fd&) = delete;

  int Get() const { return fd_; }
  explicit operator bool() const { return fd_ >= 0; }

 private:
  int fd_ = -1;
};

// Opens a directory for reading; a symbolic link is none. False, with errno, when that fails. The
// second form takes an absolute path of any length and follows links in all but the last component.
Fd OpenDirectory(int parent, const std::string& name);
Fd OpenDirectory(const std::string& path);

// True when errno `error` of an open means that no directory stands there.
bool MeansNoDirectory(int error);

// A hash of what a listing with attributes would show of an entry: 0 is as likely as any other
// value. Sums of it compare folders whatever the order of their entries. What changes in a
// directory when its own entries do (size, times) is left out.
uint64_t EntryHash(std::string_view name, const struct stat& attributes);

// Calls take(name, d_type) for each entry but "." and "..". `buffer` is scratch space. False, with
// errno, when not all could be read.
template <typename Take>
bool ReadDirectory(int fd, std::span<char> buffer, const Take& take) {
  for (;;) {
    const ssize_t length = getdents64(fd, buffer.data(), buffer.size());
    if (length <= 0) {
      return length == 0;
    }
    for (ssize_t at = 0; at < length;) {
      const auto* entry = reinterpret_cast<const dirent64*>(buffer.data() + at);
      const char* name = static_cast<const char*>(entry->d_name);
      const std::string_view text(name);
      if (text != "." && text != "..") {
        take(text, entry->d_type);
      }
      at += entry->d_reclen;
    }
  }
}

}  // namespace vexlo::watch

#endif  // WATCH_DIRECTORY_H_
