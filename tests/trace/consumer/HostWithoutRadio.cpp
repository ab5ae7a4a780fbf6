// SPDX-License-Identifier: MIT
// A minimal platform backend: a host with no baseband radio, no build flags, no trace
// permission and no device properties. It defines what the trace library calls.
#include <map>
#include <memory>
#include <string>

#include "platform/DevicePropertyService.h"
#include "platform/DeviceQueries.h"

namespace halvex::device {

int getRadioType() {
  return 0;
}
int getRadioVendor() {
  return 0;
}
int getProductType() {
  return 0;
}
bool isInternalBuild() {
  return false;
}
bool isCarrierBuild() {
  return false;
}
bool isVendorBuild() {
  return false;
}
bool isTraceAllowed() {
  return false;
}

}  // namespace halvex::device

namespace halvex {

namespace {

class NoProperties final : public DevicePropertyService {
 public:
  std::map<std::string, std::string> getPropertyMap() override { return {}; }
};

}  // namespace

std::shared_ptr<DevicePropertyService> DevicePropertyService::create() {
  return std::make_shared<NoProperties>();
}

}  // namespace halvex
