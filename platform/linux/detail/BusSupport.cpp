// SPDX-License-Identifier: MIT
#include "detail/BusSupport.h"

#include <cerrno>
#include <cstring>
#include <ctime>
#include <system_error>

#include "platform/linux/MessageCodec.h"

namespace halvex::bus {

bool isSendableName(std::string_view name) {
  return !name.empty() && name.size() <= kMaxNameLength && isBusString(name);
}

std::string boundedText(std::string_view text) {
  return std::string(text.substr(0, kMaxResultMessage));
}

Result makeResult(std::int32_t code, std::string_view message) {
  return Result{code, boundedText(message)};
}

std::string errnoText(int error) {
  return std::generic_category().message(error);
}

namespace {

std::int32_t codeForLocalErrno(int r) {
  switch (r) {
    case -ENOBUFS:  // sd-bus's own queue of unsent messages is full
      return kResultLimitsExceeded;
    case -ETIMEDOUT: return kResultTimeout;
    case -ENOTCONN:
    case -ECONNRESET:
    case -EPIPE: return kResultConnectionLost;
    default: return kResultBusError;
  }
}

}  // namespace

std::uint64_t monotonicUsec() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<std::uint64_t>(now.tv_sec) * 1000000u +
         static_cast<std::uint64_t>(now.tv_nsec) / 1000u;
}

Result resultFromErrno(sd_bus* bus, int r) {
  std::string text = std::string("errno ") + std::to_string(-r) + ": " + errnoText(-r);
  if (bus != nullptr && sd_bus_is_open(bus) <= 0) {
    return makeResult(kResultConnectionLost, text);
  }
  return makeResult(codeForLocalErrno(r), text);
}

Result resultFromErrorReply(sd_bus* bus, sd_bus_message* reply) {
  const sd_bus_error* error = sd_bus_message_get_error(reply);
  if (error == nullptr || !sd_bus_error_is_set(error)) {
    return makeResult(kResultBadReply, "error reply without a name");
  }
  std::string text = error->name;
  if (error->message != nullptr) {
    text += ": ";
    text += error->message;
  }
  // Whatever sd-bus synthesises after our connection went (NoReply "Connection terminated") is
  // our connection's fault, not the peer's.
  if (bus == nullptr || sd_bus_is_open(bus) <= 0) {
    return makeResult(kResultConnectionLost, text);
  }
  const char* sender = sd_bus_message_get_sender(reply);
  const bool fromDriver = sender != nullptr && std::strcmp(sender, kBusDriverName) == 0;
  if (fromDriver &&
      sd_bus_error_has_names(error, SD_BUS_ERROR_NAME_HAS_NO_OWNER, SD_BUS_ERROR_SERVICE_UNKNOWN)) {
    return makeResult(kResultServerNotRunning, text);
  }
  // Time-outs are our own (ProcessBus), so a NoReply means the peer left without answering.
  if (sd_bus_error_has_name(error, SD_BUS_ERROR_NO_REPLY)) {
    return makeResult(kResultServerGone, text);
  }
  if (sd_bus_error_has_name(error, SD_BUS_ERROR_TIMEOUT)) {
    return makeResult(kResultTimeout, text);
  }
  if (sd_bus_error_has_name(error, SD_BUS_ERROR_LIMITS_EXCEEDED)) {
    return makeResult(kResultLimitsExceeded, text);
  }
  return makeResult(kResultBusError, text);
}

Result resultFromOpenFailure(int r) {
  return makeResult(kResultServerNotRunning, "no system bus: " + errnoText(r < 0 ? -r : r));
}

std::string ownerChangedRule(const char* name) {
  return std::string("type='signal',sender='") + kBusDriverName + "',path='" + kBusDriverPath +
         "',interface='" + kBusDriverInterface + "',member='NameOwnerChanged',arg0='" + name + "'";
}

std::string signalRule(const char* sender, const char* path, const char* interface,
                       const char* member) {
  std::string rule = "type='signal',";
  if (sender != nullptr) {
    rule = rule + "sender='" + sender + "',";
  }
  return rule + "path='" + path + "',interface='" + interface + "',member='" + member + "'";
}

Result readOutcome(sd_bus_message* reply, MessageValue& value) {
  if (sd_bus_message_has_signature(reply, "isv") <= 0) {
    const char* signature = sd_bus_message_get_signature(reply, 1);
    return makeResult(kResultBadReply,
                      std::string("reply has signature ") + (signature ? signature : "?"));
  }
  std::int32_t code = 0;
  const char* message = nullptr;
  int r = sd_bus_message_read(reply, "is", &code, &message);
  if (r <= 0) {
    return makeResult(kResultBadReply, "unreadable reply");
  }
  MessageValue decoded;
  r = readVariant(reply, decoded);
  if (r < 0) {
    return makeResult(kResultBadReply, "reply value outside the mapping: " + errnoText(-r));
  }
  value = std::move(decoded);
  return makeResult(code, message != nullptr ? message : "");
}

}  // namespace halvex::bus
