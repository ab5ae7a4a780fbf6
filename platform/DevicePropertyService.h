// SPDX-License-Identifier: MIT
// The device-property service: named properties of the device (such as "boot-args").
#pragma once

#include <map>
#include <memory>
#include <string>

namespace halvex {

class DevicePropertyService {
 public:
  virtual ~DevicePropertyService() = default;

  // Never null.
  static std::shared_ptr<DevicePropertyService> create();

  // Every property the device has, by name. Safe to call from any thread.
  virtual std::map<std::string, std::string> getPropertyMap() = 0;
};

}  // namespace halvex
