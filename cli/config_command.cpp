// "fileindex config check": what is wrong with the files that say what is indexed.
#include <json/value.h>

#include "cli/command.h"
#include "cli/config_check.h"
#include "cli/text.h"
#include "common/json.h"

namespace vexlo::cli {
namespace {

ExitStatus Check(const Arguments& arguments, const Console& console) {
  size_t folders = 0;
  const std::vector<ConfigFinding> findings = CheckConfig(folders);
  for (const auto& [file, place, what] : findings) {
    if (arguments.Has("--json")) {
      Json::Value line;
      line["file"] = file;
      line["place"] = place;
      line["what"] = what;
      console.out << JsonToString(line) << "\n";
    } else {
      // The place is what jq would be asked for: "FILE: .[2].owner: is no text, ...".
      console.out << ForTerminal(file) << ": " << ForTerminal(place) << (place.empty() ? "" : ": ")
                  << ForTerminal(what) << "\n";
    }
  }
  console.err << Counted(folders, "folder") << " configured, "
              << Counted(findings.size(), "finding") << "\n";
  return findings.empty() ? kDone : kNothingFound;
}

}  // namespace

std::vector<Command> ConfigCommands() {
  return {
      {"config check",
       "",
       "looks for faults in the files of folders and of the service's state",
       "Reads the two files, changes nothing, and prints a line for each fault: the file, the\n"
       "place in it as jq takes it, and what is wrong there. A single bad record keeps the whole\n"
       "list from loading. Also told: folders of shares that are gone, folders that are not there\n"
       "or may not be indexed, and values of a wrong type that are passed over.\n"
       "\n"
       "Exit status 0 when nothing is wrong, 1 when something is.\n"
       "\n"
       "  fileindex config check --json | jq -r .place\n",
       {{"--json", nullptr, "one JSON object a line: file, place, what"}},
       {},
       0,
       0,
       Check},
  };
}

}  // namespace vexlo::cli
