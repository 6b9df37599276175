// Pages for man(7): requests of roff, written so that groff and mandoc show the same.
#include <algorithm>
#include <cctype>
#include <sstream>
#include <string_view>

#include "cli/manual/manual.h"
#include "cli/text.h"

namespace vexlo::cli::manual {
namespace {

// The text as roff shows it unchanged: no character of it is a request or an escape.
std::string Escaped(std::string_view text) {
  std::string escaped;
  escaped.reserve(text.size() + 16);
  for (const char character : text) {
    switch (character) {
      case '\\':
        escaped += "\\e";
        break;
      case '-':
        escaped += "\\-";
        break;
      case '\'':
        escaped += "\\(aq";
        break;
      case '`':
        escaped += "\\(ga";
        break;
      case '^':
        escaped += "\\(ha";
        break;
      case '~':
        escaped += "\\(ti";
        break;
      default:
        escaped += character;
    }
  }
  if (escaped.starts_with('.')) {
    escaped.insert(0, "\\&");
  }
  return escaped;
}

std::string Trimmed(std::string_view text) {
  const size_t begin = text.find_first_not_of(' ');
  return begin == std::string_view::npos
             ? ""
             : std::string(text.substr(begin, text.find_last_not_of(' ') - begin + 1));
}

std::string OneLine(std::string text) {
  std::replace(text.begin(), text.end(), '\n', ' ');
  return Trimmed(text);
}

// Without its full stop. A stop inside of a word, as in a file name, ends none.
std::string FirstSentence(std::string_view text) {
  size_t end = 0;
  while (end < text.size() && (text[end] != '.' || (end + 1 < text.size() && text[end + 1] != ' ' &&
                                                    text[end + 1] != '\n'))) {
    ++end;
  }
  return std::string(text.substr(0, end));
}

void Begin(std::ostream& page, const std::string& name, int section, std::string_view summary) {
  page << ".\\\" Made from what the program and its headers say of themselves.\n.TH \""
       << Escaped(name) << "\" \"" << section << "\" \"\" \"fileindex " << FILEINDEX_VERSION
       << "\" \"fileindex\"\n.SH NAME\n"
       << Escaped(name) << " \\- " << Escaped(summary) << "\n";
}

void PutExample(std::ostream& page, std::string_view line, bool& in_example) {
  if (!in_example) {
    page << ".PP\n.EX\n";
    in_example = true;
  }
  page << Escaped(line) << "\n";
}

void EndExample(std::ostream& page, bool& in_example) {
  if (in_example) {
    page << ".EE\n";
    in_example = false;
  }
}

// Paragraphs; lines that begin with two blanks are examples and keep their breaks. Right below a
// heading the first paragraph needs no request.
void PutText(std::ostream& page, std::string_view text, bool below_heading) {
  bool in_example = false;
  bool new_paragraph = !below_heading;
  for (const std::string& line : Split(text, '\n')) {
    if (line.starts_with("  ")) {
      PutExample(page, line, in_example);
      below_heading = false;
      new_paragraph = true;
    } else if (line.empty()) {
      new_paragraph = new_paragraph || !below_heading;
    } else {
      EndExample(page, in_example);
      page << (new_paragraph ? ".PP\n" : "") << Escaped(line) << "\n";
      new_paragraph = false;
      below_heading = false;
    }
  }
  EndExample(page, in_example);
}

void PutOption(std::ostream& page, const std::string& name, std::string_view value,
               std::string_view help) {
  page << ".TP\n\\fB" << Escaped(name) << "\\fR";
  if (!value.empty()) {
    page << " \\fI" << Escaped(value) << "\\fR";
  }
  page << "\n" << Escaped(help) << "\n";
}

// What follows "usage: ".
std::string Usage(const Command& command) {
  std::ostringstream usage;
  PrintUsage(usage, command);
  const std::string line = usage.str();
  return Trimmed(Split(line.substr(line.find(' ')), '\n').front());
}

std::string FirstWord(const Command& command) { return Split(command.name, ' ').front(); }

void PutCommand(std::ostream& page, const Command& command) {
  std::string summary = command.summary;
  summary.front() = static_cast<char>(toupper(static_cast<unsigned char>(summary.front())));
  page << Escaped(summary) << ".\n";
  PutText(page, command.details, /*below_heading=*/false);
  page << ".PP\nOptions:\n";
  for (const Option& option : command.options) {
    PutOption(page, option.name, option.value == nullptr ? "" : option.value, option.help);
  }
  PutOption(page, kHelpOption.name, "", kHelpOption.help);
}

std::string FamilyPage(const std::string& word, const std::vector<const Command*>& family) {
  std::ostringstream page;
  std::string summary = family.front()->summary;
  for (size_t at = 1; at < family.size(); ++at) {
    summary += std::string("; ") + family[at]->summary;
  }
  Begin(page, "fileindex-" + word, 1, summary);
  page << ".SH SYNOPSIS\n";
  for (const Command* const command : family) {
    page << (command == family.front() ? "" : ".br\n") << Escaped(Usage(*command)) << "\n";
  }
  if (family.size() == 1) {
    page << ".SH DESCRIPTION\n";
    PutCommand(page, *family.front());
  } else {
    page << ".SH COMMANDS\n";
    for (const Command* const command : family) {
      page << ".SS " << Escaped(command->name) << "\n";
      PutCommand(page, *command);
    }
  }
  page << ".SH EXIT STATUS\n" << kExitStatusHelp << ".\n.SH SEE ALSO\n\\fBfileindex\\fR(1)\n";
  return page.str();
}

std::string OverviewPage(const std::vector<Command>& commands) {
  std::ostringstream page;
  Begin(page, "fileindex", 1, "keeps folders searchable, and shows what its daemons do");
  page << ".SH SYNOPSIS\n\\fBfileindex\\fR \\fICOMMAND\\fR [\\fIARGUMENTS\\fR]\n"
          ".SH DESCRIPTION\n"
       << kToolSummary << "\n.SH COMMANDS\n";
  for (const Command& command : commands) {
    page << ".TP\n\\fB" << Escaped(command.name) << "\\fR\n"
         << Escaped(command.summary) << "; \\fBfileindex\\-" << Escaped(FirstWord(command))
         << "\\fR(1)\n";
  }
  page << ".SH EXIT STATUS\n"
       << kExitStatusHelp
       << ".\n.SH SEE ALSO\n\\fBevnotifyd\\fR(8), \\fBfileindexd\\fR(8), \\fBkavoelasticd\\fR(8), "
          "\\fBkavocontentextractd\\fR(8), \\fBfileindex\\-engine\\fR(5), "
          "\\fBfileindex\\-queue\\fR(5)\n";
  return page.str();
}

}  // namespace

Pages ToolPages(const std::vector<Command>& commands) {
  std::map<std::string, std::vector<const Command*>> families;
  for (const Command& command : commands) {
    families[FirstWord(command)].push_back(&command);
  }
  Pages pages;
  pages["fileindex.1"] = OverviewPage(commands);
  for (const auto& [word, family] : families) {
    pages["fileindex-" + word + ".1"] = FamilyPage(word, family);
  }
  return pages;
}

std::string DaemonPage(const std::string& name, const std::string& help) {
  const std::vector<std::string> lines = Split(help, '\n');
  const std::string usage_mark = "usage: ";
  if (!lines[0].starts_with(usage_mark + name)) {
    throw Failure("the help of " + name + " does not begin with its usage");
  }
  const std::string exit_mark = "exit status: ";
  std::string description;
  std::ostringstream options;
  std::string exit_status;
  for (size_t at = 1; at < lines.size(); ++at) {
    const std::string& line = lines[at];
    const std::string text = Trimmed(line);
    if (line.starts_with("  --")) {
      const size_t gap = text.find("  ");
      const std::vector<std::string> words = Split(text.substr(0, gap), ' ');
      PutOption(options, words[0], words.size() > 1 ? words[1] : "",
                gap == std::string::npos ? "" : Trimmed(text.substr(gap)));
    } else if (line.starts_with("  ")) {
      options << Escaped(text) << "\n";
    } else if (line.starts_with(exit_mark)) {
      exit_status = line.substr(exit_mark.size());
    } else {
      description += line + "\n";
    }
  }
  if (exit_status.empty()) {
    throw Failure("the help of " + name + " does not say its exit status");
  }
  std::ostringstream page;
  const size_t first_word = description.find_first_not_of('\n');
  Begin(page, name, 8, OneLine(FirstSentence(description.substr(first_word))));
  page << ".SH SYNOPSIS\n" << Escaped(lines[0].substr(usage_mark.size())) << "\n.SH DESCRIPTION\n";
  PutText(page, description, /*below_heading=*/true);
  if (!options.str().empty()) {
    page << ".SH OPTIONS\n" << options.str();
  }
  page << ".SH EXIT STATUS\n"
       << Escaped(exit_status)
       << ".\n.SH SIGNALS\nSIGTERM and SIGINT end it in order. It may be killed and started again "
          "at "
          "any\nmoment.\n.SH ENVIRONMENT\n.TP\n\\fBNOTIFY_SOCKET\\fR\nWhere the service manager is "
          "told when it is ready.\n.SH SEE ALSO\n\\fBfileindex\\fR(1)\n";
  return page.str();
}

std::string HeaderPageName(const std::string& spelling) {
  const std::string stem = spelling.substr(0, spelling.rfind('.'));
  std::string name = stem.starts_with("fileindex/") ? stem : "fileindex/" + stem;
  for (char& character : name) {
    character = character == '/' ? '_' : character;
  }
  return name;
}

std::string HeaderPage(const std::string& spelling, const std::string& text) {
  std::string description;
  std::string declarations;
  bool top = true;
  for (const std::string& line : Split(text, '\n')) {
    if (top && line.starts_with("//")) {
      description += Trimmed(line.substr(2)) + "\n";
      continue;
    }
    top = false;
    if (!line.starts_with("#")) {  // Guards and includes.
      declarations += line + "\n";
    }
  }
  std::ostringstream page;
  Begin(page, HeaderPageName(spelling), 3, OneLine(FirstSentence(description)));
  page << ".SH SYNOPSIS\n.EX\n#include <" << Escaped(spelling) << ">\n.EE\n.SH DESCRIPTION\n";
  PutText(page, description, /*below_heading=*/true);
  page << ".SH DECLARATIONS\n.EX\n";
  bool blank = true;
  for (const std::string& line : Split(declarations, '\n')) {
    if (!line.empty() || !blank) {
      page << Escaped(line) << "\n";
    }
    blank = line.empty();
  }
  page << ".EE\n.SH SEE ALSO\n\\fBfileindex\\fR(3)\n";
  return page.str();
}

}  // namespace vexlo::cli::manual
