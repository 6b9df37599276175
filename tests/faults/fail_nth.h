// Makes the Nth call of a set of C library functions fail, in a program that has fail_nth.cpp
// linked in, or is started with it as a preloaded module. What fails is what the program and its
// libraries call; calls inside the C library are not seen.
//
// A preloaded module takes its order from the environment, and counts from main() on:
//
//   FAIL_CALLS    the functions, with a comma before and behind each: ",open,openat,"
//   FAIL_AT       which of their calls fails, from 1
//   FAIL_ERROR    the errno; 0 has a call transfer one byte (those that transfer none succeed)
//   FAIL_LASTING  1 when all calls after that one fail, too
//   FAIL_REPORT   a file that gets the name of the function that failed first
//   FAIL_DEATH    a file that holds a DeathOrder, through which the process can be told to die;
//   what
//                 it starts does not take that over
//
// The functions of 64-bit files count under the names without "64", stat, lstat and fstat as
// "stat".
#ifndef FAULTS_FAIL_NTH_H_
#define FAULTS_FAIL_NTH_H_

#include <atomic>

struct FailNth {
  const char* calls = "";  // As FAIL_CALLS; must live until Disarm().
  int error = 0;
  long at = 1;
  bool lasting = false;
};

// What stands in a file that both sides map: the process ends as by SIGKILL instead of making the
// call with which `left` comes to 0. To be set last; 0 for no order.
struct DeathOrder {
  std::atomic<long> left;
  char calls[120];  // As FAIL_CALLS.
};

// One order at a time, for the whole process.
void Arm(const FailNth& order);

// The function that failed first since Arm(); nullptr when none did.
const char* Disarm();

#endif  // FAULTS_FAIL_NTH_H_
