// Manual pages and shell completions, made from what the programs say of themselves with --help,
// and from the comments of headers. So they cannot disagree.
#ifndef CLI_MANUAL_MANUAL_H_
#define CLI_MANUAL_MANUAL_H_

#include <map>
#include <string>
#include <vector>

#include "cli/command.h"

namespace vexlo::cli::manual {

// File names ("fileindex-queue.1") and what is in them.
using Pages = std::map<std::string, std::string>;

// fileindex(1), and a page for each first word of the commands' names: fileindex-queue(1) has all
// of "queue show", "queue add" and so on.
Pages ToolPages(const std::vector<Command>& commands);

// NAME(8) from the text that the daemon prints with --help: a usage line, a paragraph, "  --option
// VALUE  what it does" lines, and sections of a heading with a colon.
std::string DaemonPage(const std::string& name, const std::string& help);

// fileindex_STEM(3) of an installed header, spelled as in an #include: its first comment, and its
// declarations with their comments as they stand.
std::string HeaderPage(const std::string& spelling, const std::string& text);
std::string HeaderPageName(const std::string& spelling);

// The files fileindex.bash, _fileindex (zsh) and fileindex.fish.
Pages Completions(const std::vector<Command>& commands);

}  // namespace vexlo::cli::manual

#endif  // CLI_MANUAL_MANUAL_H_
