// SPDX-License-Identifier: MIT
#include <fcntl.h>
#include <linux/close_range.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <stdexcept>
#include <thread>

#include "tests/support/Subprocess.h"
#include "tests/support/TestBus.h"

extern char** environ;

namespace halvex::test {
namespace {

std::runtime_error systemError(const std::string& what, int error = errno) {
  return std::runtime_error(what + ": " + std::strerror(error));
}

std::vector<char*> pointers(const std::vector<std::string>& strings) {
  std::vector<char*> result;
  result.reserve(strings.size() + 1);
  for (const auto& s : strings) {
    result.push_back(const_cast<char*>(s.c_str()));
  }
  result.push_back(nullptr);
  return result;
}

// Between fork and exec only async-signal-safe calls: the test process may have threads.
[[noreturn]] void execChild(pid_t parent, const std::vector<FdMapping>& fds, char* const* argv,
                            char* const* envp) {
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (::getppid() != parent) {
    ::_exit(127);
  }
  // A test that ignores SIGPIPE or blocks signals must not hand that on.
  sigset_t none;
  ::sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  ::signal(SIGPIPE, SIG_DFL);

  for (const FdMapping& m : fds) {
    if (::dup2(m.parentFd, m.childFd) < 0) {
      ::_exit(127);
    }
  }
  ::syscall(SYS_close_range, 3U, ~0U, CLOSE_RANGE_CLOEXEC);
  for (const FdMapping& m : fds) {
    ::fcntl(m.childFd, F_SETFD, 0);
  }
  ::execve(argv[0], argv, envp);
  ::_exit(127);
}

// In-memory files for a child's standard streams.
struct Streams {
  int fds[3] = {::memfd_create("in", MFD_CLOEXEC), ::memfd_create("out", MFD_CLOEXEC),
                ::memfd_create("err", MFD_CLOEXEC)};
  ~Streams() {
    for (int fd : fds) {
      ::close(fd);
    }
  }
  std::string text(int i) const {
    std::ifstream in("/proc/self/fd/" + std::to_string(fds[i]), std::ios::binary);
    return {std::istreambuf_iterator<char>(in), {}};
  }
};

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

// Starts a program that reports on its descriptor 3 and has its standard error go to errPath,
// and returns the first line it reports, newline included: less when it closed the descriptor,
// or stayed silent for ten seconds.
std::string startReporting(const std::vector<std::string>& args, const EnvChanges& env,
                           const std::string& errPath, pid_t& pid) {
  int report[2];
  if (::pipe2(report, O_CLOEXEC) != 0) {
    throw systemError("pipe2");
  }
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
        ::read(report[0], &c, 1) != 1) {
      break;
    }
    line += c;
  }
  ::close(report[0]);
  return line;
}

std::string program(const char* path, const char* name) {
  if (*path == '\0') {
    throw std::runtime_error(std::string("this test binary was built without ") + name);
  }
  return path;
}

// Waits for pid to end, killing it once timeout has passed; false, with errno, when pid is
// not a child to wait for.
bool reap(pid_t pid, std::chrono::milliseconds timeout, ExitStatus& status) noexcept {
  int raw = 0;
  pid_t done;
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  // A pidfd would let us sleep exactly until the exit; the kernel may refuse one in a container,
  // and a few milliseconds of latency do not matter to a test.
  while ((done = ::waitpid(pid, &raw, WNOHANG)) == 0 || (done < 0 && errno == EINTR)) {
    if (std::chrono::steady_clock::now() >= deadline) {
      ::kill(pid, SIGKILL);
      done = ::waitpid(pid, &raw, 0);
      status.timedOut = true;
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  if (done != pid) {
    return false;
  }
  status.exited = WIFEXITED(raw);
  status.code = status.exited ? WEXITSTATUS(raw) : -1;
  status.signal = WIFSIGNALED(raw) ? WTERMSIG(raw) : 0;
  return true;
}

// For destructors: a child that cannot be waited for has been reaped already.
void terminate(pid_t& pid) noexcept {
  if (pid >= 0) {
    ::kill(pid, SIGTERM);
    ExitStatus ignored;
    reap(std::exchange(pid, -1), std::chrono::seconds(5), ignored);
  }
}

}  // namespace

std::string ExitStatus::describe() const {
  std::string text = exited ? "exit " + std::to_string(code) : "signal " + std::to_string(signal);
  return timedOut ? "timed out (" + text + ")" : text;
}

pid_t spawnChild(const std::vector<std::string>& args, const EnvChanges& env,
                 const std::vector<FdMapping>& fds) {
  if (args.empty() || ::access(args[0].c_str(), X_OK) != 0) {
    throw systemError("cannot start " + (args.empty() ? std::string("nothing") : args[0]));
  }
  std::vector<std::string> environment;
  for (char** entry = environ; *entry != nullptr; ++entry) {
    environment.emplace_back(*entry);
  }
  for (const auto& [name, value] : env) {
    const std::string prefix = name + "=";
    std::erase_if(environment, [&prefix](const std::string& e) { return e.starts_with(prefix); });
    if (value) {
      environment.push_back(prefix + *value);
    }
  }
  const std::vector<char*> argv = pointers(args), envp = pointers(environment);
  const pid_t parent = ::getpid();
  const pid_t pid = ::fork();
  if (pid < 0) {
    throw systemError("fork");
  }
  if (pid == 0) {
    execChild(parent, fds, argv.data(), envp.data());
  }
  return pid;
}

ExitStatus waitChild(pid_t pid, std::chrono::milliseconds timeout) {
  ExitStatus status;
  if (!reap(pid, timeout, status)) {
    throw systemError("waitpid");
  }
  return status;
}

RunResult runProcess(const RunOptions& options) {
  const Streams streams;
  const auto [in, out, err] = streams.fds;
  const auto size = static_cast<ssize_t>(options.input.size());
  if (in < 0 || out < 0 || err < 0 ||
      ::pwrite(in, options.input.data(), options.input.size(), 0) != size) {
    throw systemError("cannot prepare the standard streams");
  }
  RunResult result;
  result.status = waitChild(spawnChild(options.args, options.env, {{in, 0}, {out, 1}, {err, 2}}),
                            options.timeout);
  result.out = streams.text(1);
  result.err = streams.text(2);
  return result;
}

std::string simPath() {
  return program(HALVEX_SIM_PATH, "halvex-sim");
}

std::string toolPath() {
  return program(HALVEXTOOL_PATH, "halvextool");
}

TempDir::TempDir() {
  std::string pattern = (std::filesystem::temp_directory_path() / "halvex-test-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) {
    throw systemError("mkdtemp");
  }
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
  if (!listenAddress.empty()) {
    args.push_back("--address=" + listenAddress);
  }
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
  std::vector<std::string> command = {"/usr/bin/busctl", "--address=" + address_};
  command.insert(command.end(), args.begin(), args.end());
  return runProcess({command, {}, {}});
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
    std::ifstream err(errPath);
    throw std::runtime_error(
        "halvex-sim did not get ready (" +
        (line.empty() ? status.describe() : "said \"" + line + "\"") +
        "); its stderr: " + std::string(std::istreambuf_iterator<char>(err), {}));
  }
}

SimProcess::~SimProcess() {
  terminate(pid_);
}

std::vector<nlohmann::json> SimProcess::requestLog() const {
  std::vector<nlohmann::json> entries;
  std::ifstream in(dir_.path() / "requests.jsonl");
  for (std::string line; std::getline(in, line);) {
    entries.push_back(nlohmann::json::parse(line));
  }
  return entries;
}

void SimProcess::kill(int signal) {
  if (pid_ >= 0) {
    ::kill(pid_, signal);
  }
}

ExitStatus SimProcess::waitExit(std::chrono::milliseconds timeout) {
  if (pid_ < 0) {
    throw std::logic_error("SimProcess::waitExit called twice");
  }
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
