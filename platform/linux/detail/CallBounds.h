// SPDX-License-Identifier: MIT
// How long each kind of request may take before the platform gives up on it. The bounds are the
// platform's own, whatever the environment says (libsystemd's default reads SYSTEMD_BUS_TIMEOUT,
// which may even be "infinity"); docs/dbus-protocol.md gives the reasoning for each.
#pragma once

#include <chrono>
#include <string_view>

#include "detail/Private.h"

namespace halvex::bus {

struct CallBounds {
  std::chrono::microseconds identity;      // the device's GetIdentity
  std::chrono::microseconds property;      // GetTraceProperty
  std::chrono::microseconds dump;          // TraceDumpState: may reset the baseband
  std::chrono::microseconds otherCommand;  // any other server command
  std::chrono::microseconds subscribe;     // Subscribe, and the bus driver's GetNameOwner
  std::chrono::microseconds helper;        // a helper service's Perform
};

const CallBounds& callBounds();

// The bound of one server command.
std::chrono::microseconds serverCommandBound(std::string_view command);

}  // namespace halvex::bus
