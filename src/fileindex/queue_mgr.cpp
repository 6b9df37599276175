#include "fileindex/queue_mgr.h"

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <optional>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/lock.h"
#include "common/string.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/optree/line_parser.h"
#include "fileindex/optree/line_reader.h"
#include "fileindex/optree/reindex_notes.h"

namespace vexlo::fileindex {
namespace {

constexpr int kTornLineTries = 10;
constexpr useconds_t kTornLinePauseMicroseconds = 10000;

bool IsWhole(const QueueLine& line) {
  EventView event;
  Json::Value value;
  return ScanLine(line.text, event) || JsonFromString(value, line.text);
}

// A last line without a newline may be one that its writer is in the middle of: gives the writer a
// moment, so that a half line is not taken for a bad one. False when the file cannot be read.
bool AwaitWholeLine(LineReader& reader, QueueLine& line) {
  for (int tries = 0; tries < kTornLineTries && !line.terminated && !IsWhole(line); ++tries) {
    usleep(kTornLinePauseMicroseconds);
    if (!reader.Seek(reader.LineOffset()) || !reader.Next(line)) {
      return false;
    }
  }
  return true;
}

// Opens a queue for a scan; false when there is none. Throws for one that cannot be opened.
bool IsThere(const std::string& path, std::optional<LineReader>& reader) {
  if (!MayFileExist(path)) {
    return false;
  }
  errno = 0;
  reader.emplace(path);
  if (!reader->IsOpen() && errno == ENOENT) {
    return false;  // Renamed to its snapshot, or deleted, since we looked.
  }
  // Log monitors know this site by the name of another function.
  VEXLO_CHECK_AT((LogSite{"queue_mgr", 32, "PrepareTmpQueue", "!input_stream"}), !reader->IsOpen(),
                 ERR_SYSTEM, std::string("Failed to open queue, reason=") + strerror(errno));
  return true;
}

// Whether matches(line, event) holds for some line from where the reader stands, up to the first
// one.
template <typename Matches>
bool ScanLines(LineReader& reader, Matches matches) {
  LineParser parser;
  QueueLine line;
  while (reader.Next(line)) {
    if (!line.terminated && !AwaitWholeLine(reader, line)) {
      break;
    }
    if (matches(line, parser.Parse(line))) {
      return true;
    }
  }
  VEXLO_CHECK(reader.Failed(), ERR_SYSTEM,
              std::string("Failed to read queue, reason=") + strerror(errno));
  return false;
}

bool HasEventFor(const std::string& path, const std::string& full_path) {
  std::optional<LineReader> reader;
  return IsThere(path, reader) &&
         ScanLines(*reader, [&full_path](const QueueLine&, const EventView& event) {
           return IsSameOrBelow(event.path, full_path) || IsSameOrBelow(event.path_old, full_path);
         });
}

// Whoever adds events one by one asks this before each; so what was read is noted, and only new
// lines are read the next time.
bool HasReindexFor(const std::string& path, const std::string& full_path) {
  std::optional<LineReader> reader;
  if (!IsThere(path, reader)) {
    return false;
  }
  ReindexNote note = ReindexNotes::Take(*reader);
  const auto keep = [&] { ReindexNotes::Keep(*reader, std::move(note)); };
  if (note.Covers(full_path)) {
    keep();
    return true;
  }
  bool notes = reader->Seek(note.Offset());
  try {
    const bool found = ScanLines(*reader, [&](const QueueLine& line, const EventView& event) {
      notes = notes && note.Add(line, event, reader->LineOffset());
      return event.event == EV_REINDEX && IsSameOrBelow(full_path, event.path);
    });
    keep();
    return found;
  } catch (const Error&) {
    keep();
    throw;
  }
}

}  // namespace

QueueMgr::QueueMgr(const std::string& queue_path)
    : queue_path_(queue_path), queue_path_tmp_(queue_path + ".tmp") {}

void QueueMgr::PrepareTmpQueue() {
  if (!MayFileExist(queue_path_)) {
    return;
  }
  const LockFile lock(queue_path_, /*exclusive=*/true);
  // A snapshot that is there and cannot be seen must not be renamed over, nor deleted unread.
  if (MayFileExist(queue_path_tmp_)) {
    return;
  }
  VEXLO_CHECK_AT((LogSite{"queue_mgr", 136, "PrepareTmpQueue",
                          "0 > rename(queue_path_.c_str(), queue_path_tmp_.c_str())"}),
                 0 > rename(queue_path_.c_str(), queue_path_tmp_.c_str()), ERR_SYSTEM,
                 std::string("rename failed, reason=") + strerror(errno));
}

std::shared_ptr<OPTree> QueueMgr::GetOPTree() const {
  if (op_tree_ == nullptr) {
    op_tree_ = std::make_shared<OPTree>(queue_path_);
  }
  return op_tree_;
}

std::shared_ptr<OPTree> QueueMgr::GetOPTreeTmp() const {
  if (op_tree_tmp_ == nullptr) {
    op_tree_tmp_ = std::make_shared<OPTree>(queue_path_tmp_);
  }
  return op_tree_tmp_;
}

int QueueMgr::DeleteTmp() { return unlink(queue_path_tmp_.c_str()); }

int QueueMgr::ProcessOP(std::function<void(std::shared_ptr<OP>)> callback, bool use_tmp) {
  if (use_tmp) {
    PrepareTmpQueue();
  }
  if (!MayFileExist(use_tmp ? queue_path_tmp_ : queue_path_)) {
    return 0;
  }
  return static_cast<int>((use_tmp ? GetOPTreeTmp() : GetOPTree())->ProcessOP(callback));
}

bool QueueMgr::IsFullPathProcessing(const std::string& full_path) {
  // Whoever asks trusts the list of folders: one that cannot be loaded must not look like an idle
  // queue.
  const FolderMgr folders;
  return HasEventFor(queue_path_, full_path) || HasEventFor(queue_path_tmp_, full_path);
}

bool QueueMgr::IsFullPathHasReindex(const std::string& full_path) {
  return HasReindexFor(queue_path_, full_path) || HasReindexFor(queue_path_tmp_, full_path);
}

}  // namespace vexlo::fileindex
