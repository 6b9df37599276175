#include "cli/repair.h"

#include <json/value.h>

#include "common/string.h"
#include "fileindex/optree/event.h"
#include "fileindex/util/custom_event.h"

namespace vexlo::cli {
namespace {

// Over so many in one folder it is indexed again as a whole, which reads what has changed only.
constexpr size_t kMostInFolder = 32;
// Each line reads the queue before it is appended.
constexpr size_t kMostInAll = 500;

}  // namespace

Repair::Repair(const AuditScope& scope, const std::string& root)
    : scope_(scope), root_(root.empty() ? scope.SharePath() : root) {}

void Repair::Add(Difference difference, const std::string& path, bool is_there) {
  if (!scope_.IsInShare(path)) {
    ++strays_;
    return;
  }
  if (IsCovered(path)) {
    return;
  }
  // What is there and is not wanted may have wanted folders below it, which a delete would take
  // away.
  const int event = difference != Difference::kGhost ? fileindex::EV_CLOSE_WRITE
                    : is_there                       ? fileindex::EV_REINDEX
                                                     : fileindex::EV_DELETE;
  const std::string folder = path == root_ ? root_ : Dirname(path);
  Events& events = events_[folder];
  event_count_ += events.emplace(path, event).second ? 1 : 0;
  if (events.size() > kMostInFolder) {
    ReindexFolder(folder);
  }
  if (event_count_ + folders_.size() > kMostInAll) {
    ReindexFolder(root_);
  }
}

bool Repair::IsCovered(const std::string& path) const {
  for (size_t end = path.size(); end != std::string::npos && end > 0;
       end = path.rfind('/', end - 1)) {
    const std::string above = path.substr(0, end);
    if (folders_.contains(above)) {
      return true;
    }
    // A delete takes along what was below.
    const auto events = events_.find(Dirname(above));
    const auto event =
        events == events_.end() ? Events::const_iterator() : events->second.find(above);
    if (events != events_.end() && event != events->second.end() &&
        event->second == fileindex::EV_DELETE) {
      return true;
    }
  }
  return false;
}

void Repair::ReindexFolder(const std::string& folder) {
  std::erase_if(events_, [&](const auto& events) {
    if (!IsSameOrBelow(events.first, folder)) {
      return false;
    }
    event_count_ -= events.second.size();
    return true;
  });
  std::erase_if(folders_, [&](const auto& other) { return IsSameOrBelow(other, folder); });
  folders_.insert(folder);
}

size_t Repair::Queue() const {
  for (const std::string& folder : folders_) {
    fileindex::AddCustomEvent(fileindex::EV_REINDEX, folder, "", Json::Value());
  }
  for (const auto& [folder, events] : events_) {
    for (const auto& [path, event] : events) {
      fileindex::AddCustomEvent(event, path, "", Json::Value());
    }
  }
  return folders_.size() + event_count_;
}

}  // namespace vexlo::cli
