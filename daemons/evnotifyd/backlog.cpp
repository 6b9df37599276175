#include "daemons/evnotifyd/backlog.h"

namespace vexlo::evnotifyd {

void Backlog::Add(const watch::QueueEvent& event) {
  Append(event);
  if (text_.size() > most_bytes_) {
    Clear();
    for (const std::string& root : roots_) {
      Append({watch::kMaskCrashed, true, root, ""});
    }
  }
}

void Backlog::Append(const watch::QueueEvent& event) {
  text_ += watch::QueueLine(event);
  ++lines_;
  crashed_ += event.mask == watch::kMaskCrashed ? 1 : 0;
}

void Backlog::Clear() {
  text_ = std::string();  // Gives the memory of a burst back.
  lines_ = 0;
  crashed_ = 0;
}

}  // namespace vexlo::evnotifyd
