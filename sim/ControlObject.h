// SPDX-License-Identifier: MIT
// The simulator's control interface, org.halvex.Simulator1 at /org/halvex/Simulator, through
// which tests steer a running simulator: EmitState and EmitEvent send the server's Event signal,
// SetServerPresent takes the server off the bus or brings it back, SetIdentity changes the
// device's identity, and Quit ends the loop. Its
// connection is the first made and stays for the daemon's life. Runs on the daemon's loop.
#pragma once

#include <string>

#include "sim/DeviceObject.h"
#include "sim/Endpoint.h"
#include "sim/ServerObject.h"

namespace halvex::sim {

class ControlObject {
 public:
  ControlObject(ServerObject& server, DeviceObject& device, const Services& services);
  ControlObject(const ControlObject&) = delete;
  ControlObject& operator=(const ControlObject&) = delete;

  Endpoint& endpoint() { return endpoint_; }

 private:
  static int onEmitState(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onEmitEvent(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onSetServerPresent(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onSetIdentity(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onQuit(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static const sd_bus_vtable kVtable[];

  // Sends the server's Event signal, refusing the call when the server is not on the bus.
  int emit(sd_bus_message* call, sd_bus_error* error, const std::string& asked, const char* name,
           const MessageValue& payload);

  ServerObject& server_;
  DeviceObject& device_;
  const Services& services_;
  Endpoint endpoint_;
};

}  // namespace halvex::sim
