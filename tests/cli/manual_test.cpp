// Manual pages and completions, judged by the programs that read them.
#include "cli/manual/manual.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>

#include "support/temp_folder.h"

namespace vexlo::cli::manual {
namespace {

void Write(const Pages& pages, const std::string& folder) {
  for (const auto& [name, text] : pages) {
    std::ofstream(folder + "/" + name, std::ios::binary) << text;
  }
}

// What the shell command prints, errors too.
std::string Output(const std::string& command) {
  FILE* const pipe = popen(("{ " + command + "; } 2>&1").c_str(), "re");
  std::string output;
  for (int byte = 0; (byte = getc(pipe)) != EOF;) {
    output += static_cast<char>(byte);
  }
  pclose(pipe);
  return output;
}

bool IsInstalled(const std::string& program) { return !Output("command -v " + program).empty(); }

TEST(ManualTest, PagesHaveAllCommandsAndNoFaults) {
  const TempFolder folder;
  const std::vector<Command> commands = AllCommands();
  Pages pages = ToolPages(commands);
  pages["tricky.3"] = HeaderPage(
      "fileindex/tricky.h", "// What .this is: 'odd'. See a.h \\n.\n\n// .TH \\fB\nint\n.x;\n");
  pages["d.8"] = DaemonPage("d",
                            "usage: d [--n N]\n\nServes. Well.\n\n  --n N  how many,\n         at "
                            "most\n\nexit status: 0 fine\n");
  for (const Command& command : commands) {
    const std::string word =
        std::string(command.name).substr(0, std::string(command.name).find(' '));
    ASSERT_TRUE(pages.contains("fileindex-" + word + ".1")) << command.name;
    for (const Option& option : command.options) {
      std::string escaped;
      for (const char* at = option.name; *at != '\0'; ++at) {
        escaped += *at == '-' ? "\\-" : std::string(1, *at);
      }
      EXPECT_NE(pages["fileindex-" + word + ".1"].find("\n\\fB" + escaped + "\\fR"),
                std::string::npos)
          << command.name << " " << option.name;
    }
  }
  Write(pages, folder.Path());
  ASSERT_TRUE(IsInstalled("groff"));
  EXPECT_EQ(Output("cd " + folder.Path() + " && groff -man -ww -z -Tutf8 *.[138]"), "");
  EXPECT_NE(Output("groff -man -Tascii -P-c " + folder.Path() + "/tricky.3").find("// .TH \\fB"),
            std::string::npos);
  EXPECT_THROW(DaemonPage("d", "usage: e\n\nexit status: 0 fine\n"), Failure);
  EXPECT_THROW(DaemonPage("d", "usage: d\n\nServes.\n"), Failure);
}

TEST(ManualTest, ShellsComplete) {
  const TempFolder folder;
  Write(Completions(AllCommands()), folder.Path());
  std::ofstream(folder.Path() + "/some file") << "";
  const struct {
    const char* words;  // The last one is what is being typed.
    const char* want;
  } cases[] = {
      {"qu", "queue"},
      {"queue ha", "has-reindex"},
      {"queue show --j", "--json"},
      {"search --sm", "--smaller"},
      {"search --below / x --sm", "--smaller"},
      {"queue show so", "some file"},
      {"search --sort so", ""},
  };
  const std::string fish = "source fileindex.fish; complete -C ";
  const auto in_bash = [&folder](const std::string& words) {
    return Output("cd " + folder.Path() +
                  " && PATH=.:$PATH bash -c 'compopt() { :; }; . ./fileindex.bash; "
                  "COMP_WORDS=(fileindex " +
                  words +
                  "); COMP_CWORD=$((${#COMP_WORDS[@]} - 1)); "
                  "_fileindex; echo -n \"${COMPREPLY[*]}\"'");
  };
  std::ofstream(folder.Path() + "/fileindex") << R"(echo '{"name":"my share"}{"x":1}')";
  Output("chmod +x " + folder.Path() + "/fileindex");
  EXPECT_EQ(in_bash("index create m"), "my\\ share");
  for (const auto& [words, want] : cases) {
    EXPECT_EQ(in_bash(words), want) << words;
    if (IsInstalled("fish")) {
      const std::string output =
          Output("cd " + folder.Path() + " && HOME=$PWD fish --no-config -c '" + fish +
                 "\"fileindex " + words + "\"'");
      EXPECT_TRUE(output.starts_with(want) && output.empty() == std::string(want).empty())
          << output;
    }
  }
  if (IsInstalled("zsh")) {
    EXPECT_EQ(Output("zsh -n " + folder.Path() + "/_fileindex"), "");
  }
}

}  // namespace
}  // namespace vexlo::cli::manual
