// SPDX-License-Identifier: MIT
// The simulator's bus side: the server, the helper, the device identity and the control
// interface, each on its own connection to the system bus, all served by one sd_event loop on
// the main thread. Nothing here blocks that loop: a delayed or never-answered request keeps its
// message and is answered (or not) later, and names are taken and released asynchronously.
#pragma once

#include <memory>
#include <string>

#include "sim/Scenario.h"

namespace halvex::sim {

struct DaemonOptions {
  std::string scenarioPath;  // where the scenario came from, for the service manager's status
  std::string requestLog;    // empty: no log
  std::string logRoot;       // empty: no log sets written
  int readyFd = -1;          // -1: nobody to tell
};

class Daemon {
 public:
  // Connects to the system bus and starts the scenario's processes. Throws std::runtime_error.
  // Once every name present at start is owned, tells the service manager (READY=1, when
  // NOTIFY_SOCKET is set) and then options.readyFd.
  Daemon(const Scenario& scenario, DaemonOptions options);
  ~Daemon();
  Daemon(const Daemon&) = delete;
  Daemon& operator=(const Daemon&) = delete;

  // Serves until SIGTERM, SIGINT, Quit or the loss of the bus, then tells the service manager
  // STOPPING=1. Returns the exit status.
  int run();

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace halvex::sim
