// SPDX-License-Identifier: MIT
#include "sim/ProcessKeeper.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>

namespace halvex::sim {
namespace {

constexpr const char* kSleep = "/bin/sleep";

}  // namespace

ProcessKeeper::~ProcessKeeper() {
  for (pid_t pid : pids_) {
    ::kill(pid, SIGKILL);
  }
  for (pid_t pid : pids_) {
    while (::waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
    }
  }
}

void ProcessKeeper::start(const std::vector<std::string>& names) {
  if (names.empty()) {
    return;
  }
  std::string dir = (std::filesystem::temp_directory_path() / "halvex-sim-XXXXXX").string();
  if (::mkdtemp(dir.data()) == nullptr) {
    throw std::system_error(errno, std::generic_category(), "cannot create a folder for processes");
  }
  // The links matter only to exec, which has read them by the time it returns in the child; the
  // folder goes as soon as every process is started, so a killed simulator leaves nothing behind.
  struct RemoveDir {
    std::string path;
    ~RemoveDir() {
      std::error_code ignored;
      std::filesystem::remove_all(path, ignored);
    }
  } remove{dir};
  const pid_t self = ::getpid();
  for (const std::string& name : names) {
    const std::string link = (std::filesystem::path(dir) / name).string();
    if (::symlink(kSleep, link.c_str()) != 0) {
      throw std::system_error(errno, std::generic_category(), "cannot link " + link);
    }
    // An exec failure is reported through a pipe that a successful exec closes.
    int report[2];
    if (::pipe2(report, O_CLOEXEC) != 0) {
      throw std::system_error(errno, std::generic_category(), "pipe2");
    }
    const pid_t pid = ::fork();
    if (pid < 0) {
      const int error = errno;
      ::close(report[0]);
      ::close(report[1]);
      throw std::system_error(error, std::generic_category(), "fork");
    }
    if (pid == 0) {
      // Die with the simulator however it ends; the check covers a parent already gone.
      ::prctl(PR_SET_PDEATHSIG, SIGKILL);
      if (::getppid() != self) {
        ::_exit(0);
      }
      sigset_t none;
      ::sigemptyset(&none);
      ::pthread_sigmask(SIG_SETMASK, &none, nullptr);
      char infinity[] = "infinity";
      char* argv[] = {const_cast<char*>(link.c_str()), infinity, nullptr};
      ::execv(link.c_str(), argv);
      const int error = errno;
      [[maybe_unused]] auto n = ::write(report[1], &error, sizeof error);
      ::_exit(127);
    }
    pids_.push_back(pid);
    ::close(report[1]);
    int error = 0;
    ssize_t got;
    while ((got = ::read(report[0], &error, sizeof error)) < 0 && errno == EINTR) {
    }
    ::close(report[0]);
    if (got == static_cast<ssize_t>(sizeof error)) {
      throw std::system_error(error, std::generic_category(), "cannot start process " + name);
    }
  }
}

}  // namespace halvex::sim
