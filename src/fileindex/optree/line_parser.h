// Queue lines to events, the fast way where it serves. Not installed.
#ifndef FILEINDEX_OPTREE_LINE_PARSER_H_
#define FILEINDEX_OPTREE_LINE_PARSER_H_

#include <optional>

#include "fileindex/optree/event.h"
#include "fileindex/optree/line_reader.h"
#include "fileindex/optree/line_scanner.h"

namespace vexlo::fileindex {

EventView ViewOf(const Event& event);

// Turns lines into events with the results and errors of Event's constructor.
class LineParser {
 public:
  // Valid until the next call, and as long as the line's text is.
  const EventView& Parse(const QueueLine& line);

  // The same for a line that ScanLine() has refused already.
  const EventView& ParseUnusual(const QueueLine& line);

 private:
  EventView view_;
  std::optional<Event> event_;  // Of the last line that was not ordinary.
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_LINE_PARSER_H_
