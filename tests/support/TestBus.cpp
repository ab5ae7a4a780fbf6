// SPDX-License-Identifier: MIT
#include "tests/support/TestBus.h"

#include <fcntl.h>
#include <poll.h>
#include <stdlib.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>
#include <stdexcept>

namespace halvex::test {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

// Starts a program that reports on its descriptor 3 and has its standard error go to errPath,
// and returns the first line it reports, newline included: less when it closed the descriptor,
// or stayed silent for ten seconds.
std::string startReporting(const std::vector<std::string>& args, const EnvChanges& env,
                           const std::string& errPath, pid_t& pid) {
  int report[2];
  if (::pipe2(report, O_CLOEXEC) != 0)
    throw std::runtime_error(std::string("pipe2: ") + std::strerror(errno));
  const int err = ::open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  pid = spawnChild(args, env, {{report[1], 3}, {err, 2}});
  ::close(report[1]);
  ::close(err);
  const auto deadline = Clock::now() + std::chrono::seconds(10);
  std::string line;
  pollfd ready{report[0], POLLIN, 0};
  while (!line.ends_with('\n')) {
    const auto left = std::chrono::duration_cast<milliseconds>(deadline - Clock::now()).count();
    char c;
    if (left <= 0 || ::poll(&ready, 1, static_cast<int>(left)) != 1 ||
        ::read(report[0], &c, 1) != 1)
      break;
    line += c;
  }
  ::close(report[0]);
  return line;
}

std::string program(const char* path, const char* name) {
  if (*path == '\0')
    throw std::runtime_error(std::string("this test binary was built without ") + name);
  return path;
}

void terminate(pid_t& pid) {
  if (pid >= 0) {
    ::kill(pid, SIGTERM);
    waitChild(std::exchange(pid, -1), std::chrono::seconds(5));
  }
}

}  // namespace

std::string simPath() {
  return program(HALVEX_SIM_PATH, "halvex-sim");
}

std::string toolPath() {
  return program(HALVEXTOOL_PATH, "halvextool");
}

TempDir::TempDir() {
  std::string pattern = (std::filesystem::temp_directory_path() / "halvex-test-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr)
    throw std::runtime_error(std::string("mkdtemp: ") + std::strerror(errno));
  path_ = pattern;
}

TempDir::~TempDir() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

PrivateBus::PrivateBus() {
  launch({});
  ::setenv("DBUS_SYSTEM_BUS_ADDRESS", address_.c_str(), 1);
}

void PrivateBus::launch(const std::string& listenAddress) {
  std::vector<std::string> args = {"/usr/bin/dbus-daemon",
                                   "--config-file=" HALVEX_PRIVATE_BUS_CONFIG, "--nofork",
                                   "--print-address=3"};
  if (!listenAddress.empty())
    args.push_back("--address=" + listenAddress);
  // dbus-daemon complains that it cannot raise its fd limit in a container: harmless, dropped.
  const std::string printed = startReporting(args, {}, "/dev/null", pid_);
  if (!printed.ends_with('\n')) {
    const ExitStatus status = waitChild(std::exchange(pid_, -1), milliseconds(0));
    throw std::runtime_error("dbus-daemon did not print its address (" + status.describe() + ")");
  }
  // Without the daemon's guid, so that a restarted daemon at the same socket is the same bus to
  // a client reconnecting through the variable.
  address_ = printed.substr(0, std::min(printed.find(",guid="), printed.size() - 1));
}

void PrivateBus::restart() {
  stop();
  launch(address_);
}

PrivateBus::~PrivateBus() {
  stop();
}

void PrivateBus::stop() {
  terminate(pid_);
}

RunResult PrivateBus::busctl(const std::vector<std::string>& args) const {
  RunOptions run;
  run.args = {"/usr/bin/busctl", "--address=" + address_};
  run.args.insert(run.args.end(), args.begin(), args.end());
  return runProcess(run);
}

SimProcess::SimProcess(const PrivateBus& bus, const std::string& scenarioJson, SimOptions options)
    : bus_(bus) {
  const std::string dir = dir_.path().string();
  std::ofstream(dir + "/scenario.json") << scenarioJson;
  std::vector<std::string> args = {simPath(), "--scenario=" + dir + "/scenario.json",
                                   "--ready-fd=3", "--request-log=" + dir + "/requests.jsonl"};
  if (options.logRoot) {
    logRoot_ = dir_.path() / "root";
    std::filesystem::create_directory(logRoot_);
    args.push_back("--log-root=" + logRoot_.string());
  }
  const auto errPath = dir_.path() / "stderr";
  const std::string line =
      startReporting(args, {{"DBUS_SYSTEM_BUS_ADDRESS", bus.address()}}, errPath, pid_);
  if (line != "ready\n") {
    ::kill(pid_, SIGKILL);
    const ExitStatus status = waitChild(std::exchange(pid_, -1), std::chrono::seconds(5));
    std::ostringstream stderrText;
    stderrText << std::ifstream(errPath).rdbuf();
    throw std::runtime_error("halvex-sim did not get ready (" +
                             (line.empty() ? status.describe() : "said \"" + line + "\"") +
                             "); its stderr: " + stderrText.str());
  }
}

SimProcess::~SimProcess() {
  terminate(pid_);
}

std::vector<nlohmann::json> SimProcess::requestLog() const {
  std::vector<nlohmann::json> entries;
  std::ifstream in(dir_.path() / "requests.jsonl");
  for (std::string line; std::getline(in, line);)
    entries.push_back(nlohmann::json::parse(line));
  return entries;
}

void SimProcess::kill(int signal) {
  if (pid_ >= 0)
    ::kill(pid_, signal);
}

ExitStatus SimProcess::waitExit(std::chrono::milliseconds timeout) {
  if (pid_ < 0)
    throw std::logic_error("SimProcess::waitExit called twice");
  return waitChild(std::exchange(pid_, -1), timeout);
}

RunResult SimProcess::callControl(const std::string& method, const std::string& signature,
                                  const std::vector<std::string>& args) const {
  std::vector<std::string> call = {"call", "org.halvex.Simulator", "/org/halvex/Simulator",
                                   "org.halvex.Simulator1", method};
  if (!signature.empty()) {
    call.push_back(signature);
    call.insert(call.end(), args.begin(), args.end());
  }
  return bus_.busctl(call);
}

}  // namespace halvex::test
