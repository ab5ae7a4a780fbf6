// SPDX-License-Identifier: MIT
// What every service of the host backend needs on the bus: the names of the protocol, the
// mapping of bus failures to Result codes, owning pointers and a blocking call for the services
// that are synchronous by contract. Nothing here keeps state between calls.
#pragma once

#include <systemd/sd-bus.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/MessageDict.h"
#include "platform/Result.h"

namespace halvex::bus {

inline constexpr char kServerName[] = "org.halvex.Server";
inline constexpr char kServerPath[] = "/org/halvex/Server";
inline constexpr char kServerInterface[] = "org.halvex.Server1";
inline constexpr char kHelperName[] = "org.halvex.Helper";
inline constexpr char kHelperPath[] = "/org/halvex/Helper";
inline constexpr char kHelperInterface[] = "org.halvex.Helper1";
inline constexpr char kDeviceName[] = "org.halvex.Device";
inline constexpr char kDevicePath[] = "/org/halvex/Device";
inline constexpr char kDeviceInterface[] = "org.halvex.Device1";

inline constexpr char kBusDriverName[] = "org.freedesktop.DBus";
inline constexpr char kBusDriverPath[] = "/org/freedesktop/DBus";
inline constexpr char kBusDriverInterface[] = "org.freedesktop.DBus";

// Client, command and service names travel as strings; longer ones are refused locally so that a
// caller's mistake costs nothing on the bus.
inline constexpr std::size_t kMaxNameLength = 255;

// Result messages are for logs only; a peer cannot make them grow beyond this.
inline constexpr std::size_t kMaxResultMessage = 1024;

struct BusCloser {
  void operator()(sd_bus* bus) const { sd_bus_close_unref(bus); }
};
struct MessageReleaser {
  void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
using BusPtr = std::unique_ptr<sd_bus, BusCloser>;
using MessagePtr = std::unique_ptr<sd_bus_message, MessageReleaser>;

// Non-empty, at most kMaxNameLength bytes and a valid bus string.
bool isSendableName(std::string_view name);

// text cut to kMaxResultMessage bytes.
std::string boundedText(std::string_view text);

Result makeResult(std::int32_t code, std::string_view message);

// The outcome of a call that failed: error is the bus error (may be unset) and r the negative
// errno sd-bus returned. bus is the connection the call went out on; once it is no longer open,
// every failure is our connection's fault, whatever name sd-bus gave it. deadlinePassed says
// that the call's time-out had run out when the failure came: sd-bus reports its own time-out of
// an asynchronous call as NoReply, under the same sender as a peer that crashed.
Result resultFromFailure(sd_bus* bus, const sd_bus_error* error, int r,
                         bool deadlinePassed = false);

// The monotonic time, and the moment a call sent now on bus times out.
std::uint64_t monotonicUsec();
std::uint64_t callDeadline(sd_bus* bus);

// The outcome when sd_bus_open_system itself failed with r: there is no bus to reach anyone on.
Result resultFromOpenFailure(int r);

// Reads a method reply "isv" (code, message, reply). A code other than 0 is returned as the
// Result with value left null; anything but "isv" gives kResultBadReply.
Result readOutcome(sd_bus_message* reply, MessageValue& value);

using MessageBuilder = std::function<int(sd_bus_message*)>;

// Calls member of destination synchronously on bus with sd-bus's default time-out and auto-start
// off. build appends the arguments; a negative return from it gives kResultInvalidRequest. On
// success reply holds the method return.
Result callSync(sd_bus* bus, const char* destination, const char* path, const char* interface,
                const char* member, const MessageBuilder& build, MessagePtr& reply);

}  // namespace halvex::bus
