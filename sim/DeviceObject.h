// SPDX-License-Identifier: MIT
// The device identity service, org.halvex.Device1 at /org/halvex/Device: GetIdentity answers with
// the identity the object holds, which starts as the scenario's; a change sends IdentityChanged.
// Runs on the daemon's loop.
#pragma once

#include <cstdint>

#include "sim/Endpoint.h"
#include "sim/Scenario.h"

namespace halvex::sim {

class DeviceObject {
 public:
  DeviceObject(Device identity, const Services& services);
  DeviceObject(const DeviceObject&) = delete;
  DeviceObject& operator=(const DeviceObject&) = delete;

  Endpoint& endpoint() { return endpoint_; }
  // The radio vendor the tool reads: 0 when the device identity service is absent.
  std::int64_t vendorSeenByTool() const { return identity_.present ? identity_.radioVendor : 0; }

  // Takes the values changes names, with the keys and types GetIdentity answers with, and sends
  // IdentityChanged. Returns a negative errno, changing nothing: -EINVAL for another key or type,
  // -ENOTCONN while the service is not on the bus, another when the signal cannot be sent.
  int change(const MessageDict& changes);

 private:
  static int onGetIdentity(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static const sd_bus_vtable kVtable[];

  Device identity_;
  const Services& services_;
  Endpoint endpoint_;
};

}  // namespace halvex::sim
