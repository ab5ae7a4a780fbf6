// Encoding of messages on the bus, shared by the host backend and the simulator.
// See docs/dbus-protocol.md for the mapping. These functions touch only the message they are
// given, so they run on whichever thread owns that message's bus.
#pragma once

#include <systemd/sd-bus.h>

#include "platform/MessageDict.h"

namespace halvex::bus {

// Deepest nesting of dictionaries accepted in either direction.
inline constexpr int kMaxDictDepth = 16;

// Appends dict as "a{sv}". Returns 0, or a negative errno (-EINVAL for a string that is not
// valid UTF-8 or nesting deeper than kMaxDictDepth).
int appendDict(sd_bus_message* message, const MessageDict& dict);

// Appends value as a variant "v"; null is a variant holding the empty signature.
int appendVariant(sd_bus_message* message, const MessageValue& value);

// Reads an "a{sv}" at the current position. Returns 0, or a negative errno when the message
// holds anything else there (-EBADMSG for a type outside the mapping).
int readDict(sd_bus_message* message, MessageDict& dict);

// Reads a "v" at the current position.
int readVariant(sd_bus_message* message, MessageValue& value);

}  // namespace halvex::bus
