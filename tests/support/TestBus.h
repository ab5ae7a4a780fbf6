// SPDX-License-Identifier: MIT
// Fixtures for everything that talks over D-Bus: a private bus (first thing in a test) and the
// simulated device on it. A fixture that cannot be set up throws, which fails the test.
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

// The programs under test, as built (tests/support/CMakeLists.txt); each throws when the test
// binary was configured without its program.
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

// A dbus-daemon of our own, where anyone may own, send and receive. The constructor points
// DBUS_SYSTEM_BUS_ADDRESS at it, so code that opens "the system bus" lands here. setenv is not
// thread-safe: create the bus before the test starts a thread. Each test runs in a process of its
// own, so the variable never leaks into another.
class PrivateBus {
 public:
  PrivateBus();
  ~PrivateBus();  // kills the daemon; the variable still names its address
  PrivateBus(const PrivateBus&) = delete;
  PrivateBus& operator=(const PrivateBus&) = delete;

  const std::string& address() const { return address_; }
  // Kills the daemon now: the bus went away.
  void stop();
  // Kills the daemon and starts another at the same address: every connection and name is lost.
  void restart();
  // Runs `busctl --address=ADDRESS args...`.
  RunResult busctl(const std::vector<std::string>& args) const;

 private:
  void launch(const std::string& listenAddress);

  pid_t pid_ = -1;
  std::string address_;
};

struct SimOptions {
  bool logRoot = false;  // pass --log-root with a fresh directory
};

// A halvex-sim on a PrivateBus, playing the scenario given as JSON text and logging requests.
// The constructor returns once it has reported ready (every name present at start is owned), or
// throws with its standard error.
class SimProcess {
 public:
  SimProcess(const PrivateBus& bus, const std::string& scenarioJson, SimOptions options = {});
  ~SimProcess();  // SIGTERM, then SIGKILL if it lingers
  SimProcess(const SimProcess&) = delete;
  SimProcess& operator=(const SimProcess&) = delete;

  // The --log-root directory, empty unless SimOptions::logRoot.
  const std::filesystem::path& logRoot() const { return logRoot_; }
  // The requests so far in the order received. Objects compare by key, so only their "keys"
  // arrays keep the order the request had its keys in.
  std::vector<nlohmann::json> requestLog() const;
  void kill(int signal = SIGTERM);
  // Waits for the simulator to end (by itself, a fault, Quit or kill()). Once only.
  ExitStatus waitExit(std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // Calls a method of org.halvex.Simulator1 through busctl: ("SetServerPresent", "b", {"false"}).
  RunResult callControl(const std::string& method, const std::string& signature = {},
                        const std::vector<std::string>& args = {}) const;

 private:
  const PrivateBus& bus_;
  TempDir dir_;
  std::filesystem::path logRoot_;
  pid_t pid_ = -1;
};

}  // namespace halvex::test
