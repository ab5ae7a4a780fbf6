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

constexpr const char* kBusConfig = R"(<!DOCTYPE busconfig PUBLIC
 "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <listen>unix:tmpdir=/tmp</listen>
  <auth>EXTERNAL</auth>
  <policy context="default">
    <allow user="*"/>
    <allow own="*"/>
    <allow send_destination="*" eavesdrop="true"/>
    <allow receive_sender="*" eavesdrop="true"/>
    <allow send_type="method_call"/>
    <allow send_type="signal"/>
    <allow send_type="method_return"/>
    <allow send_type="error"/>
  </policy>
  <limit name="max_replies_per_connection">4096</limit>
  <limit name="max_connections_per_user">4096</limit>
  <limit name="max_completed_connections">4096</limit>
  <limit name="max_match_rules_per_connection">4096</limit>
  <limit name="max_names_per_connection">512</limit>
  <limit name="reply_timeout">600000</limit>
</busconfig>
)";

// Reads one line from fd, waiting at most until deadline. Returns false on EOF or time-out, with
// what was read so far in line.
bool readLine(int fd, std::string& line, Clock::time_point deadline) {
  for (;;) {
    const auto left = std::chrono::duration_cast<milliseconds>(deadline - Clock::now()).count();
    if (left <= 0)
      return false;
    pollfd p{fd, POLLIN, 0};
    const int ready = ::poll(&p, 1, static_cast<int>(left));
    if (ready < 0 && errno == EINTR)
      continue;
    if (ready <= 0)
      return false;
    char c;
    const ssize_t n = ::read(fd, &c, 1);
    if (n < 0 && errno == EINTR)
      continue;
    if (n <= 0)
      return false;
    if (c == '\n')
      return true;
    line += c;
  }
}

std::string readFile(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  return text.str();
}

void writeFile(const std::filesystem::path& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << text;
  if (!out.flush())
    throw std::runtime_error("cannot write " + path.string());
}

struct Pipe {
  int fds[2] = {-1, -1};
  Pipe() {
    if (::pipe2(fds, O_CLOEXEC) != 0) {
      throw std::runtime_error(std::string("pipe2: ") + std::strerror(errno));
    }
  }
  ~Pipe() { closeWriteEnd(), closeReadEnd(); }
  Pipe(const Pipe&) = delete;
  Pipe& operator=(const Pipe&) = delete;
  void closeWriteEnd() {
    if (fds[1] >= 0)
      ::close(std::exchange(fds[1], -1));
  }
  void closeReadEnd() {
    if (fds[0] >= 0)
      ::close(std::exchange(fds[0], -1));
  }
};

}  // namespace

std::string simPath() {
#ifdef HALVEX_SIM_PATH
  return HALVEX_SIM_PATH;
#else
  throw std::runtime_error("this test binary was built without halvex-sim");
#endif
}

std::string toolPath() {
#ifdef HALVEXTOOL_PATH
  return HALVEXTOOL_PATH;
#else
  throw std::runtime_error("this test binary was built without halvextool");
#endif
}

TempDir::TempDir() {
  std::string pattern = (std::filesystem::temp_directory_path() / "halvex-test-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) {
    throw std::runtime_error(std::string("mkdtemp: ") + std::strerror(errno));
  }
  path_ = pattern;
}

TempDir::~TempDir() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

PrivateBus::PrivateBus() {
  writeFile(dir_.path() / "bus.conf", kBusConfig);
  launch({});
  // Without the daemon's guid, so that a restarted daemon at the same socket is the same bus to
  // a client reconnecting through the variable.
  address_ = address_.substr(0, address_.find(",guid="));
  ::setenv("DBUS_SYSTEM_BUS_ADDRESS", address_.c_str(), 1);
}

void PrivateBus::launch(const std::string& listenAddress) {
  const auto config = dir_.path() / "bus.conf";
  std::vector<std::string> args = {"/usr/bin/dbus-daemon", "--config-file=" + config.string(),
                                   "--nofork", "--print-address=3"};
  if (!listenAddress.empty()) {
    args.push_back("--address=" + listenAddress);
  }
  Pipe address;
  const int devNull = ::open("/dev/null", O_WRONLY | O_CLOEXEC);
  // dbus-daemon complains on stderr that it cannot raise its fd limit in a container; harmless,
  // so its stderr goes nowhere.
  pid_ = spawnChild(args, {}, {{address.fds[1], 3}, {devNull, 2}});
  ::close(devNull);
  address.closeWriteEnd();
  std::string printed;
  if (!readLine(address.fds[0], printed, Clock::now() + std::chrono::seconds(10)) ||
      printed.empty()) {
    const ExitStatus status = waitChild(std::exchange(pid_, -1), milliseconds(0));
    throw std::runtime_error("dbus-daemon did not print its address (" + status.describe() + ")");
  }
  if (listenAddress.empty()) {
    address_ = printed;
  }
}

void PrivateBus::restart() {
  stop();
  launch(address_);
}

PrivateBus::~PrivateBus() {
  stop();
}

void PrivateBus::stop() {
  if (pid_ < 0)
    return;
  ::kill(pid_, SIGTERM);
  waitChild(std::exchange(pid_, -1), std::chrono::seconds(5));
}

RunResult PrivateBus::busctl(const std::vector<std::string>& args) const {
  RunOptions run;
  run.args = {"/usr/bin/busctl", "--address=" + address_};
  run.args.insert(run.args.end(), args.begin(), args.end());
  run.timeout = std::chrono::seconds(30);
  return runProcess(run);
}

SimProcess::SimProcess(const PrivateBus& bus, const std::string& scenarioJson, SimOptions options)
    : bus_(bus) {
  const auto scenario = dir_.path() / "scenario.json";
  writeFile(scenario, scenarioJson);
  stderr_ = dir_.path() / "stderr.txt";
  std::vector<std::string> args = {simPath(), "--scenario", scenario.string(), "--ready-fd", "3"};
  if (options.requestLog) {
    requestLog_ = dir_.path() / "requests.jsonl";
    args.insert(args.end(), {"--request-log", requestLog_.string()});
  }
  if (options.logRoot) {
    logRoot_ = dir_.path() / "root";
    std::filesystem::create_directory(logRoot_);
    args.insert(args.end(), {"--log-root", logRoot_.string()});
  }
  args.insert(args.end(), options.extraArgs.begin(), options.extraArgs.end());

  Pipe ready;
  const int errFd = ::open(stderr_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (errFd < 0)
    throw std::runtime_error("cannot create " + stderr_.string());
  try {
    pid_ = spawnChild(args, {{"DBUS_SYSTEM_BUS_ADDRESS", bus.address()}},
                      {{ready.fds[1], 3}, {errFd, 2}});
  } catch (...) {
    ::close(errFd);
    throw;
  }
  ::close(errFd);
  ready.closeWriteEnd();
  std::string line;
  const bool gotLine = readLine(ready.fds[0], line, Clock::now() + options.readyTimeout);
  if (!gotLine || line != "ready") {
    ::kill(pid_, SIGKILL);
    const ExitStatus status = waitChild(std::exchange(pid_, -1), std::chrono::seconds(5));
    throw std::runtime_error("halvex-sim did not get ready (" +
                             (gotLine ? "said \"" + line + "\"" : status.describe()) +
                             "); its stderr: " + stderrText());
  }
}

SimProcess::~SimProcess() {
  if (pid_ < 0)
    return;
  ::kill(pid_, SIGTERM);
  waitChild(std::exchange(pid_, -1), std::chrono::seconds(5));
}

std::string SimProcess::stderrText() const {
  return readFile(stderr_);
}

std::vector<nlohmann::json> SimProcess::requestLog() const {
  std::vector<nlohmann::json> entries;
  if (requestLog_.empty())
    return entries;
  std::ifstream in(requestLog_);
  std::string line;
  while (std::getline(in, line)) {
    entries.push_back(nlohmann::json::parse(line));
  }
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
