// SPDX-License-Identifier: MIT
// Processes on a Linux host, from /proc. A check that cannot read /proc answers "not running",
// as the interface demands, and leaves one warning in the system log saying what it could not
// read and why, since that answer alone would mislead whoever reads the tool's refusal.
#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <string_view>

#include "detail/BusSupport.h"
#include "platform/DeviceQueries.h"
#include "platform/SystemLog.h"

namespace halvex::device {

namespace {

// The kernel keeps a process's name (comm) in 16 bytes including the terminator.
constexpr std::size_t kCommLength = 15;
// Longest process name worth looking for; argv[0] is read no further than this.
constexpr std::size_t kMaxProcessName = 4096;

// One look through /proc, and the first thing it could not read.
class Scan {
 public:
  explicit Scan(const std::string& name) : name_(name) {}

  // The first field of a small file under /proc, at most kMaxProcessName + 1 bytes of it. False
  // when it cannot be read; a process that ended meanwhile is no failure of the scan.
  bool readFirstField(int procFd, const std::string& path, char terminator, std::string& out) {
    const int fd = openat(procFd, path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
      if (errno != ENOENT && errno != ESRCH) {
        fail("/proc/" + path, errno);
      }
      return false;
    }
    out.clear();
    char buffer[512];
    bool done = false;
    while (!done && out.size() <= kMaxProcessName) {
      const ssize_t n = read(fd, buffer, sizeof buffer);
      if (n < 0 && errno == EINTR) {
        continue;
      }
      if (n <= 0) {
        break;
      }
      std::string_view chunk(buffer, static_cast<std::size_t>(n));
      const std::size_t end = chunk.find(terminator);
      done = end != std::string_view::npos;
      out.append(chunk.substr(0, done ? end : chunk.size()));
    }
    close(fd);
    if (out.size() > kMaxProcessName + 1) {
      out.resize(kMaxProcessName + 1);
    }
    return true;
  }

  // Only the first failure is told: the rest usually share its cause.
  void fail(const std::string& what, int error) {
    if (failed_) {
      return;
    }
    failed_ = true;
    LogServer::create()->write(
        LogContext(bus::kLogSubsystem, "device"), LogLevel::kWarning,
        "process check for " + name_ + ": cannot read " + what + ": " + bus::errnoText(error));
  }

 private:
  const std::string& name_;
  bool failed_ = false;
};

std::string_view baseName(std::string_view path) {
  std::size_t slash = path.rfind('/');
  return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

// A process that has ended but is not yet reaped keeps its name; it is not running. Its state
// follows the name in stat, after the last ")" since the name may hold one itself.
bool hasEnded(Scan& scan, int procFd, const std::string& pid) {
  std::string stat;
  if (!scan.readFirstField(procFd, pid + "/stat", '\n', stat)) {
    return true;
  }
  const std::size_t close = stat.rfind(')');
  if (close == std::string::npos || close + 2 >= stat.size()) {
    return false;
  }
  const char state = stat[close + 2];
  return state == 'Z' || state == 'X';
}

bool processHasName(Scan& scan, int procFd, const std::string& pid, const std::string& name) {
  std::string comm;
  if (!scan.readFirstField(procFd, pid + "/comm", '\n', comm)) {
    return false;
  }
  if (name.size() < kCommLength) {
    return comm == name && !hasEnded(scan, procFd, pid);
  }
  // comm holds only the first 15 bytes; a name that long is confirmed through argv[0], which the
  // program was started under (the link's name when started through a symbolic link). An ended
  // process has no argv left.
  if (comm != std::string_view(name).substr(0, kCommLength)) {
    return false;
  }
  std::string argv0;
  return scan.readFirstField(procFd, pid + "/cmdline", '\0', argv0) && baseName(argv0) == name;
}

}  // namespace

bool isProcessRunning(const std::string& name) {
  if (name.empty() || name.size() > kMaxProcessName ||
      name.find_first_of(std::string_view("/\0\n", 3)) != std::string::npos) {
    return false;
  }
  Scan scan(name);
  DIR* proc = opendir("/proc");
  if (proc == nullptr) {
    scan.fail("/proc", errno);
    return false;
  }
  bool found = false;
  while (!found) {
    errno = 0;
    const dirent* entry = readdir(proc);
    if (entry == nullptr) {
      if (errno != 0) {
        scan.fail("/proc", errno);
      }
      break;
    }
    std::string_view pid(entry->d_name);
    if (pid.empty() || pid.find_first_not_of("0123456789") != std::string_view::npos) {
      continue;
    }
    found = processHasName(scan, dirfd(proc), std::string(pid), name);
  }
  closedir(proc);
  return found;
}

std::string getProgramName() {
  return program_invocation_short_name;
}

}  // namespace halvex::device
