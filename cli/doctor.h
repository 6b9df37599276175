// What keeps the stack on this machine from indexing, and what helps.
#ifndef CLI_DOCTOR_H_
#define CLI_DOCTOR_H_

#include <string>
#include <vector>

namespace vexlo::cli {

enum class Severity {
  kOk,       // As it should be.
  kWarning,  // Works, but not for all or not for long.
  kError,    // Something is not indexed, or not searched.
};

// "ok", "warning", "error": printed, and so never renamed.
const char* NameOf(Severity severity);

struct Finding {
  Severity severity = Severity::kOk;
  std::string subject;  // One word: "fileindexd", "inotify", "space".
  std::string what;     // A sentence for people, without its full stop.
  std::string remedy;   // A command line; "" where there is none.
};

// Looks at everything and changes nothing. What cannot be looked at is a finding, too.
std::vector<Finding> Diagnose();

}  // namespace vexlo::cli

#endif  // CLI_DOCTOR_H_
