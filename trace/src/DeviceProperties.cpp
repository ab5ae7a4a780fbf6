// SPDX-License-Identifier: MIT
// The device's named properties, read once through one shared DevicePropertyService. Kept apart
// from the other identity queries so that only programs reading properties need the service.
#include <map>
#include <memory>
#include <string>

#include "halvex/trace/DeviceIdentity.h"
#include "platform/DevicePropertyService.h"

namespace halvex::trace {

namespace {

// Created by the first caller that needs it and shared until exit; callers hold a counted
// reference while they use it.
std::shared_ptr<DevicePropertyService> propertyService() {
  static const std::shared_ptr<DevicePropertyService> service = DevicePropertyService::create();
  return service;
}

const std::map<std::string, std::string>& propertyMap() {
  static const std::map<std::string, std::string> properties = propertyService()->getPropertyMap();
  return properties;
}

}  // namespace

std::string getBootArgs() {
  const auto& properties = propertyMap();
  const auto found = properties.find("boot-args");
  return found != properties.end() ? found->second : std::string();
}

}  // namespace halvex::trace
