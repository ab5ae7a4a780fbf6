// SPDX-License-Identifier: MIT
// Encoding of messages on the bus, shared by the host backend and the simulator.
// See docs/dbus-protocol.md for the mapping. These functions touch only the message they are
// given, so they run on whichever thread owns that message's bus.
//
// Encoding checks the whole value before it appends anything, so a value that cannot be sent
// leaves the message as it was: never half-built. Decoding stops at the first fault; the message's
// read position is then wherever the fault was found and the caller should treat the whole message
// as bad. Decoded output is only complete when the call returns 0.
#pragma once

#include <systemd/sd-bus.h>

#include <cstddef>
#include <string_view>

#include "platform/MessageDict.h"

namespace halvex::bus {

// Deepest nesting of dictionaries accepted in either direction.
inline constexpr int kMaxDictDepth = 16;

// Largest number of entries in one dictionary, and of values (entries and nested values counted
// together) in one encoded or decoded value. Both directions enforce them so that a peer cannot
// make us spend unbounded time or memory on one message; MessageDict's set is linear in its size.
inline constexpr std::size_t kMaxDictEntries = 1024;
inline constexpr std::size_t kMaxValues = 16384;

// True when text can travel as a D-Bus string unchanged: valid UTF-8 (no overlong forms, no
// surrogates, no noncharacters, as sd-bus checks it) without a NUL byte. sd-bus takes C strings,
// so a NUL would silently cut the value.
bool isBusString(std::string_view text);

// Appends dict as "a{sv}". A string value the bus cannot carry (not UTF-8, a NUL byte, a
// noncharacter) is sent as null instead, so a request is never lost to one bad value. Returns 0,
// or a negative errno (-EINVAL for such a key, or nesting deeper than kMaxDictDepth; -E2BIG
// beyond the size limits above).
int appendDict(sd_bus_message* message, const MessageDict& dict);

// Appends value as a variant "v"; null is a variant holding the empty signature. Errors as for
// appendDict.
int appendVariant(sd_bus_message* message, const MessageValue& value);

// Reads an "a{sv}" at the current position. Returns 0, or a negative errno when the message
// holds anything else there (-EBADMSG for a type outside the mapping, a non-empty signature in a
// null variant or nesting deeper than kMaxDictDepth; -E2BIG beyond the size limits). A key that
// occurs twice keeps its first position and its last value, as MessageDict::set does.
int readDict(sd_bus_message* message, MessageDict& dict);

// Reads a "v" at the current position.
int readVariant(sd_bus_message* message, MessageValue& value);

}  // namespace halvex::bus
