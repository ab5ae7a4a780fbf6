// SPDX-License-Identifier: MIT
// Keeps named processes running for as long as the simulator runs, so that a check of the
// process table (comm, and argv[0] for names of 15 bytes or more) finds them. Each is /bin/sleep
// started through a symbolic link named NAME: the kernel takes comm from the link's name, and
// argv[0] is the link's path. They die with the simulator, even when it is killed.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace halvex::sim {

class ProcessKeeper {
 public:
  ProcessKeeper() = default;
  ~ProcessKeeper();  // kills and reaps them
  ProcessKeeper(const ProcessKeeper&) = delete;
  ProcessKeeper& operator=(const ProcessKeeper&) = delete;

  // Starts one process per name. Throws std::runtime_error when one cannot be started.
  void start(const std::vector<std::string>& names);

 private:
  std::vector<pid_t> pids_;
};

}  // namespace halvex::sim
