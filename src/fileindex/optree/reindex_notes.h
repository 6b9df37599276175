// What was already read of queue files, for those who ask the same again and again. Not installed.
#ifndef FILEINDEX_OPTREE_REINDEX_NOTES_H_
#define FILEINDEX_OPTREE_REINDEX_NOTES_H_

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>

#include "fileindex/optree/event.h"
#include "fileindex/optree/line_reader.h"
#include "fileindex/optree/line_scanner.h"

namespace vexlo::fileindex {

// The paths whose reindex the first lines of one queue file ask for. A line is noted only when it
// is good and whole, so whoever goes on behind the last one meets the same lines, and the same
// errors, as one who reads from the start.
class ReindexNote {
 public:
  // Behind the last line that was noted.
  uint64_t Offset() const { return offset_; }

  // Whether a path that was noted is `full_path` or a folder above it. Takes what the components of
  // the path take.
  bool Covers(std::string_view full_path) const;

  // The line that LineReader::Next() has just returned, and its event. False, and the note stays as
  // it is, when the line is not whole or the note has reached its bound; no later line of the file
  // may be added then.
  bool Add(const QueueLine& line, const EventView& event, uint64_t line_offset);

 private:
  friend class ReindexNotes;

  struct Hash {
    using is_transparent = void;
    size_t operator()(std::string_view text) const { return std::hash<std::string_view>{}(text); }
  };

  std::unordered_set<std::string, Hash, std::equal_to<>> paths_;
  size_t path_bytes_ = 0;
  uint64_t offset_ = 0;
  std::string tail_;  // The last bytes before offset_.
};

// Notes for the few queue files that a process asks about, the oldest forgotten first. Safe to use
// from several threads: whoever takes a note has it alone, and others do without meanwhile.
class ReindexNotes {
 public:
  // A note is good for the file that it was made of and for no other: device, inode and date of
  // birth are the same, the file is no shorter, and what stood right before the note's end still
  // does (a failed append may have been cut back). Without such a note, or where the file system
  // tells no date of birth, an empty one.
  static ReindexNote Take(const LineReader& reader);

  // Keeps a note for the next who asks about this file.
  static void Keep(const LineReader& reader, ReindexNote note);
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_REINDEX_NOTES_H_
