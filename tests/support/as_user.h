// What other users than the one that the tests run as see.
#ifndef SUPPORT_AS_USER_H_
#define SUPPORT_AS_USER_H_

#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <string>

#include "support/raw_client.h"

// What `ask` comes to in a process of that user, with a group of the same number and two further
// ones. Only root can start it.
inline std::string HearAs(uid_t uid, const std::function<std::string()>& ask) {
  int ends[2];
  EXPECT_EQ(pipe2(ends, O_CLOEXEC), 0);
  const pid_t child = fork();
  if (child == 0) {
    const gid_t groups[] = {uid + 1, uid + 2};
    const bool is_other =
        setgroups(2, groups) == 0 && setresgid(uid, uid, uid) == 0 && setresuid(uid, uid, uid) == 0;
    const std::string heard = is_other ? ask() : "<still the same user>";
    _exit(write(ends[1], heard.data(), heard.size()) < 0 ? 1 : 0);
  }
  close(ends[1]);
  const RawClient output(ends[0]);
  std::string heard(4096, '\0');
  const ssize_t count = read(output.fd, heard.data(), heard.size());
  heard.resize(count > 0 ? static_cast<size_t>(count) : 0);
  int status = 0;
  waitpid(child, &status, 0);
  return heard;
}

#endif  // SUPPORT_AS_USER_H_
