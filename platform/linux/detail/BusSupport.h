// SPDX-License-Identifier: MIT
// What every service of the host backend needs on the bus: the mapping of bus failures to Result
// codes, and the checks and bounds of what goes out. Nothing here keeps state between calls.
#pragma once

#include <systemd/sd-bus.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "detail/Private.h"
#include "platform/MessageDict.h"
#include "platform/Result.h"
#include "platform/linux/BusProtocol.h"

namespace halvex::bus {

// Where the platform's own entries in the system log come from.
inline constexpr char kLogSubsystem[] = "org.halvex.platform";

// Client, command and service names travel as strings; longer ones are refused locally so that a
// caller's mistake costs nothing on the bus.
inline constexpr std::size_t kMaxNameLength = 255;

// Result messages are for logs only; a peer cannot make them grow beyond this.
inline constexpr std::size_t kMaxResultMessage = 1024;

struct MessageReleaser {
  void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
using MessagePtr = std::unique_ptr<sd_bus_message, MessageReleaser>;

// Non-empty, at most kMaxNameLength bytes and a valid bus string.
bool isSendableName(std::string_view name);

// text cut to kMaxResultMessage bytes.
std::string boundedText(std::string_view text);

Result makeResult(std::int32_t code, std::string_view message);

// What errno value error means, in words (strerror's text, but safe from any thread).
std::string errnoText(int error);

// The monotonic clock in microseconds, as sd-event counts it.
std::uint64_t monotonicUsec();

// The outcome of a call that sd-bus refused with the negative errno r on bus (null when no
// connection was involved). Once the connection is no longer open every failure is its fault.
Result resultFromErrno(sd_bus* bus, int r);

// The outcome carried by an error reply. Only the bus driver can say that a name has no owner:
// the same error names sent by the peer itself are plain failures.
Result resultFromErrorReply(sd_bus* bus, sd_bus_message* reply);

// The outcome when sd_bus_open_system itself failed with r: there is no bus to reach anyone on.
Result resultFromOpenFailure(int r);

// Match rules: the bus driver's NameOwnerChanged for name, and a signal at path from sender (a
// name the bus resolves to its owner when the signal comes; null: from anyone).
std::string ownerChangedRule(const char* name);
std::string signalRule(const char* sender, const char* path, const char* interface,
                       const char* member);

// Reads a method reply "isv" (code, message, reply) into the outcome and value, whatever the
// code: a caller that needs success checks it. Anything but "isv", or a value outside the
// mapping, gives kResultBadReply with value left as it was.
Result readOutcome(sd_bus_message* reply, MessageValue& value);

using MessageBuilder = std::function<int(sd_bus_message*)>;

}  // namespace halvex::bus
