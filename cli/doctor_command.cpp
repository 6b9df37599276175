// "fileindex doctor": what keeps this machine from indexing, and what helps.
#include <json/value.h>

#include <iomanip>

#include "cli/command.h"
#include "cli/doctor.h"
#include "cli/text.h"
#include "common/json.h"

namespace vexlo::cli {
namespace {

constexpr int kSeverityColumn = 9;

void Print(const Console& console, const Finding& finding, bool as_json) {
  if (as_json) {
    Json::Value line;
    line["severity"] = NameOf(finding.severity);
    line["subject"] = finding.subject;
    line["what"] = finding.what;
    line["remedy"] = finding.remedy;
    console.out << JsonToString(line) << "\n";
    return;
  }
  console.out << std::left << std::setw(kSeverityColumn) << NameOf(finding.severity)
              << finding.subject << ": " << ForTerminal(finding.what) << "\n";
  if (!finding.remedy.empty()) {
    console.out << std::string(kSeverityColumn, ' ') << "$ " << ForTerminal(finding.remedy) << "\n";
  }
}

ExitStatus RunDoctor(const Arguments& arguments, const Console& console) {
  uint64_t errors = 0;
  uint64_t warnings = 0;
  for (const Finding& finding : Diagnose()) {
    errors += finding.severity == Severity::kError ? 1 : 0;
    warnings += finding.severity == Severity::kWarning ? 1 : 0;
    Print(console, finding, arguments.Has("--json"));
  }
  console.out.flush();
  console.err << Counted(errors, "error") << ", " << Counted(warnings, "warning") << "\n";
  return errors + warnings == 0 ? kDone : kNothingFound;
}

}  // namespace

std::vector<Command> DoctorCommands() {
  return {
      {"doctor",
       "",
       "looks for what keeps files from being indexed",
       "Looks at the daemons, the limits of the kernel, mounts, permissions, disks, settings and\n"
       "states, changes nothing, and prints a line for each finding: \"error\", \"warning\" or\n"
       "\"ok\", what was looked at, and what was found. The line below it is a command that "
       "helps,\n"
       "where there is one; look at it before you give it.\n"
       "\n"
       "Exit status 0 when there is nothing to do, 1 when there are errors or warnings.\n"
       "\n"
       "  fileindex doctor --json | jq -r 'select(.severity == \"error\").what'\n",
       {{"--json", nullptr, "one JSON object a line: severity, subject, what, remedy"}},
       {},
       0,
       0,
       RunDoctor},
  };
}

}  // namespace vexlo::cli
