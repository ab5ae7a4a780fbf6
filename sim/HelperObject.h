// SPDX-License-Identifier: MIT
// The log-dump helper, org.halvex.Helper1 at /org/halvex/Helper: Perform answers VarniskStatus as
// the scenario says, and every other command with success and an empty dictionary. Runs on the
// daemon's loop.
#pragma once

#include "sim/DeviceObject.h"
#include "sim/Endpoint.h"
#include "sim/Scenario.h"

namespace halvex::sim {

class HelperObject {
 public:
  // device tells the radio vendor the log sets are named for.
  HelperObject(Helper scenario, const DeviceObject& device, const Services& services);
  HelperObject(const HelperObject&) = delete;
  HelperObject& operator=(const HelperObject&) = delete;

  Endpoint& endpoint() { return endpoint_; }

 private:
  static int onPerform(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static const sd_bus_vtable kVtable[];

  Helper scenario_;
  const DeviceObject& device_;
  const Services& services_;
  Endpoint endpoint_;
};

}  // namespace halvex::sim
