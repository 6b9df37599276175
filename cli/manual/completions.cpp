// Shell completions: commands, their options, and what an argument or an option's value is, as far
// as its placeholder tells.
#include <cstring>
#include <set>
#include <sstream>
#include <string_view>

#include "cli/manual/manual.h"
#include "cli/text.h"

namespace vexlo::cli::manual {
namespace {

// The shares' names, one a line; nothing where there is no shares file.
constexpr char kShareNames[] =
    "fileindex share list --json 2>/dev/null | sed -n 's/.*\"name\":\"\\([^\"\\\\]*\\)\".*/\\1/p'";

enum class Kind { kWord, kFile, kFolder, kShare };

Kind KindOf(std::string_view placeholder) {
  for (const auto& [begin, kind] :
       {std::pair("SHARE", Kind::kShare), std::pair("[FOLDER", Kind::kFolder),
        std::pair("FOLDER", Kind::kFolder), std::pair("[DIR", Kind::kFolder),
        std::pair("DIR", Kind::kFolder), std::pair("FILE", Kind::kFile),
        std::pair("PATH", Kind::kFile), std::pair("EVENT PATH", Kind::kFile)}) {
    if (placeholder.starts_with(begin)) {
      return kind;
    }
  }
  return Kind::kWord;
}

// Inside single quotes of any of the three shells; apostrophes are spelled otherwise.
std::string Quotable(std::string_view text) {
  std::string quotable;
  quotable.reserve(text.size());
  for (const char character : text) {
    if (character == '\'') {
      quotable += "\xe2\x80\x99";
    } else if (character == '[' || character == ']' || character == ':') {
      quotable += ' ';  // These mean something to zsh.
    } else {
      quotable += character;
    }
  }
  return quotable;
}

std::string BashValues(Kind kind) {
  switch (kind) {
    case Kind::kFile:
      return "compopt -o filenames; mapfile -t COMPREPLY < <(compgen -f -- \"$word\")";
    case Kind::kFolder:
      return "compopt -o filenames; mapfile -t COMPREPLY < <(compgen -d -- \"$word\")";
    case Kind::kShare:
      return "_fileindex_complete_share \"$word\"";
    default:
      return ":";
  }
}

std::string Bash(const std::vector<Command>& commands) {
  std::ostringstream script;
  script << "# Completes fileindex in bash.\n_fileindex_shares() {\n  " << kShareNames
         << "\n}\n\n"
            "# A share's name is one word, whatever it holds.\n"
            "_fileindex_complete_share() {\n"
            "  local share quoted\n"
            "  while read -r share; do\n"
            "    quoted=$(printf %q \"$share\")\n"
            "    if [[ $share == \"$1\"* || $quoted == \"$1\"* ]]; then\n"
            "      COMPREPLY+=(\"$quoted\")\n"
            "    fi\n"
            "  done < <(_fileindex_shares)\n"
            "}\n\n_fileindex() {\n"
            "  local word=${COMP_WORDS[COMP_CWORD]} before=${COMP_WORDS[COMP_CWORD-1]} command\n"
            "  COMPREPLY=()\n"
            "  for command in \"${COMP_WORDS[*]:1:2}\" \"${COMP_WORDS[1]-}\"; do\n"
            "    ((COMP_CWORD > $(wc -w <<<\"$command\"))) || continue\n"
            "    case $command in\n";
  std::string names;
  for (const Command& command : commands) {
    names += std::string(command.name) + "\n";
    script << "      '" << command.name << "')\n        case $before in\n";
    std::string options = kHelpOption.name;
    for (const Option& option : command.options) {
      options += std::string(" ") + option.name;
      if (option.value != nullptr) {
        script << "          " << option.name << ") " << BashValues(KindOf(option.value))
               << "; return ;;\n";
      }
    }
    script << "        esac\n        if [[ $word == -* ]]; then\n"
              "          mapfile -t COMPREPLY < <(compgen -W '"
           << options << "' -- \"$word\")\n        else\n          "
           << BashValues(KindOf(command.arguments)) << "\n        fi\n        return ;;\n";
  }
  script
      << "    esac\n  done\n"
         "  # A command's name, of one word or two: what is behind the words that stand already.\n"
         "  local typed=\"${COMP_WORDS[*]:1:COMP_CWORD-1}\" name\n"
         "  while read -r name; do\n"
         "    if [[ -z $typed ]]; then\n      name=${name%% *}\n"
         "    elif [[ $name == \"$typed \"* ]]; then\n      name=${name#\"$typed \"}\n"
         "    else\n      continue\n    fi\n"
         "    if [[ $name == \"$word\"* && \" ${COMPREPLY[*]} \" != *\" $name \"* ]]; then\n      "
         "COMPREPLY+=(\"$name\")\n    fi\n"
         "  done <<'NAMES'\n"
      << names << "NAMES\n}\ncomplete -F _fileindex fileindex\n";
  return script.str();
}

std::string ZshAction(std::string_view placeholder) {
  switch (KindOf(placeholder)) {
    case Kind::kFile:
      return "_files";
    case Kind::kFolder:
      return "_files -/";
    case Kind::kShare:
      return "_fileindex_shares";
    default:
      return " ";
  }
}

std::string Zsh(const std::vector<Command>& commands) {
  std::ostringstream script;
  script << "#compdef fileindex\n# Completes fileindex in zsh.\n_fileindex_shares() {\n"
            "  local -a shares\n  shares=(${(f)\"$("
         << kShareNames
         << ")\"})\n  compadd -a shares\n}\n\n_fileindex() {\n"
            "  local -a first second\n"
            "  local command\n"
            "  for command in \"$words[2] $words[3]\" \"$words[2]\"; do\n"
            "    (( CURRENT > 1 + ${#${=command}} )) || continue\n"
            "    case $command in\n";
  std::map<std::string, std::string> first;   // By first word: its summary, of the first command.
  std::map<std::string, std::string> second;  // By first word: "word:summary" of the second ones.
  for (const Command& command : commands) {
    const std::vector<std::string> words = Split(command.name, ' ');
    const std::string summary = Quotable(command.summary);
    first.emplace(words[0], summary);
    if (words.size() > 1) {
      second[words[0]] += " '" + words[1] + ":" + summary + "'";
    }
    script << "      '" << command.name << "')\n        shift " << words.size()
           << " words; (( CURRENT -= " << words.size() << " ))\n        _arguments";
    for (const Option& option : command.options) {
      script << " \\\n          '" << option.name << "[" << Quotable(option.help) << "]";
      if (option.value != nullptr) {
        script << ":" << option.value << ":" << ZshAction(option.value);
      }
      script << "'";
    }
    script << " \\\n          '" << kHelpOption.name << "[" << kHelpOption.help << "]'";
    if (command.most > 0) {
      script << " \\\n          '*:" << Quotable(command.arguments) << ":"
             << ZshAction(command.arguments) << "'";
    }
    script << "\n        return ;;\n";
  }
  script << "    esac\n  done\n  if (( CURRENT == 2 )); then\n    first=(";
  for (const auto& [word, summary] : first) {
    script << " '" << word << ":" << summary << "'";
  }
  script
      << ")\n    _describe command first\n  elif (( CURRENT == 3 )); then\n    case $words[2] in\n";
  for (const auto& [word, described] : second) {
    script << "      " << word << ") second=(" << described << ") ;;\n";
  }
  script << "    esac\n    _describe command second\n  fi\n}\n_fileindex \"$@\"\n";
  return script.str();
}

std::string FishValues(std::string_view placeholder) {
  switch (KindOf(placeholder)) {
    case Kind::kFile:
      return " -F";
    case Kind::kFolder:
      return " -a '(__fish_complete_directories)'";
    case Kind::kShare:
      return " -a '(__fileindex_shares)'";
    default:
      return "";
  }
}

std::string Fish(const std::vector<Command>& commands) {
  std::ostringstream script;
  script << "# Completes fileindex in fish.\nfunction __fileindex_shares\n  " << kShareNames
         << "\nend\n\n# Whether the words so far begin with these.\nfunction __fileindex_is\n"
            "  set -l words (commandline -opc)\n"
            "  set -l last (math (count $argv) + 1)\n"
            "  test (count $words) -ge $last; and test \"$words[2..$last]\" = \"$argv\"\nend\n\n# "
            "Whether just these words stand behind the program's name.\n"
            "function __fileindex_only\n  set -l words (commandline -opc)\n"
            "  test \"$words[2..-1]\" = \"$argv\"; or test (count $words) -eq 1 -a -z \"$argv\"\n"
            "end\n\ncomplete -c fileindex -f\n";
  std::set<std::string> seen;
  for (const Command& command : commands) {
    const std::vector<std::string> words = Split(command.name, ' ');
    const std::string summary = Quotable(command.summary);
    if (words.size() > 1) {
      script << "complete -c fileindex -n '__fileindex_only " << words[0] << "' -a " << words[1]
             << " -d '" << summary << "'\n";
    }
    if (seen.insert(words[0]).second) {
      script << "complete -c fileindex -n '__fileindex_only' -a " << words[0] << " -d '"
             << (words.size() > 1 ? "" : summary) << "'\n";
    }
    const std::string condition =
        "complete -c fileindex -n '__fileindex_is " + std::string(command.name) + "'";
    for (const Option& option : command.options) {
      script << condition << (strlen(option.name) == 2 ? " -s " : " -l ")
             << std::string_view(option.name).substr(strlen(option.name) == 2 ? 1 : 2) << " -d '"
             << Quotable(option.help) << "'";
      if (option.value != nullptr) {
        const std::string values = FishValues(option.value);
        script << (values == " -F" ? " -r" : " -x") << values;
      }
      script << "\n";
    }
    if (const std::string values = FishValues(command.arguments); !values.empty()) {
      script << condition << values << "\n";
    }
  }
  return script.str();
}

}  // namespace

Pages Completions(const std::vector<Command>& commands) {
  return {{"_fileindex", Zsh(commands)},
          {"fileindex.bash", Bash(commands)},
          {"fileindex.fish", Fish(commands)}};
}

}  // namespace vexlo::cli::manual
