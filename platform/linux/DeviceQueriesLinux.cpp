// SPDX-License-Identifier: MIT
// Device queries on a Linux host: the identity comes from org.halvex.Device over the system bus,
// processes from /proc.
//
// A device's radio, vendor, product and build types do not change while a process runs, so the
// identity is asked once and kept. Only an answer is kept: when no device service runs, or the
// question fails, it is asked again next time, so a passing fault never reads as "no baseband"
// for the rest of the process.
#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <limits>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/DeviceQueries.h"
#include "platform/linux/MessageCodec.h"
#include "platform/linux/detail/BusSupport.h"
#include "platform/linux/detail/CallBounds.h"
#include "platform/linux/detail/ProcessBus.h"

namespace halvex::device {

namespace {

// The kernel keeps a process's name (comm) in 16 bytes including the terminator.
constexpr std::size_t kCommLength = 15;
// Longest process name worth looking for; argv[0] is read no further than this.
constexpr std::size_t kMaxProcessName = 4096;

MessageDict fetchIdentity() {
  // Held across the first query, so that concurrent first callers make one query between them.
  static std::mutex mutex;
  static std::optional<MessageDict> kept;
  std::lock_guard lock(mutex);
  if (kept) {
    return *kept;
  }
  MessageDict identity;
  // A connection that went stale while nobody served it is replaced by the bus itself when the
  // question cannot be sent on it.
  const Result result = bus::ProcessBus::instance().call(
      {bus::kDeviceName, bus::kDevicePath, bus::kDeviceInterface, "GetIdentity",
       bus::callBounds().identity, "device", "GetIdentity"},
      nullptr, [&identity](sd_bus_message* reply) {
        if (sd_bus_message_has_signature(reply, "a{sv}") <= 0 ||
            bus::readDict(reply, identity) < 0) {
          identity = {};
          return bus::makeResult(kResultBadReply, "identity of the wrong shape");
        }
        return Result{};
      });
  if (result.ok()) {
    kept = identity;
  }
  return identity;
}

int identityNumber(const char* key) {
  const MessageDict identity = fetchIdentity();
  const MessageValue* value = identity.get(key);
  const std::int64_t* number = value ? value->asInt64() : nullptr;
  if (number == nullptr || *number < std::numeric_limits<int>::min() ||
      *number > std::numeric_limits<int>::max()) {
    return 0;
  }
  return static_cast<int>(*number);
}

bool identityFlag(const char* key) {
  const MessageDict identity = fetchIdentity();
  const MessageValue* value = identity.get(key);
  const bool* flag = value ? value->asBool() : nullptr;
  return flag != nullptr && *flag;
}

// The first field of a small file under /proc (procFd), at most kMaxProcessName + 1 bytes of it,
// or nothing when the process is gone. Plain reads relative to the open directory: a scan opens
// one of these per process on the host.
bool readFirstField(int procFd, const std::string& path, char terminator, std::string& out) {
  const int fd = openat(procFd, path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
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

std::string_view baseName(std::string_view path) {
  std::size_t slash = path.rfind('/');
  return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

// A process that has ended but is not yet reaped keeps its name; it is not running. Its state
// follows the name in stat, after the last ")" since the name may hold one itself.
bool hasEnded(int procFd, const std::string& pid) {
  std::string stat;
  if (!readFirstField(procFd, pid + "/stat", '\n', stat)) {
    return true;
  }
  const std::size_t close = stat.rfind(')');
  if (close == std::string::npos || close + 2 >= stat.size()) {
    return false;
  }
  const char state = stat[close + 2];
  return state == 'Z' || state == 'X';
}

bool processHasName(int procFd, const std::string& pid, const std::string& name) {
  std::string comm;
  if (!readFirstField(procFd, pid + "/comm", '\n', comm)) {
    return false;
  }
  if (name.size() < kCommLength) {
    return comm == name && !hasEnded(procFd, pid);
  }
  // comm holds only the first 15 bytes; a name that long is confirmed through argv[0], which the
  // program was started under (the link's name when started through a symbolic link). An ended
  // process has no argv left.
  if (comm != std::string_view(name).substr(0, kCommLength)) {
    return false;
  }
  std::string argv0;
  return readFirstField(procFd, pid + "/cmdline", '\0', argv0) && baseName(argv0) == name;
}

}  // namespace

int getRadioType() {
  return identityNumber("RadioType");
}

int getRadioVendor() {
  return identityNumber("RadioVendor");
}

int getProductType() {
  return identityNumber("ProductType");
}

bool isInternalBuild() {
  return identityFlag("InternalBuild");
}

bool isCarrierBuild() {
  return identityFlag("CarrierBuild");
}

bool isVendorBuild() {
  return identityFlag("VendorBuild");
}

bool isTraceAllowed() {
  return identityFlag("TraceAllowed");
}

bool isProcessRunning(const std::string& name) {
  if (name.empty() || name.size() > kMaxProcessName ||
      name.find_first_of(std::string_view("/\0\n", 3)) != std::string::npos) {
    return false;
  }
  DIR* proc = opendir("/proc");
  if (proc == nullptr) {
    return false;
  }
  bool found = false;
  while (!found) {
    errno = 0;
    const dirent* entry = readdir(proc);
    if (entry == nullptr) {
      break;
    }
    std::string_view pid(entry->d_name);
    if (pid.empty() || pid.find_first_not_of("0123456789") != std::string_view::npos) {
      continue;
    }
    found = processHasName(dirfd(proc), std::string(pid), name);
  }
  closedir(proc);
  return found;
}

std::string getProgramName() {
  return program_invocation_short_name;
}

}  // namespace halvex::device
