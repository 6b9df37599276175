#include "fileindex/optree/reindex_notes.h"

#include <algorithm>
#include <deque>
#include <mutex>
#include <utility>

namespace vexlo::fileindex {
namespace {

constexpr size_t kMostNotes = 16;
constexpr size_t kMostPathBytes = size_t{4} << 20;  // Of one note.
constexpr size_t kTailBytes = 4096;

struct KeptNote {
  FileIdentity file;
  ReindexNote note;
};

std::mutex& Guard() {
  static std::mutex mutex;
  return mutex;
}

std::deque<KeptNote>& Kept() {
  static auto* const kept = new std::deque<KeptNote>;  // Threads may ask until the very end.
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
    const std::lock_guard lock(Guard());
    const auto kept = std::find_if(Kept().begin(), Kept().end(),
                                   [&](const KeptNote& each) { return each.file == *file; });
    if (kept == Kept().end()) {
      return note;
    }
    note = std::move(kept->note);
    Kept().erase(kept);
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
  const std::lock_guard lock(Guard());
  std::erase_if(Kept(), [&](const KeptNote& each) { return each.file == *file; });
  if (Kept().size() >= kMostNotes) {
    Kept().pop_front();
  }
  Kept().push_back({*file, std::move(note)});
}

}  // namespace vexlo::fileindex
