// SPDX-License-Identifier: MIT
// The control interface's methods. Each answers at once, except SetServerPresent, which the
// server object answers once the bus has done what it asked.
#include "sim/ControlObject.h"

#include <cerrno>
#include <string>
#include <system_error>

#include "platform/ServerProtocol.h"
#include "platform/linux/MessageCodec.h"

namespace halvex::sim {
namespace {

constexpr ObjectNames kNames{"org.halvex.Simulator", "/org/halvex/Simulator",
                             "org.halvex.Simulator1", "control"};
constexpr char kErrorNoState[] = "org.halvex.Simulator.Error.NoState";
constexpr char kErrorServerAbsent[] = "org.halvex.Simulator.Error.ServerAbsent";
constexpr char kErrorDeviceAbsent[] = "org.halvex.Simulator.Error.DeviceAbsent";

}  // namespace

// Argument names are those of data/dbus/interfaces/*.xml, which a test holds equal to these.
const sd_bus_vtable ControlObject::kVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("EmitState", "", "", &ControlObject::onEmitState, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("EmitEvent", "sv", SD_BUS_PARAM(name) SD_BUS_PARAM(payload), "", "",
                             &ControlObject::onEmitEvent, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("SetServerPresent", "b", SD_BUS_PARAM(present), "", "",
                             &ControlObject::onSetServerPresent, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("SetIdentity", "a{sv}", SD_BUS_PARAM(identity), "", "",
                             &ControlObject::onSetIdentity, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("Quit", "", "", &ControlObject::onQuit, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END};

ControlObject::ControlObject(ServerObject& server, DeviceObject& device, const Services& services)
    : server_(server),
      device_(device),
      services_(services),
      endpoint_(kNames, kVtable, this, services) {}

int ControlObject::emit(sd_bus_message* call, sd_bus_error* error, const std::string& asked,
                        const char* name, const MessageValue& payload) {
  if (server_.emit(name, payload) < 0) {
    return endpoint_.refuse(error, asked, kErrorServerAbsent, "the server is not on the bus");
  }
  endpoint_.journal().log(LogLevel::kInfo, asked + ": sent " + describe(payload));
  return sd_bus_reply_method_return(call, "");
}

int ControlObject::onEmitState(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<ControlObject*>(userdata);
    const std::optional<StateEvent>& state = self->server_.stateEvent();
    if (!state) {
      return self->endpoint_.refuse(error, "EmitState", kErrorNoState,
                                    "the scenario has no state event");
    }
    return self->emit(call, error, "EmitState", kEventServerStateChange, state->payload);
  });
}

int ControlObject::onEmitEvent(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<ControlObject*>(userdata);
    const char* name = nullptr;
    const int r = sd_bus_message_read(call, "s", &name);
    if (r < 0) {
      return r;
    }
    const std::string asked = std::string("EmitEvent ") + name;
    MessageValue payload;
    if (bus::readVariant(call, payload) < 0) {
      return self->endpoint_.refuse(error, asked, SD_BUS_ERROR_INVALID_ARGS,
                                    "the payload holds a value outside the message types");
    }
    return self->emit(call, error, asked, name, payload);
  });
}

int ControlObject::onSetServerPresent(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<ControlObject*>(userdata);
    int present = 0;
    const int r = sd_bus_message_read(call, "b", &present);
    if (r < 0) {
      return r;
    }
    self->server_.setPresent(present != 0, keep(call), self->endpoint_.journal());
    return 1;
  });
}

int ControlObject::onSetIdentity(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<ControlObject*>(userdata);
    MessageDict changes;
    if (bus::readDict(call, changes) < 0) {
      return self->endpoint_.refuse(error, "SetIdentity", SD_BUS_ERROR_INVALID_ARGS,
                                    "the identity holds a value outside the message types");
    }
    const std::string asked = "SetIdentity " + describe(MessageValue::dict(changes));
    const int r = self->device_.change(changes);
    if (r == -EINVAL) {
      return self->endpoint_.refuse(error, asked, SD_BUS_ERROR_INVALID_ARGS,
                                    "a key or a type that GetIdentity does not answer with");
    }
    if (r == -ENOTCONN) {
      return self->endpoint_.refuse(error, asked, kErrorDeviceAbsent,
                                    "the device is not on the bus");
    }
    if (r < 0) {
      const std::string reason =
          "IdentityChanged cannot be sent: " + std::generic_category().message(-r);
      return self->endpoint_.refuse(error, asked, SD_BUS_ERROR_FAILED, reason.c_str());
    }
    self->endpoint_.journal().log(LogLevel::kInfo, asked + ": IdentityChanged sent");
    return sd_bus_reply_method_return(call, "");
  });
}

int ControlObject::onQuit(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<ControlObject*>(userdata);
    const int r = sd_bus_reply_method_return(call, "");
    self->endpoint_.journal().log(LogLevel::kInfo, "Quit: exiting");
    sd_event_exit(self->services_.event, 0);
    return r < 0 ? r : 1;
  });
}

}  // namespace halvex::sim
