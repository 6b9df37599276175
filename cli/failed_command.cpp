// "fileindex failed": the files whose text is not in the index, and why.
#include <json/value.h>

#include <map>
#include <set>
#include <utility>

#include "cli/command.h"
#include "cli/engine.h"
#include "cli/index_listing.h"
#include "cli/quarantine_list.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/json.h"
#include "fileindex/elastic_control/schema.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "kavo/local/content.h"

namespace vexlo::cli {
namespace {

using fileindex::elastic::field::KAVOMDPath;

class FailedFiles {
 public:
  FailedFiles(const Console& console, bool as_json, const Quarantined& quarantined)
      : console_(console), as_json_(as_json), quarantined_(quarantined) {}

  void PrintShare(const std::string& share) {
    IndexListing listing(fileindex::elastic::GetFileIndexID(share), "",
                         {kavo::local::kContentErrorField});
    while (const auto document = listing.Next()) {
      const Json::Value& error = (*document)[kavo::local::kContentErrorField];
      if (error.isString()) {
        const std::string path = (*document)[KAVOMDPath].asString();
        Print(path, error.asString());
        printed_.insert(quarantined_.contains(path) ? path : "");
      }
    }
  }

  // Those of which no document tells yet.
  void PrintRest() {
    for (const auto& [path, error] : quarantined_) {
      if (!printed_.contains(path)) {
        Print(path, error);
      }
    }
  }

  // `all_read`: no index is missing.
  void Summarize(bool all_read) const {
    console_.out.flush();
    if (counts_.empty() && all_read) {
      console_.err << "the text of every file that was indexed is there\n";
    }
    for (const auto& [reason, count] : counts_) {
      console_.err << Counted(count, "file") << " " << ForTerminal(reason) << "\n";
    }
  }

  bool IsEmpty() const { return counts_.empty(); }

 private:
  // `error` is "REASON: what happened".
  void Print(const std::string& path, const std::string& error) {
    const size_t colon = error.find(": ");
    const std::string reason = error.substr(0, colon);
    const std::string message = colon == std::string::npos ? "" : error.substr(colon + 2);
    const bool is_quarantined = quarantined_.contains(path);
    ++counts_[reason];
    if (as_json_) {
      Json::Value line;
      line["path"] = path;
      line["reason"] = reason;
      line["message"] = message;
      line["quarantined"] = is_quarantined;
      console_.out << JsonToString(line) << "\n";
    } else {
      console_.out << ForTerminal(path + ": " + error) << (is_quarantined ? " (quarantined)" : "")
                   << "\n";
    }
  }

  const Console& console_;
  const bool as_json_;
  const Quarantined& quarantined_;
  std::set<std::string> printed_;  // Of those in quarantine.
  std::map<std::string, uint64_t> counts_;
};

ExitStatus ShowFailed(const Arguments& arguments, const Console& console) {
  const QuarantineList quarantine = ReadQuarantine();
  if (!quarantine.fault.empty()) {
    console.err << "without the quarantine: " << ForTerminal(quarantine.fault) << "\n";
  }
  FailedFiles failed(console, arguments.Has("--json"), quarantine.files);
  bool all_read = true;
  RequireEngine();
  for (const std::string& share : fileindex::FolderMgr().GetIndexedShares()) {
    try {
      WithEngine([&] { failed.PrintShare(share); });
    } catch (const std::exception& error) {
      all_read = false;
      console.err << "not read: the index of '" << ForTerminal(share)
                  << "': " << ForTerminal(error.what()) << "\n";
    }
  }
  failed.PrintRest();
  failed.Summarize(all_read);
  return !all_read ? kFailed : failed.IsEmpty() ? kNothingFound : kDone;
}

}  // namespace

std::vector<Command> FailedCommands() {
  return {
      {"failed",
       "",
       "lists the files without text in the index, and why",
       "Prints a line for each file whose content is missing in its document, or there in part:\n"
       "the path, the reason, and what happened. Files that ended the processes that read them "
       "are\n"
       "quarantined: they are left alone until they change. Their list only its owner may read.\n"
       "\n"
       "Exit status 0 when there are some, 1 when there are none, 3 when an index could not be\n"
       "read.\n"
       "\n"
       "  fileindex failed --json | jq -r 'select(.reason == \"unavailable\").path'\n",
       {{"--json", nullptr, "one JSON object a line: path, reason, message, quarantined"}},
       {},
       0,
       0,
       ShowFailed},
  };
}

}  // namespace vexlo::cli
