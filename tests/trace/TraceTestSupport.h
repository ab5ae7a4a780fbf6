// Shared by the trace tests: each test starts from a device of its choosing and then reads the
// platform calls that the code under test made.
#pragma once

#include <map>
#include <string>
#include <utility>
#include <vector>

#include "platform/fake/FakePlatform.h"

namespace halvex::trace::tests {

using Calls = std::vector<std::string>;

// The device answers the tests vary, for designated initializers; whatever is left out keeps the
// fake's default.
struct DeviceSpec {
  int radioType = fake::Device{}.radioType;
  int radioVendor = fake::Device{}.radioVendor;
  int productType = fake::Device{}.productType;
  bool internalBuild = fake::Device{}.internalBuild;
  bool carrierBuild = fake::Device{}.carrierBuild;
  bool vendorBuild = fake::Device{}.vendorBuild;
  bool traceAllowed = fake::Device{}.traceAllowed;
  std::map<std::string, std::string> properties = {};
};

// Answers as spec from now on and forgets every call made so far.
inline void useDevice(const DeviceSpec& spec) {
  fake::Device device;
  device.radioType = spec.radioType;
  device.radioVendor = spec.radioVendor;
  device.productType = spec.productType;
  device.internalBuild = spec.internalBuild;
  device.carrierBuild = spec.carrierBuild;
  device.vendorBuild = spec.vendorBuild;
  device.traceAllowed = spec.traceAllowed;
  device.properties = spec.properties;
  auto& platform = fake::FakePlatform::get();
  platform.setDevice(std::move(device));
  platform.clearCalls();
}

// The platform calls made since the last useDevice() or takeCalls(), in order.
inline Calls takeCalls() {
  auto& platform = fake::FakePlatform::get();
  Calls calls = platform.calls();
  platform.clearCalls();
  return calls;
}

}  // namespace halvex::trace::tests
