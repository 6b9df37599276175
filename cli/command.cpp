#include "cli/command.h"

#include <algorithm>
#include <cstring>
#include <functional>
#include <iomanip>
#include <optional>
#include <utility>

#include "cli/text.h"
#include "common/error.h"
#include "kavo/local/shares.h"

namespace vexlo::cli {
namespace {

constexpr const char* kName = "fileindex";
constexpr int kOptionColumn = 22;

void PrintOption(std::ostream& out, const Option& option) {
  const std::string value = option.value == nullptr ? "" : std::string(" ") + option.value;
  out << "  " << std::left << std::setw(kOptionColumn) << option.name + value << option.help
      << "\n";
}

bool IsRequired(const Command& command, const Option& option) {
  return std::any_of(command.required_options.begin(), command.required_options.end(),
                     [&](const char* name) { return strcmp(name, option.name) == 0; });
}

// How many of the words name the command: all of its name's, or 0.
size_t MatchName(const Command& command, const std::vector<std::string>& words) {
  size_t count = 0;
  for (const std::string& part : Split(command.name, ' ')) {
    if (count >= words.size() || words[count] != part) {
      return 0;
    }
    ++count;
  }
  return count;
}

const Option* FindOption(const Command& command, const std::string& name) {
  const auto found = std::find_if(command.options.begin(), command.options.end(),
                                  [&](const Option& option) { return name == option.name; });
  return found == command.options.end() ? nullptr : &*found;
}

// Takes the option at words[at]; returns how many words it used.
size_t TakeOption(const Command& command, const std::vector<std::string>& words, size_t at,
                  Arguments& arguments) {
  const size_t equals = words[at].find('=');
  const std::string name = words[at].substr(0, equals);
  const Option* const option = FindOption(command, name);
  if (option == nullptr) {
    throw UsageError("there is no option '" + name + "'");
  }
  if (option->value != nullptr && arguments.Has(name)) {
    throw UsageError("the option " + name + " was given more than once");
  }
  if (option->value == nullptr) {
    if (equals != std::string::npos) {
      throw UsageError("the option " + name + " takes no value");
    }
    arguments.options[name] = "";
    return 1;
  }
  if (equals != std::string::npos) {
    arguments.options[name] = words[at].substr(equals + 1);
    return 1;
  }
  if (at + 1 == words.size()) {
    throw UsageError("the option " + name + " wants a value, " + option->value);
  }
  arguments.options[name] = words[at + 1];
  return 2;
}

// None when the words ask for help.
std::optional<Arguments> ReadArguments(const Command& command,
                                       const std::vector<std::string>& words) {
  Arguments arguments;
  bool options_end = false;
  for (size_t at = 0; at < words.size();) {
    const std::string& word = words[at];
    if (options_end || !word.starts_with("-") || word == "-") {
      arguments.positional.push_back(word);
      ++at;
    } else if (word == "--") {
      options_end = true;
      ++at;
    } else if (word == "--help" || word == "-h") {
      return std::nullopt;
    } else {
      at += TakeOption(command, words, at, arguments);
    }
  }
  const size_t count = arguments.positional.size();
  if (count < command.fewest) {
    throw UsageError(std::string("wants ") + command.arguments);
  }
  if (count > command.most) {
    throw UsageError("'" + arguments.positional[command.most] + "' is one argument too many");
  }
  for (const char* const name : command.required_options) {
    if (!arguments.Has(name)) {
      throw UsageError(std::string("wants the option ") + name + " " +
                       FindOption(command, name)->value);
    }
  }
  return arguments;
}

// Throws Failure when what was said cannot be written.
void FlushOutput(const Console& console) {
  console.out.flush();
  if (!console.out) {
    throw Failure("the output cannot be written");
  }
}

ExitStatus RunCommand(const Command& command, const std::vector<std::string>& words,
                      const Console& console) {
  try {
    const std::optional<Arguments> arguments = ReadArguments(command, words);
    if (!arguments.has_value()) {
      PrintHelp(console.out, command);
      FlushOutput(console);
      return kDone;
    }
    if (const std::string fault = kavo::local::RootFault(); !fault.empty()) {
      throw Failure(fault);
    }
    const ExitStatus status = command.run(*arguments, console);
    FlushOutput(console);
    return status;
  } catch (const UsageError& error) {
    console.err << kName << " " << command.name << ": " << error.what() << "\n";
    PrintUsage(console.err, command);
    return kBadUsage;
  } catch (const Error& error) {
    console.err << kName << ": " << TextOf(error) << "\n";
    return kFailed;
  } catch (const std::exception& error) {
    console.err << kName << ": " << ForTerminal(error.what()) << "\n";
    return kFailed;
  }
}

// What is no command's.
ExitStatus Print(const Console& console, const std::function<void()>& print) {
  try {
    print();
    FlushOutput(console);
    return kDone;
  } catch (const Failure& failure) {
    console.err << kName << ": " << failure.what() << "\n";
    return kFailed;
  }
}

}  // namespace

const char* const kToolSummary = "Turns changes in folders into the least work for a search index.";
const char* const kExitStatusHelp =
    "0 done (or yes), 1 nothing found (or no), 2 wrong usage, 3 failed";
const Option kHelpOption = {"--help", nullptr, "show this help"};

void PrintOverview(std::ostream& out, const std::vector<Command>& commands) {
  out << "usage: " << kName << " COMMAND [ARGUMENTS]\n\n" << kToolSummary << "\n\ncommands:\n";
  for (const Command& command : commands) {
    out << "  " << std::left << std::setw(kOptionColumn) << command.name << command.summary << "\n";
  }
  out << "\n  " << std::setw(kOptionColumn) << "COMMAND --help"
      << "explains a command\n  " << std::setw(kOptionColumn) << "--version"
      << "prints the version\n\n"
      << "exit status: " << kExitStatusHelp << "\n";
}

void PrintUsage(std::ostream& out, const Command& command) {
  out << "usage: " << kName << " " << command.name;
  for (const Option& option : command.options) {
    const bool required = IsRequired(command, option);
    out << (required ? " " : " [") << option.name
        << (option.value == nullptr ? "" : std::string(" ") + option.value)
        << (required ? "" : "]");
  }
  out << (*command.arguments == '\0' ? "" : " ") << command.arguments << "\n";
}

void PrintHelp(std::ostream& out, const Command& command) {
  PrintUsage(out, command);
  out << "\n" << command.summary << "\n\n" << command.details << "\noptions:\n";
  for (const Option& option : command.options) {
    PrintOption(out, option);
  }
  PrintOption(out, kHelpOption);
}

std::string Arguments::Get(const std::string& option) const {
  const auto found = options.find(option);
  return found == options.end() ? "" : found->second;
}

ExitStatus Run(const std::vector<Command>& commands, const std::vector<std::string>& words,
               const Console& console) {
  if (words.empty()) {
    PrintOverview(console.err, commands);
    return kBadUsage;
  }
  if (words[0] == "--help" || words[0] == "-h" || words[0] == "help") {
    return Print(console, [&] { PrintOverview(console.out, commands); });
  }
  if (words[0] == "--version") {
    return Print(console, [&] { console.out << kName << " " << FILEINDEX_VERSION << "\n"; });
  }
  for (const Command& command : commands) {
    if (const size_t used = MatchName(command, words); used > 0) {
      return RunCommand(command, {words.begin() + static_cast<ptrdiff_t>(used), words.end()},
                        console);
    }
  }
  console.err << kName << ": there is no command '" << words[0]
              << (words.size() > 1 && !words[1].starts_with("-") ? " " + words[1] : "") << "'; '"
              << kName << " --help' lists them\n";
  return kBadUsage;
}

}  // namespace vexlo::cli
