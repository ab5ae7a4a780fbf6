// SPDX-License-Identifier: MIT
// Device properties on a Linux host: the kernel's command line stands for the boot arguments.
#include <fstream>
#include <iterator>

#include "platform/DevicePropertyService.h"

namespace halvex {

namespace {

// /proc/cmdline is at most a few kilobytes; anything beyond this is not a command line.
constexpr std::size_t kMaxCommandLine = std::size_t{64} * 1024;

class LinuxDevicePropertyService final : public DevicePropertyService {
 public:
  std::map<std::string, std::string> getPropertyMap() override {
    std::map<std::string, std::string> properties;
    std::ifstream file("/proc/cmdline", std::ios::binary);
    if (!file) {
      return properties;
    }
    std::string line;
    char c = 0;
    while (line.size() < kMaxCommandLine && file.get(c)) {
      line.push_back(c);
    }
    while (!line.empty() && (line.back() == '\n' || line.back() == '\0')) {
      line.pop_back();
    }
    properties.emplace("boot-args", std::move(line));
    return properties;
  }
};

}  // namespace

std::shared_ptr<DevicePropertyService> DevicePropertyService::create() {
  return std::make_shared<LinuxDevicePropertyService>();
}

}  // namespace halvex
