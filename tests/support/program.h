// A program as a person or a service manager runs it.
#ifndef SUPPORT_PROGRAM_H_
#define SUPPORT_PROGRAM_H_

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>

#include <cstdio>
#include <string>
#include <utility>

struct Program {
  // Takes the place of a shell that has run the commands before it.
  Program(const std::string& before, const std::string& command)
      : output(popen((before + "; echo $$; exec " + command).c_str(), "re")) {
    EXPECT_TRUE(Await("\n"));
    pid = std::stoi(std::exchange(text, ""));
  }

  // Reads on until the text holds `wanted`; false when it ends before.
  bool Await(const std::string& wanted) {
    for (int byte = 0; text.find(wanted) == std::string::npos;) {
      if ((byte = getc(output)) == EOF) {
        return false;
      }
      text += static_cast<char>(byte);
    }
    return true;
  }
  // Reads to the end, after a signal if it is one. The exit status; 128 and the signal that ended
  // it.
  int End(int signal = 0) {
    kill(pid, signal);
    EXPECT_FALSE(Await("what no program says"));
    const int status = pclose(output);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }

  FILE* output;
  pid_t pid = 0;
  std::string text;
};

#endif  // SUPPORT_PROGRAM_H_
