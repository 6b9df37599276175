// Reads a queue file line by line. Not installed.
#ifndef FILEINDEX_OPTREE_LINE_READER_H_
#define FILEINDEX_OPTREE_LINE_READER_H_

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace vexlo::fileindex {

// One line of a queue file.
struct QueueLine {
  std::string_view text;   // Without its newline. Of a line that is too long, the start.
  bool terminated = true;  // A newline follows.
  uint64_t length = 0;     // In bytes; more than `text` holds when the line is too long.
};

// Tells a file from every other, also from one that has its inode later.
struct FileIdentity {
  uint64_t device = 0;
  uint64_t inode = 0;
  int64_t birth_seconds = 0;
  uint32_t birth_nanoseconds = 0;

  bool operator==(const FileIdentity&) const = default;
};

// Lines as std::getline finds them: what follows the last newline is a line unless it is empty. A
// line over kMaxQueueLineBytes is read past without being kept.
class LineReader {
 public:
  // Opens the file; IsOpen() is false and errno is set when that fails, also for a folder or a
  // FIFO.
  explicit LineReader(const std::string& path);
  ~LineReader();
  LineReader(const LineReader&) = delete;
  LineReader& operator=(const LineReader&) = delete;

  bool IsOpen() const { return fd_ >= 0; }

  // False at the end of the file, or at a read error, which sets errno and Failed(). The line's
  // text is valid until the next call.
  bool Next(QueueLine& line);

  // The next line, when the whole of it was read already; the lines before it stay valid.
  bool NextBuffered(QueueLine& line);

  bool Failed() const { return failed_; }

  // Where the line that Next() returned last begins.
  uint64_t LineOffset() const { return line_offset_; }

  // Goes on at `offset`, with what stands in the file by now. False with errno when that fails.
  bool Seek(uint64_t offset);

  // None when the file system does not tell when the file was made.
  std::optional<FileIdentity> Identity() const;

  // Fills `text` with the bytes that stand before `offset`; false when there are not so many.
  bool ReadBefore(uint64_t offset, std::string& text) const;

  uint64_t BytesRead() const { return next_offset_; }
  uint64_t FileBytes() const { return file_bytes_; }  // When it was opened.

 private:
  bool Refill();
  bool SkipTooLong(QueueLine& line);

  int fd_ = -1;
  bool failed_ = false;
  uint64_t file_bytes_ = 0;
  uint64_t line_offset_ = 0;
  uint64_t next_offset_ = 0;  // Of the first byte that was not returned yet.
  std::string start_of_too_long_;
  std::vector<char> buffer_;
  size_t begin_ = 0;    // buffer_[begin_, end_) was read and not returned yet,
  size_t scanned_ = 0;  // and buffer_[begin_, scanned_) of it holds no newline.
  size_t end_ = 0;
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_LINE_READER_H_
