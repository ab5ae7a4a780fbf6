// Device queries on a Linux host: the identity comes from org.halvex.Device over the system bus,
// processes from /proc.
//
// Every identity query opens a connection of its own, asks GetIdentity and closes it again. That
// costs a millisecond or so, but these queries are rare, may come from any thread, and must answer
// afresh each time; a connection per call shares nothing between threads and never goes stale.
#include <dirent.h>

#include <cerrno>
#include <cstdint>
#include <fstream>
#include <limits>
#include <string>
#include <string_view>

#include "platform/DeviceQueries.h"
#include "platform/linux/MessageCodec.h"
#include "platform/linux/detail/BusSupport.h"

namespace halvex::device {

namespace {

// The kernel keeps a process's name (comm) in 16 bytes including the terminator.
constexpr std::size_t kCommLength = 15;
// Longest process name worth looking for; argv[0] is read no further than this.
constexpr std::size_t kMaxProcessName = 4096;

// The identity as the device reported it; empty when it could not be asked.
MessageDict fetchIdentity() {
  sd_bus* opened = nullptr;
  if (sd_bus_open_system(&opened) < 0) {
    return {};
  }
  bus::BusPtr connection(opened);
  bus::MessagePtr reply;
  Result result = bus::callSync(connection.get(), bus::kDeviceName, bus::kDevicePath,
                                bus::kDeviceInterface, "GetIdentity", nullptr, reply);
  MessageDict identity;
  if (!result.ok() || sd_bus_message_has_signature(reply.get(), "a{sv}") <= 0 ||
      bus::readDict(reply.get(), identity) < 0) {
    return {};
  }
  return identity;
}

int identityNumber(const char* key) {
  MessageDict identity = fetchIdentity();
  const MessageValue* value = identity.get(key);
  const std::int64_t* number = value ? value->asInt64() : nullptr;
  if (number == nullptr || *number < std::numeric_limits<int>::min() ||
      *number > std::numeric_limits<int>::max()) {
    return 0;
  }
  return static_cast<int>(*number);
}

bool identityFlag(const char* key) {
  MessageDict identity = fetchIdentity();
  const MessageValue* value = identity.get(key);
  const bool* flag = value ? value->asBool() : nullptr;
  return flag != nullptr && *flag;
}

// The first line of a small /proc file, or nothing when the process is gone.
bool readFirstField(const std::string& path, char terminator, std::string& out) {
  std::ifstream file(path, std::ios::binary);
  if (!file) {
    return false;
  }
  out.clear();
  char c = 0;
  while (out.size() <= kMaxProcessName && file.get(c) && c != terminator) {
    out.push_back(c);
  }
  return true;
}

std::string_view baseName(std::string_view path) {
  std::size_t slash = path.rfind('/');
  return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

bool processHasName(const std::string& pid, const std::string& name) {
  std::string comm;
  if (!readFirstField("/proc/" + pid + "/comm", '\n', comm)) {
    return false;
  }
  if (name.size() < kCommLength) {
    return comm == name;
  }
  // comm holds only the first 15 bytes; a name that long is confirmed through argv[0], which the
  // program was started under (the link's name when started through a symbolic link).
  if (comm != std::string_view(name).substr(0, kCommLength)) {
    return false;
  }
  std::string argv0;
  return readFirstField("/proc/" + pid + "/cmdline", '\0', argv0) && baseName(argv0) == name;
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
    found = processHasName(std::string(pid), name);
  }
  closedir(proc);
  return found;
}

std::string getProgramName() {
  return program_invocation_short_name;
}

}  // namespace halvex::device
