#include "fileindex/queue_mgr.h"

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "common/check.h"
#include "common/file.h"
#include "common/json.h"
#include "common/lock.h"
#include "common/string.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/optree/line_parser.h"
#include "fileindex/optree/line_reader.h"

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

// Whether `matches` holds for some event of the file, up to the first one. No file has no events.
template <typename Matches>
bool ScanQueue(const std::string& path, Matches matches) {
  if (!IsFileExist(path)) {
    return false;
  }
  errno = 0;
  LineReader reader(path);
  if (!reader.IsOpen() && errno == ENOENT) {
    return false;  // Renamed to its snapshot, or deleted, since we looked.
  }
  // Log monitors know this site by the name of another function.
  VEXLO_CHECK_AT((LogSite{"queue_mgr", 32, "PrepareTmpQueue", "!input_stream"}), !reader.IsOpen(),
                 ERR_SYSTEM, std::string("Failed to open queue, reason=") + strerror(errno));
  LineParser parser;
  QueueLine line;
  while (reader.Next(line)) {
    if (!line.terminated && !AwaitWholeLine(reader, line)) {
      break;
    }
    if (matches(parser.Parse(line))) {
      return true;
    }
  }
  VEXLO_CHECK(reader.Failed(), ERR_SYSTEM,
              std::string("Failed to read queue, reason=") + strerror(errno));
  return false;
}

}  // namespace

QueueMgr::QueueMgr(const std::string& queue_path)
    : queue_path_(queue_path), queue_path_tmp_(queue_path + ".tmp") {}

void QueueMgr::PrepareTmpQueue() {
  if (!IsFileExist(queue_path_)) {
    return;
  }
  const LockFile lock(queue_path_, /*exclusive=*/true);
  if (IsFileExist(queue_path_tmp_)) {
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
  if (!IsFileExist(use_tmp ? queue_path_tmp_ : queue_path_)) {
    return 0;
  }
  return static_cast<int>((use_tmp ? GetOPTreeTmp() : GetOPTree())->ProcessOP(callback));
}

bool QueueMgr::IsFullPathProcessing(const std::string& full_path) {
  // Whoever asks trusts the list of folders: one that cannot be loaded must not look like an idle
  // queue.
  const FolderMgr folders;
  const auto concerns = [&full_path](const EventView& event) {
    return IsSameOrBelow(event.path, full_path) || IsSameOrBelow(event.path_old, full_path);
  };
  return ScanQueue(queue_path_, concerns) || ScanQueue(queue_path_tmp_, concerns);
}

bool QueueMgr::IsFullPathHasReindex(const std::string& full_path) {
  const auto reindexes = [&full_path](const EventView& event) {
    return event.event == EV_REINDEX && IsSameOrBelow(full_path, event.path);
  };
  return ScanQueue(queue_path_, reindexes) || ScanQueue(queue_path_tmp_, reindexes);
}

}  // namespace vexlo::fileindex
