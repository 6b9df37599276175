// The tool's commands as a table, and what they share.
#ifndef CLI_COMMAND_H_
#define CLI_COMMAND_H_

#include <cstddef>
#include <map>
#include <ostream>
#include <stdexcept>
#include <string>
#include <vector>

namespace vexlo::cli {

// Exit statuses of the tool. Scripts test them: never renumber.
enum ExitStatus : int {
  kDone = 0,
  kNothingFound = 1,  // Also the "no" of a question.
  kBadUsage = 2,
  kFailed = 3,
};

struct Console {
  std::ostream& out;
  std::ostream& err;
  bool out_is_terminal;
  bool err_is_terminal;
};

// Thrown by handlers; the message is one sentence for people, without the tool's name.
class UsageError : public std::runtime_error {
  using std::runtime_error::runtime_error;
};
class Failure : public std::runtime_error {
  using std::runtime_error::runtime_error;
};

struct Option {
  const char* name;   // "--interval"
  const char* value;  // "SECONDS", or null for a switch.
  const char* help;
};

// What --help, which every command has, says of itself.
extern const Option kHelpOption;

struct Arguments {
  std::vector<std::string> positional;
  std::map<std::string, std::string> options;  // By name; the value of a switch is empty.

  bool Has(const std::string& option) const { return options.contains(option); }
  // "" when it was not given.
  std::string Get(const std::string& option) const;
};

struct Command {
  const char* name;       // "queue show"
  const char* arguments;  // "FILE"
  const char* summary;    // One line.
  const char* details;    // Paragraphs and examples for --help.
  std::vector<Option> options;
  std::vector<const char*> required_options;
  size_t fewest;  // Positional arguments.
  size_t most;
  ExitStatus (*run)(const Arguments& arguments, const Console& console);
};

// One a command family.
std::vector<Command> AuditCommands();
std::vector<Command> ConfigCommands();
std::vector<Command> DoctorCommands();
std::vector<Command> ExplainCommands();
std::vector<Command> ExtractCommands();
std::vector<Command> FailedCommands();
std::vector<Command> FolderCommands();
std::vector<Command> IndexCommands();
std::vector<Command> MetricsCommands();
std::vector<Command> PauseCommands();
std::vector<Command> QueueCommands();
std::vector<Command> SearchCommands();
std::vector<Command> ShareCommands();
std::vector<Command> StatusCommands();
std::vector<Command> UpCommands();
std::vector<Command> WatchCommands();
std::vector<Command> WebCommands();

// All of them, in the order of the overview.
std::vector<Command> AllCommands();

// Of the tool, and of every command: "0 done (or yes), ...".
extern const char* const kToolSummary;
extern const char* const kExitStatusHelp;

// What --help shows, of the tool and of one command; and the line "usage: ..." alone.
void PrintOverview(std::ostream& out, const std::vector<Command>& commands);
void PrintHelp(std::ostream& out, const Command& command);
void PrintUsage(std::ostream& out, const Command& command);

// Finds the command, reads its arguments and runs it. `words` are the program's arguments without
// its own name. Errors go to `console.err` as one sentence.
ExitStatus Run(const std::vector<Command>& commands, const std::vector<std::string>& words,
               const Console& console);

}  // namespace vexlo::cli

#endif  // CLI_COMMAND_H_
