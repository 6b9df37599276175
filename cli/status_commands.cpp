// "fileindex status" and "fileindex summary": how indexing stands.
#include <json/value.h>

#include "cli/command.h"
#include "cli/service.h"
#include "cli/text.h"
#include "common/json.h"
#include "fileindex/index_mgr/status_report.h"

namespace vexlo::cli {
namespace {

const Option kJson = {"--json", nullptr, "the library's own JSON"};

ExitStatus ShowStatus(const Arguments& arguments, const Console& console) {
  const std::string status = fileindex::GetIndexProcessingStatus();
  console.out << (arguments.Has("--json") ? JsonToString(status) : status) << "\n";
  if (!IsIndexDaemonRunning()) {
    console.err << NoIndexDaemon() << "\n";
  }
  return kDone;
}

ExitStatus ShowSummary(const Arguments& arguments, const Console& console) {
  Json::Value summary;
  fileindex::FolderSummary(summary);
  if (arguments.Has("--json")) {
    console.out << JsonToString(summary) << "\n";
    return kDone;
  }
  std::vector<std::vector<std::string>> rows;
  for (const Json::Value& item : summary["items"]) {
    rows.push_back(
        {ForTerminal(item["name"].asString()) + (item["group"].asBool() ? " (group)" : ""),
         item["text"].asString() + (item.isMember("desc") ? ": " + item["desc"].asString() : "")});
  }
  rows.push_back({"in all", summary["status"].asString()});
  console.out << Table(rows);
  return kDone;
}

}  // namespace

std::vector<Command> StatusCommands() {
  return {
      {"status",
       "",
       "says whether indexing is finished, under way or paused",
       "Prints one word: finished, processing or paused.\n"
       "\n"
       "  while [ \"$(fileindex status)\" = processing ]; do sleep 1; done\n",
       {kJson},
       {},
       0,
       0,
       ShowStatus},
      {"summary",
       "",
       "sums up how far each folder and group of folders is",
       "The words are those of 'fileindex folder list'; the last line is that of the whole\n"
       "service.\n"
       "\n"
       "  fileindex summary --json | jq -r '.items[] | select(.text == \"error\").name'\n",
       {kJson},
       {},
       0,
       0,
       ShowSummary},
  };
}

}  // namespace vexlo::cli
