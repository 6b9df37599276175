// What a worker remembers of its share over restarts: which folders it has crawled, and how far the
// crawl under way has come.
#ifndef DAEMONS_FILEINDEXD_SHARE_STATE_H_
#define DAEMONS_FILEINDEXD_SHARE_STATE_H_

#include <map>
#include <optional>
#include <set>
#include <string>

#include "daemons/fileindexd/missed_paths.h"

namespace vexlo::fileindexd {

// A crawl that was begun. The index holds what it found up to `after`, committed.
struct CrawlPoint {
  std::string root;   // The full path that is crawled.
  std::string cause;  // What asked for it. Another cause begins anew.
  std::string after;  // The last path that is done with, in the order of a crawl; "" at the start.
  int pass = 1;       // See Crawl.
  bool saw_gone = false;

  bool operator==(const CrawlPoint&) const = default;
};

struct ShareState {
  std::set<std::string> crawled;  // Full paths of indexed folders.
  // What each of them was compared with last (Scope::SettingsOf), unless that is not known.
  std::map<std::string, std::string> settings;
  std::optional<CrawlPoint> crawl;
  // The index was made anew as the status file asked for, and is still to be filled.
  bool rebuilt = false;
  MissedPaths missed;

  bool operator==(const ShareState&) const = default;
};

std::string ShareStateFile(const std::string& share);

// A file that is missing or cannot be used is no state: everything is compared once more. Logged
// unless it is missing.
ShareState LoadShareState(const std::string& file);

// Replaces the file whole, and makes its folder. A failure is logged: what is lost is work.
void SaveShareState(const std::string& file, const ShareState& state);

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_SHARE_STATE_H_
