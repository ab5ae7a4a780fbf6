// SPDX-License-Identifier: MIT
#include "tests/support/Subprocess.h"

#include <fcntl.h>
#include <linux/close_range.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <stdexcept>
#include <thread>

extern char** environ;

namespace halvex::test {
namespace {

std::runtime_error systemError(const std::string& what, int error = errno) {
  return std::runtime_error(what + ": " + std::strerror(error));
}

std::vector<char*> pointers(const std::vector<std::string>& strings) {
  std::vector<char*> result;
  for (const auto& s : strings)
    result.push_back(const_cast<char*>(s.c_str()));
  result.push_back(nullptr);
  return result;
}

// Between fork and exec only async-signal-safe calls: the test process may have threads.
[[noreturn]] void execChild(pid_t parent, const std::vector<FdMapping>& fds, char* const* argv,
                            char* const* envp) {
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (::getppid() != parent)
    ::_exit(127);
  // A test that ignores SIGPIPE or blocks signals must not hand that on.
  sigset_t none;
  ::sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  ::signal(SIGPIPE, SIG_DFL);

  for (const FdMapping& m : fds) {
    if (::dup2(m.parentFd, m.childFd) < 0)
      ::_exit(127);
  }
  ::syscall(SYS_close_range, 3U, ~0U, CLOSE_RANGE_CLOEXEC);
  for (const FdMapping& m : fds)
    ::fcntl(m.childFd, F_SETFD, 0);
  ::execve(argv[0], argv, envp);
  ::_exit(127);
}

// In-memory files for a child's standard streams.
struct Streams {
  int fds[3] = {::memfd_create("in", MFD_CLOEXEC), ::memfd_create("out", MFD_CLOEXEC),
                ::memfd_create("err", MFD_CLOEXEC)};
  ~Streams() {
    for (int fd : fds)
      ::close(fd);
  }
  std::string text(int i) const {
    std::string text(static_cast<std::size_t>(std::max<off_t>(::lseek(fds[i], 0, SEEK_END), 0)),
                     '\0');
    const ssize_t n = ::pread(fds[i], text.data(), text.size(), 0);
    text.resize(static_cast<std::size_t>(std::max<ssize_t>(n, 0)));
    return text;
  }
};

}  // namespace

std::string ExitStatus::describe() const {
  std::string text = exited ? "exit " + std::to_string(code) : "signal " + std::to_string(signal);
  return timedOut ? "timed out (" + text + ")" : text;
}

pid_t spawnChild(const std::vector<std::string>& args, const EnvChanges& env,
                 const std::vector<FdMapping>& fds) {
  if (args.empty() || ::access(args[0].c_str(), X_OK) != 0)
    throw systemError("cannot start " + (args.empty() ? std::string("nothing") : args[0]));
  std::vector<std::string> environment;
  for (char** entry = environ; *entry != nullptr; ++entry)
    environment.emplace_back(*entry);
  for (const auto& [name, value] : env) {
    std::erase_if(environment, [&](const std::string& e) { return e.starts_with(name + "="); });
    if (value)
      environment.push_back(name + "=" + *value);
  }
  const std::vector<char*> argv = pointers(args), envp = pointers(environment);
  const pid_t parent = ::getpid();
  const pid_t pid = ::fork();
  if (pid < 0)
    throw systemError("fork");
  if (pid == 0)
    execChild(parent, fds, argv.data(), envp.data());
  return pid;
}

ExitStatus waitChild(pid_t pid, std::chrono::milliseconds timeout) {
  ExitStatus status;
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
  if (done != pid)
    throw systemError("waitpid");
  status.exited = WIFEXITED(raw);
  status.code = status.exited ? WEXITSTATUS(raw) : -1;
  status.signal = WIFSIGNALED(raw) ? WTERMSIG(raw) : 0;
  return status;
}

RunResult runProcess(const RunOptions& options) {
  const Streams streams;
  const auto [in, out, err] = streams.fds;
  const auto size = static_cast<ssize_t>(options.input.size());
  if (in < 0 || out < 0 || err < 0 ||
      ::pwrite(in, options.input.data(), options.input.size(), 0) != size)
    throw systemError("cannot prepare the standard streams");
  RunResult result;
  result.status = waitChild(spawnChild(options.args, options.env, {{in, 0}, {out, 1}, {err, 2}}),
                            options.timeout);
  result.out = streams.text(1);
  result.err = streams.text(2);
  return result;
}

}  // namespace halvex::test
