// SPDX-License-Identifier: MIT
// Child processes for tests, which never wait forever. Every child gets PR_SET_PDEATHSIG(SIGKILL),
// so nothing outlives a crashed test; the kernel sends it when the *thread* that started the
// child ends, so start children from the test's own thread.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace halvex::test {

struct ExitStatus {
  bool exited = false;  // it called exit with code
  int code = -1;
  int signal = 0;         // or a signal ended it
  bool timedOut = false;  // it did not end in time and was killed with SIGKILL

  // "exit 2", "signal 9", "timed out (signal 9)".
  std::string describe() const;
};

// Changes to the test's own environment: a value sets, nullopt removes.
using EnvChanges = std::vector<std::pair<std::string, std::optional<std::string>>>;

// The child's descriptor childFd becomes a copy of the parent's parentFd, in the order given: a
// parentFd must not be the childFd of an earlier mapping.
struct FdMapping {
  int parentFd;
  int childFd;
};

// Starts args[0] (a path) with args; descriptors above 2 are closed in the child unless fds maps
// them. Throws std::runtime_error when args[0] is no program this process may run; a child that
// cannot set itself up ends with status 127.
pid_t spawnChild(const std::vector<std::string>& args, const EnvChanges& env = {},
                 const std::vector<FdMapping>& fds = {});

// Waits for pid to end, killing it with SIGKILL after timeout. Once per child.
ExitStatus waitChild(pid_t pid, std::chrono::milliseconds timeout);

struct RunOptions {
  std::vector<std::string> args;  // args[0] is the program's path
  EnvChanges env;
  std::string input;  // all of standard input
  std::chrono::milliseconds timeout{std::chrono::seconds(30)};
};

struct RunResult {
  ExitStatus status;
  std::string out;
  std::string err;
};

// Runs a program to its end, or kills it at the time-out, and returns what it printed. Its
// standard streams are in-memory files, so neither a child that stops reading nor a grandchild
// that keeps them open can stall the test.
RunResult runProcess(const RunOptions& options);

}  // namespace halvex::test
