#include "fileindex/optree/line_reader.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "fileindex/optree/event.h"
#include "fileindex/optree/malformed_line.h"

namespace vexlo::fileindex {
namespace {

constexpr size_t kFirstBufferBytes = size_t{64} * 1024;

}  // namespace

// O_NONBLOCK means nothing to a file and keeps a FIFO at the path from holding the caller up. What
// can be read only once is refused: a queue may have to be read again from its start.
LineReader::LineReader(const std::string& path)
    : fd_(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK)) {
  struct stat info {};
  if (fd_ < 0) {
    return;
  }
  const bool known = fstat(fd_, &info) == 0;
  if (!known || S_ISDIR(info.st_mode) || S_ISFIFO(info.st_mode)) {
    const int error = !known ? errno : S_ISDIR(info.st_mode) ? EISDIR : ENOTSUP;
    close(fd_);
    fd_ = -1;
    errno = error;
    return;
  }
  file_bytes_ = static_cast<uint64_t>(info.st_size);
}

LineReader::~LineReader() {
  if (fd_ >= 0) {
    close(fd_);
  }
}

bool LineReader::NextBuffered(QueueLine& line) {
  if (scanned_ == end_) {  // Also before the first read, when there is no buffer yet.
    return false;
  }
  const char* const from = buffer_.data() + scanned_;
  const auto* const newline = static_cast<const char*>(memchr(from, '\n', end_ - scanned_));
  if (newline == nullptr) {
    scanned_ = end_;
    return false;
  }
  const auto length = static_cast<size_t>(newline - buffer_.data()) - begin_;
  if (length > kMaxQueueLineBytes) {
    return false;
  }
  line = {std::string_view(buffer_.data() + begin_, length), /*terminated=*/true, length};
  line_offset_ = next_offset_;
  next_offset_ += length + 1;
  begin_ += length + 1;
  scanned_ = begin_;
  return true;
}

bool LineReader::Next(QueueLine& line) {
  while (!NextBuffered(line)) {
    if (end_ - begin_ > kMaxQueueLineBytes) {
      return SkipTooLong(line);
    }
    if (!Refill()) {
      if (failed_ || begin_ == end_) {
        return false;
      }
      const size_t length = end_ - begin_;
      line = {std::string_view(buffer_.data() + begin_, length), /*terminated=*/false, length};
      line_offset_ = next_offset_;
      next_offset_ += length;
      begin_ = scanned_ = end_;
      return true;
    }
  }
  return true;
}

bool LineReader::Seek(uint64_t offset) {
  begin_ = scanned_ = end_ = 0;
  next_offset_ = offset;
  return lseek(fd_, static_cast<off_t>(offset), SEEK_SET) >= 0;
}

std::optional<FileIdentity> LineReader::Identity() const {
  struct statx info {};
  if (statx(fd_, "", AT_EMPTY_PATH, STATX_INO | STATX_BTIME, &info) != 0 ||
      (info.stx_mask & STATX_BTIME) == 0) {
    return std::nullopt;
  }
  return FileIdentity{makedev(info.stx_dev_major, info.stx_dev_minor), info.stx_ino,
                      info.stx_btime.tv_sec, info.stx_btime.tv_nsec};
}

bool LineReader::ReadBefore(uint64_t offset, std::string& text) const {
  return offset >= text.size() &&
         pread(fd_, text.data(), text.size(), static_cast<off_t>(offset - text.size())) ==
             static_cast<ssize_t>(text.size());
}

// Reads more behind buffer_[begin_, end_); false at the end of the file or at an error.
bool LineReader::Refill() {
  if (begin_ > 0) {
    memmove(buffer_.data(), buffer_.data() + begin_, end_ - begin_);
    end_ -= begin_;
    scanned_ -= begin_;
    begin_ = 0;
  }
  if (end_ == buffer_.size()) {
    // Twice as much for a long line; kMaxQueueLineBytes bounds it.
    buffer_.resize(std::max(buffer_.size() * 2, kFirstBufferBytes));
  }
  while (true) {
    const ssize_t count = read(fd_, buffer_.data() + end_, buffer_.size() - end_);
    if (count > 0) {
      end_ += static_cast<size_t>(count);
      return true;
    }
    if (count == 0) {
      return false;
    }
    if (errno != EINTR) {
      failed_ = true;
      return false;
    }
  }
}

// Reads past the line at begin_, keeping its first bytes only.
bool LineReader::SkipTooLong(QueueLine& line) {
  start_of_too_long_.assign(buffer_.data() + begin_, kShownOfTooLong);
  line = {start_of_too_long_, /*terminated=*/false, /*length=*/0};
  do {
    const char* const from = buffer_.data() + begin_;
    const auto* const newline = static_cast<const char*>(memchr(from, '\n', end_ - begin_));
    line.terminated = newline != nullptr;
    const size_t count = line.terminated ? static_cast<size_t>(newline - from) : end_ - begin_;
    line.length += count;
    begin_ += count + (line.terminated ? 1 : 0);
  } while (!line.terminated && Refill());
  scanned_ = begin_;
  line_offset_ = next_offset_;
  next_offset_ += line.length + (line.terminated ? 1 : 0);
  return !failed_;
}

}  // namespace vexlo::fileindex
