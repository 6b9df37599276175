// Runs a piece of work once for every call that may fail in it.
#ifndef FAULTS_EVERY_FAULT_H_
#define FAULTS_EVERY_FAULT_H_

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <filesystem>
#include <functional>
#include <random>
#include <string>

#include "faults/fail_nth.h"

struct FaultKind {
  const char* name;
  const char* calls;
  int error;  // 0: a transfer of one byte.
  bool may_last;
  bool is_harmless = false;  // Nothing may come of it.
};

inline constexpr FaultKind kFaultKinds[] = {
    {"FullDisk", ",open,write,truncate,mkdir,rename,sync,", ENOSPC, true},
    {"BrokenDisk", ",open,read,write,sync,rename,unlink,truncate,stat,readdir,mkdir,", EIO, true},
    {"NoDescriptor", ",open,socket,", EMFILE, true},
    {"Forbidden", ",open,stat,unlink,chmod,chown,", EACCES, true},
    {"NoLock", ",flock,", ENOLCK, true},
    {"NoPeer", ",connect,send,recv,", ECONNRESET, true},
    {"NoMemory", ",malloc,", ENOMEM, true},
    {"Interrupted", ",read,write,flock,", EINTR, false, /*is_harmless=*/true},
    {"Short", ",read,write,send,recv,", 0, true, /*is_harmless=*/true},
};

// FAULTS_STEP in the environment is the most by which the number of the failing call grows, 1 for
// each of them; FAULTS_SEED chooses.
inline unsigned FaultsFromEnvironment(const char* name, unsigned otherwise) {
  const char* const text = getenv(name);  // NOLINT(concurrency-mt-unsafe): one thread.
  if (text != nullptr) {
    std::from_chars(text, text + strlen(text), otherwise);
  }
  return otherwise;
}

inline size_t OpenDescriptors() {
  const std::filesystem::directory_iterator all("/proc/self/fd");
  return static_cast<size_t>(std::distance(begin(all), end(all)));
}

inline int CountFailures() {
  const auto* const result = testing::UnitTest::GetInstance()->current_test_info()->result();
  int failures = 0;
  for (int i = 0; i < result->total_part_count(); ++i) {
    failures += result->GetTestPartResult(i).failed() ? 1 : 0;
  }
  return failures;
}

// What a test says of one piece of work.
struct FaultyWork {
  const char* name;
  std::function<void()> prepare;  // In the parent: what is there before.
  std::function<bool()> run;      // False or an exception: it was not done.
  // Called without faults. Whether it was done (`done`) or not (the error), what is there has to be
  // right; `lasts` when all calls after the first failed, too.
  std::function<void(bool done, bool lasts)> judge;
  // Otherwise the process may end when there is no memory at all, as if it were killed.
  bool bears_lasting_no_memory = true;
};

// Bits of a child's exit status.
inline constexpr int kFailed = 1;
inline constexpr int kNotReached = 2;

// The part of RunWithEveryFault() in the process of its own, which ends here.
[[noreturn]] inline void RunInChild(const FaultyWork& work, const FailNth& order, bool is_harmless,
                                    unsigned seconds) {
  alarm(seconds);
  const int before = CountFailures();
  const size_t descriptors = OpenDescriptors();
  bool done = false;
  std::string reason;
  Arm(order);
  try {
    done = work.run();
  } catch (const std::exception& error) {
    Disarm();
    reason = error.what();
  }
  const char* const failed = Disarm();
  SCOPED_TRACE(std::string(failed == nullptr ? "nothing" : failed) + " failed; " +
               (done ? "done" : "not done: " + reason));
  EXPECT_TRUE(done || (failed != nullptr && !is_harmless));
  work.judge(done, order.lasting);
  EXPECT_EQ(OpenDescriptors(), descriptors);
  try {
    EXPECT_TRUE(work.run());
    work.judge(/*done=*/true, order.lasting);
  } catch (const std::exception& error) {
    ADD_FAILURE() << "when the fault is gone: " << error.what();
  }
  fflush(stdout);
  _exit((CountFailures() > before ? kFailed : 0) | (failed == nullptr ? kNotReached : 0));
}

// For every kind, once and lasting, and every N: in a process of its own, runs the work with the
// Nth call failing, judges, finds that no descriptor stays open, and that the work can be done in
// the same process once the fault is gone. A process that takes `seconds` is killed and a failure.
// Returns how many faults there were.
inline unsigned RunWithEveryFault(const FaultyWork& work, unsigned usual_step = 1,
                                  unsigned seconds = 60) {
  constexpr int kEnoughFailures = 5;
  std::minstd_rand random(FaultsFromEnvironment("FAULTS_SEED", 1));
  unsigned faults = 0;
  for (const FaultKind& kind : kFaultKinds) {
    const unsigned step =
        FaultsFromEnvironment("FAULTS_STEP", kind.error == ENOMEM ? 16 * usual_step : usual_step);
    const bool may_last = kind.may_last && (work.bears_lasting_no_memory || kind.error != ENOMEM);
    for (int lasts = 0; lasts <= (may_last ? 1 : 0); ++lasts) {
      int outcome = 0;
      int failures = 0;
      for (long at = 1; (outcome & kNotReached) == 0 && failures < kEnoughFailures;
           at += 1 + static_cast<long>(random() % std::max(step, 1U))) {
        SCOPED_TRACE(std::string(work.name) + ", " + kind.name + (lasts != 0 ? " lasting" : "") +
                     ", call " + std::to_string(at));
        work.prepare();
        fflush(stdout);
        const pid_t child = fork();
        if (child == 0) {
          RunInChild(work, {kind.calls, kind.error, at, lasts != 0}, kind.is_harmless, seconds);
        }
        int status = -1;
        waitpid(child, &status, 0);
        EXPECT_TRUE(WIFEXITED(status)) << "signal " << WTERMSIG(status);
        outcome = WIFEXITED(status) ? WEXITSTATUS(status) : kFailed;
        EXPECT_EQ(outcome & kFailed, 0);
        failures += outcome & kFailed;
        faults += (outcome & kNotReached) == 0 ? 1 : 0;
      }
    }
  }
  return faults;
}

#endif  // FAULTS_EVERY_FAULT_H_
