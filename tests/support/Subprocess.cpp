// SPDX-License-Identifier: MIT
#include "tests/support/Subprocess.h"

#include <fcntl.h>
#include <linux/close_range.h>
#include <poll.h>
#include <signal.h>
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

using Clock = std::chrono::steady_clock;

std::runtime_error systemError(const std::string& what, int error) {
  return std::runtime_error(what + ": " + std::strerror(error));
}

void closeFd(int& fd) {
  if (fd >= 0) {
    ::close(fd);
    fd = -1;
  }
}

std::vector<std::string> buildEnvironment(const EnvChanges& changes) {
  std::vector<std::string> env;
  for (char** entry = environ; *entry != nullptr; ++entry)
    env.emplace_back(*entry);
  for (const auto& [name, value] : changes) {
    const std::string prefix = name + "=";
    std::erase_if(env, [&](const std::string& e) { return e.starts_with(prefix); });
    if (value)
      env.push_back(prefix + *value);
  }
  return env;
}

std::vector<char*> pointers(std::vector<std::string>& strings) {
  std::vector<char*> result;
  for (auto& s : strings)
    result.push_back(s.data());
  result.push_back(nullptr);
  return result;
}

// Between fork and exec only async-signal-safe calls: the test process may have threads.
[[noreturn]] void execChild(pid_t parent, const std::vector<FdMapping>& fds, int errorFd,
                            char* const* argv, char* const* envp) {
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (::getppid() != parent)
    ::_exit(127);

  sigset_t none;
  ::sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  struct sigaction dfl {};
  dfl.sa_handler = SIG_DFL;
  ::sigaction(SIGPIPE, &dfl, nullptr);

  // Move every source above every target first, so a mapping cannot clobber another's source.
  int base = 3;
  for (const FdMapping& m : fds)
    base = std::max(base, m.childFd + 1);
  int moved[16];
  const std::size_t count = std::min<std::size_t>(fds.size(), 16);
  for (std::size_t i = 0; i < count; ++i)
    moved[i] = ::fcntl(fds[i].parentFd, F_DUPFD, base);
  for (std::size_t i = 0; i < count; ++i) {
    if (moved[i] < 0 || ::dup2(moved[i], fds[i].childFd) < 0) {
      const int error = errno;
      [[maybe_unused]] auto n = ::write(errorFd, &error, sizeof error);
      ::_exit(127);
    }
  }
  ::syscall(SYS_close_range, 3U, ~0U, CLOSE_RANGE_CLOEXEC);
  for (std::size_t i = 0; i < count; ++i)
    ::fcntl(fds[i].childFd, F_SETFD, 0);

  ::execve(argv[0], argv, envp);
  const int error = errno;
  [[maybe_unused]] auto n = ::write(errorFd, &error, sizeof error);
  ::_exit(127);
}

}  // namespace

std::string ExitStatus::describe() const {
  std::string text = exited ? "exit " + std::to_string(code) : "signal " + std::to_string(signal);
  return timedOut ? "timed out (" + text + ")" : text;
}

pid_t spawnChild(const std::vector<std::string>& args, const EnvChanges& env,
                 const std::vector<FdMapping>& fds) {
  if (args.empty())
    throw std::invalid_argument("spawnChild: no program");
  if (fds.size() > 16)
    throw std::invalid_argument("spawnChild: too many descriptors");
  std::vector<std::string> argStrings = args;
  std::vector<std::string> envStrings = buildEnvironment(env);
  std::vector<char*> argv = pointers(argStrings);
  std::vector<char*> envp = pointers(envStrings);

  int errorPipe[2];
  if (::pipe2(errorPipe, O_CLOEXEC) != 0)
    throw systemError("pipe2", errno);
  const pid_t parent = ::getpid();
  const pid_t pid = ::fork();
  if (pid < 0) {
    const int error = errno;
    ::close(errorPipe[0]);
    ::close(errorPipe[1]);
    throw systemError("fork", error);
  }
  if (pid == 0)
    execChild(parent, fds, errorPipe[1], argv.data(), envp.data());

  ::close(errorPipe[1]);
  int childError = 0;
  ssize_t got;
  do {
    got = ::read(errorPipe[0], &childError, sizeof childError);
  } while (got < 0 && errno == EINTR);
  ::close(errorPipe[0]);
  if (got == static_cast<ssize_t>(sizeof childError)) {
    ::waitpid(pid, nullptr, 0);
    throw systemError("cannot start " + args[0], childError);
  }
  return pid;
}

ExitStatus waitChild(pid_t pid, std::chrono::milliseconds timeout) {
  ExitStatus status;
  const auto deadline = Clock::now() + timeout;
  int raw = 0;
  for (;;) {
    const pid_t done = ::waitpid(pid, &raw, WNOHANG);
    if (done == pid)
      break;
    if (done < 0 && errno != EINTR)
      throw systemError("waitpid", errno);
    if (Clock::now() >= deadline) {
      ::kill(pid, SIGKILL);
      ::waitpid(pid, &raw, 0);
      status.timedOut = true;
      break;
    }
    // A pidfd would let us sleep exactly until the exit; the kernel may refuse one in a
    // container, and a few milliseconds of latency do not matter to a test.
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  if (WIFEXITED(raw)) {
    status.exited = true;
    status.code = WEXITSTATUS(raw);
  } else if (WIFSIGNALED(raw)) {
    status.signal = WTERMSIG(raw);
  }
  return status;
}

RunResult runProcess(const RunOptions& options) {
  int in[2], out[2], err[2];
  if (::pipe2(in, O_CLOEXEC) != 0)
    throw systemError("pipe2", errno);
  if (::pipe2(out, O_CLOEXEC) != 0)
    throw systemError("pipe2", errno);
  if (::pipe2(err, O_CLOEXEC) != 0)
    throw systemError("pipe2", errno);

  // A child that stops reading must not kill the test with SIGPIPE: block it on this thread and
  // discard any that is raised before unblocking.
  sigset_t pipeSet, oldMask;
  ::sigemptyset(&pipeSet);
  ::sigaddset(&pipeSet, SIGPIPE);
  ::pthread_sigmask(SIG_BLOCK, &pipeSet, &oldMask);

  RunResult result;
  pid_t pid = -1;
  try {
    pid = spawnChild(options.args, options.env, {{in[0], 0}, {out[1], 1}, {err[1], 2}});
  } catch (...) {
    for (int fd : {in[0], in[1], out[0], out[1], err[0], err[1]})
      ::close(fd);
    ::pthread_sigmask(SIG_SETMASK, &oldMask, nullptr);
    throw;
  }
  closeFd(in[0]);
  closeFd(out[1]);
  closeFd(err[1]);
  ::fcntl(in[1], F_SETFL, O_NONBLOCK);

  std::size_t written = 0;
  if (options.input.empty())
    closeFd(in[1]);
  const auto deadline = Clock::now() + options.timeout;
  bool exited = false;
  int raw = 0;
  while (out[0] >= 0 || err[0] >= 0) {
    if (!exited) {
      const pid_t done = ::waitpid(pid, &raw, WNOHANG);
      exited = done == pid;
    }
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() <= 0)
      break;
    // Once the child has gone, its output is all in the pipes: drain without waiting, so a
    // grandchild holding the pipes open cannot stall us.
    const int wait = exited ? 0 : static_cast<int>(std::min<long long>(left.count(), 20));
    pollfd polls[3] = {{out[0], POLLIN, 0}, {err[0], POLLIN, 0}, {in[1], POLLOUT, 0}};
    const int ready = ::poll(polls, 3, wait);
    if (ready < 0 && errno != EINTR)
      break;
    if (ready == 0 && exited)
      break;
    for (int i = 0; i < 2; ++i) {
      int& fd = i == 0 ? out[0] : err[0];
      if (fd < 0 || polls[i].revents == 0)
        continue;
      char buffer[4096];
      const ssize_t n = ::read(fd, buffer, sizeof buffer);
      if (n > 0) {
        (i == 0 ? result.out : result.err).append(buffer, static_cast<std::size_t>(n));
      } else if (n == 0 || errno != EINTR) {
        closeFd(fd);
      }
    }
    if (in[1] >= 0 && polls[2].revents != 0) {
      const ssize_t n =
          ::write(in[1], options.input.data() + written, options.input.size() - written);
      if (n > 0)
        written += static_cast<std::size_t>(n);
      if ((n < 0 && errno != EAGAIN && errno != EINTR) || written == options.input.size()) {
        closeFd(in[1]);
      }
    }
  }
  for (int* fd : {&in[1], &out[0], &err[0]})
    closeFd(*fd);

  if (exited) {
    if (WIFEXITED(raw)) {
      result.status.exited = true;
      result.status.code = WEXITSTATUS(raw);
    } else if (WIFSIGNALED(raw)) {
      result.status.signal = WTERMSIG(raw);
    }
  } else {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
    result.status = waitChild(pid, std::max(left, std::chrono::milliseconds(0)));
  }

  timespec zero{};
  while (::sigtimedwait(&pipeSet, nullptr, &zero) == SIGPIPE) {
  }
  ::pthread_sigmask(SIG_SETMASK, &oldMask, nullptr);
  return result;
}

}  // namespace halvex::test
