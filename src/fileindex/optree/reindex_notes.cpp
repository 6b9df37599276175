#include "fileindex/optree/reindex_notes.h"

#include <algorithm>
#include <deque>
#include <utility>

#include "common/lock.h"

namespace vexlo::fileindex {
namespace {

constexpr size_t kMostNotes = 16;
constexpr size_t kMostPathBytes = size_t{4} << 20;  // Of one note.
constexpr size_t kTailBytes = 4096;

struct KeptNote {
  FileIdentity file;
  ReindexNote note;
};

struct KeptNotes {
  Mutex mutex;
  std::deque<KeptNote> notes VEXLO_GUARDED_BY(mutex);
};

KeptNotes& Kept() {
  static auto* const kept = new KeptNotes;  // Threads may ask until the very end.
  return *kept;
}

}  // namespace

bool ReindexNote::Covers(std::string_view full_path) const {
  if (paths_.empty()) {
    return false;
  }
  for (;;) {
    if (paths_.contains(full_path)) {
      return true;
    }
    const size_t slash = full_path.rfind('/');
    if (slash == std::string_view::npos) {
      return false;
    }
    full_path = full_path.substr(0, slash);
  }
}

bool ReindexNote::Add(const QueueLine& line, const EventView& event, uint64_t line_offset) {
  if (!line.terminated || line_offset != offset_ || path_bytes_ > kMostPathBytes) {
    return false;
  }
  if (event.event == EV_REINDEX && paths_.emplace(event.path).second) {
    path_bytes_ += event.path.size() + sizeof(std::string);
  }
  offset_ += line.length + 1;
  tail_.append(line.text).push_back('\n');
  if (tail_.size() > 4 * kTailBytes) {
    tail_.erase(0, tail_.size() - kTailBytes);
  }
  return true;
}

ReindexNote ReindexNotes::Take(const LineReader& reader) {
  const std::optional<FileIdentity> file = reader.Identity();
  ReindexNote note;
  if (!file) {
    return note;
  }
  {
    KeptNotes& all = Kept();
    const LockMutex lock(all.mutex);
    const auto kept = std::find_if(all.notes.begin(), all.notes.end(),
                                   [&](const KeptNote& each) { return each.file == *file; });
    if (kept == all.notes.end()) {
      return note;
    }
    note = std::move(kept->note);
    all.notes.erase(kept);
  }
  std::string before(std::min(note.tail_.size(), kTailBytes), '\0');
  const std::string_view tail =
      std::string_view(note.tail_).substr(note.tail_.size() - before.size());
  if (!reader.ReadBefore(note.offset_, before) || before != tail) {
    return {};
  }
  return note;
}

void ReindexNotes::Keep(const LineReader& reader, ReindexNote note) {
  const std::optional<FileIdentity> file = reader.Identity();
  if (!file || note.offset_ == 0) {
    return;
  }
  KeptNotes& all = Kept();
  const LockMutex lock(all.mutex);
  std::erase_if(all.notes, [&](const KeptNote& each) { return each.file == *file; });
  if (all.notes.size() >= kMostNotes) {
    all.notes.pop_front();
  }
  all.notes.push_back({*file, std::move(note)});
}

}  // namespace vexlo::fileindex
