#include "fileindex/optree/line_parser.h"

#include "fileindex/optree/malformed_line.h"

namespace vexlo::fileindex {

EventView ViewOf(const Event& event) {
  return {event.event, event.is_dir, event.path, event.path_old,
          event.data.isNull() ? nullptr : &event.data};
}

const EventView& LineParser::Parse(const QueueLine& line) {
  return ScanLine(line.text, view_) ? view_ : ParseUnusual(line);
}

const EventView& LineParser::ParseUnusual(const QueueLine& line) {
  if (line.length > line.text.size()) {
    FailMalformed(line.text, line.length);
  }
  event_.emplace(std::string(line.text));
  view_ = ViewOf(*event_);
  return view_;
}

}  // namespace vexlo::fileindex
