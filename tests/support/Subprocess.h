// SPDX-License-Identifier: MIT
// Child processes for tests: start a program with chosen arguments and environment, feed its
// standard input, collect its output and exit status, and never wait forever.
//
// Every child gets PR_SET_PDEATHSIG(SIGKILL), so nothing outlives a crashed test. The kernel sends
// that signal when the *thread* that started the child ends, so start children from the test's
// own thread, not from a short-lived helper thread.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace halvex::test {

// How a child ended.
struct ExitStatus {
  bool exited = false;    // it called exit; code holds the status
  int code = -1;          // exit status, when exited
  int signal = 0;         // terminating signal, when killed
  bool timedOut = false;  // it did not end in time and was killed with SIGKILL

  // "exit 2", "signal 9", "timed out (signal 9)": for failure messages.
  std::string describe() const;
};

// Environment changes on top of the test's own environment: a value sets, nullopt removes.
using EnvChanges = std::vector<std::pair<std::string, std::optional<std::string>>>;

// The child's file descriptor childFd becomes a copy of the parent's parentFd.
struct FdMapping {
  int parentFd;
  int childFd;
};

// Starts args[0] (a path, not looked up in PATH) with args. Standard input, output and error are
// inherited unless fds remaps them; every other descriptor is closed in the child. Throws
// std::runtime_error when the program cannot be started (the exec error is reported).
pid_t spawnChild(const std::vector<std::string>& args, const EnvChanges& env = {},
                 const std::vector<FdMapping>& fds = {});

// Waits up to timeout for pid to end; on time-out kills it with SIGKILL, reaps it and sets
// timedOut. Each child must be waited for exactly once.
ExitStatus waitChild(pid_t pid, std::chrono::milliseconds timeout);

struct RunOptions {
  std::vector<std::string> args;  // args[0] is the program's path
  EnvChanges env;
  std::string input;  // written to standard input, which is then closed
  std::chrono::milliseconds timeout{std::chrono::seconds(30)};
};

struct RunResult {
  ExitStatus status;
  std::string out;
  std::string err;
};

// Runs a program to its end and returns what it printed. On time-out the child is killed and the
// output so far is returned with status.timedOut set. Standard input is a pipe; if the child
// closes it early the rest of the input is dropped (no SIGPIPE reaches the test).
RunResult runProcess(const RunOptions& options);

}  // namespace halvex::test
