// Writes the manual pages and completions at build time.
//
//   fileindex_manual tool FOLDER                 the tool's pages (1)
//   fileindex_manual completions FOLDER
//   fileindex_manual daemon NAME FOLDER          its page (8); the help comes on standard input
//   fileindex_manual header SPELLING FILE FOLDER its page (3)
#include <fstream>
#include <iostream>
#include <iterator>

#include "cli/manual/manual.h"

namespace {

using vexlo::cli::Failure;
using vexlo::cli::manual::Pages;

std::string ReadAll(std::istream& from) {
  return {std::istreambuf_iterator<char>(from), std::istreambuf_iterator<char>()};
}

Pages Make(const std::vector<std::string>& words) {
  namespace manual = vexlo::cli::manual;
  if (words.size() == 2 && words[0] == "tool") {
    return manual::ToolPages(vexlo::cli::AllCommands());
  }
  if (words.size() == 2 && words[0] == "completions") {
    return manual::Completions(vexlo::cli::AllCommands());
  }
  if (words.size() == 3 && words[0] == "daemon") {
    return {{words[1] + ".8", manual::DaemonPage(words[1], ReadAll(std::cin))}};
  }
  if (words.size() == 4 && words[0] == "header") {
    std::ifstream file(words[2]);
    const std::string text = ReadAll(file);
    if (!file || text.empty()) {
      throw Failure("reading failed, path=" + words[2]);
    }
    return {{manual::HeaderPageName(words[1]) + ".3", manual::HeaderPage(words[1], text)}};
  }
  throw Failure("wrong usage; the source says what is right");
}

}  // namespace

int main(int argc, char** argv) {
  const std::vector<std::string> words(argv + 1, argv + argc);
  try {
    for (const auto& [name, text] : Make(words)) {
      std::ofstream file(words.back() + "/" + name, std::ios::binary);
      file << text;
      file.close();
      if (!file) {
        throw Failure("writing failed, path=" + words.back() + "/" + name);
      }
    }
  } catch (const std::exception& error) {
    std::cerr << "fileindex_manual: " << error.what() << "\n";
    return 1;
  }
  return 0;
}
