// SPDX-License-Identifier: MIT
// Test fixtures for everything that talks over D-Bus: a private bus and the simulated device.
//
//   halvex::test::PrivateBus bus;                       // first thing in the test
//   halvex::test::SimProcess sim(bus, R"({"server": {"present": false}})");
//   ... run code that opens the system bus ...
//   auto log = sim.requestLog();
//
// Failures to set things up throw std::runtime_error; GoogleTest reports the message as the
// test's failure.
#pragma once

#include <signal.h>
#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "tests/support/Subprocess.h"

namespace halvex::test {

// Paths of the programs under test, fixed at build time (see tests/support/CMakeLists.txt). Each
// throws when the test binary was configured without that program.
std::string simPath();
std::string toolPath();

// A temporary directory, removed with its contents when destroyed.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::filesystem::path& path() const { return path_; }

 private:
  std::filesystem::path path_;
};

// A dbus-daemon of our own, listening in a temporary directory, with an allow-all policy and
// limits far above the defaults. The constructor sets DBUS_SYSTEM_BUS_ADDRESS (and nothing else)
// for this process and its children, so code that opens "the system bus" lands here.
//
// setenv is not thread-safe: create the bus before anything in the test starts a thread. Each
// test runs in its own process (gtest_discover_tests), so the variable never leaks between tests.
class PrivateBus {
 public:
  PrivateBus();
  ~PrivateBus();  // kills the daemon; the variable is left pointing at the dead address
  PrivateBus(const PrivateBus&) = delete;
  PrivateBus& operator=(const PrivateBus&) = delete;

  const std::string& address() const { return address_; }

  // Kills the daemon now, for tests of a bus that goes away.
  void stop();

  // Kills the daemon and starts a new one at the same address: the bus restarted, with every
  // connection and name lost.
  void restart();

  // Runs `busctl --address=ADDRESS args...`, for example {"--json=short", "call", ...}.
  RunResult busctl(const std::vector<std::string>& args) const;

 private:
  void launch(const std::string& listenAddress);

  TempDir dir_;
  pid_t pid_ = -1;
  std::string address_;
};

struct SimOptions {
  bool logRoot = false;  // pass --log-root with a fresh directory
  bool requestLog = true;
  std::vector<std::string> extraArgs;
  std::chrono::milliseconds readyTimeout{std::chrono::seconds(10)};
};

// A running halvex-sim on a PrivateBus. The constructor writes the scenario (JSON text) to a
// file, starts the simulator and returns once it has reported ready, that is once every name of
// the scenario present at start is owned. If it exits or stays silent instead, the constructor
// throws with the simulator's standard error in the message.
class SimProcess {
 public:
  SimProcess(const PrivateBus& bus, const std::string& scenarioJson, SimOptions options = {});
  ~SimProcess();  // SIGTERM, then SIGKILL if it lingers
  SimProcess(const SimProcess&) = delete;
  SimProcess& operator=(const SimProcess&) = delete;

  pid_t pid() const { return pid_; }
  // The --log-root directory, empty unless SimOptions::logRoot.
  const std::filesystem::path& logRoot() const { return logRoot_; }
  // Everything the simulator wrote to standard error so far.
  std::string stderrText() const;

  // The request log, one JSON object per request in the order received. Objects compare by
  // key, so only the "keys" arrays carry the order the request had its keys in.
  std::vector<nlohmann::json> requestLog() const;

  // Sends a signal; waitExit() then collects the status.
  void kill(int signal = SIGTERM);
  // Waits for the simulator to end (by itself, a fault "exit", Quit or kill()). Once only.
  ExitStatus waitExit(std::chrono::milliseconds timeout = std::chrono::seconds(10));

  // Calls a method of the control interface org.halvex.Simulator1 through busctl, e.g.
  // callControl("SetServerPresent", "b", {"false"}) or callControl("EmitState").
  RunResult callControl(const std::string& method, const std::string& signature = {},
                        const std::vector<std::string>& args = {}) const;

 private:
  const PrivateBus& bus_;
  TempDir dir_;
  std::filesystem::path requestLog_;
  std::filesystem::path logRoot_;
  std::filesystem::path stderr_;
  pid_t pid_ = -1;
};

}  // namespace halvex::test
