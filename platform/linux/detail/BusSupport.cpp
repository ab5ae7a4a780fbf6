// SPDX-License-Identifier: MIT
#include "platform/linux/detail/BusSupport.h"

#include <cerrno>
#include <cstring>
#include <ctime>

#include "platform/linux/MessageCodec.h"
#include "platform/linux/detail/BusString.h"

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

namespace {

std::int32_t codeForLocalErrno(int r) {
  switch (r) {
    case -ENOBUFS:  // sd-bus's own queue of unsent messages is full
      return kResultLimitsExceeded;
    case -ETIMEDOUT:
      return kResultTimeout;
    case -ENOTCONN:
    case -ECONNRESET:
    case -EPIPE:
      return kResultConnectionLost;
    default:
      return kResultBusError;
  }
}

}  // namespace

std::uint64_t monotonicUsec() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<std::uint64_t>(now.tv_sec) * 1000000u +
         static_cast<std::uint64_t>(now.tv_nsec) / 1000u;
}

std::uint64_t callDeadline(sd_bus* bus) {
  std::uint64_t timeout = 0;
  if (sd_bus_get_method_call_timeout(bus, &timeout) < 0 || timeout == 0) {
    return UINT64_MAX;
  }
  return monotonicUsec() + timeout;
}

Result resultFromFailure(sd_bus* bus, const sd_bus_error* error, int r, bool deadlinePassed) {
  const bool named = error != nullptr && sd_bus_error_is_set(error);
  std::string text = named ? std::string(error->name) : std::string("errno ") + std::to_string(-r);
  if (named && error->message != nullptr) {
    text += ": ";
    text += error->message;
  } else if (!named && r < 0) {
    text += ": ";
    text += std::strerror(-r);
  }
  if (bus == nullptr || sd_bus_is_open(bus) <= 0) {
    return makeResult(kResultConnectionLost, text);
  }
  if (!named) {
    return makeResult(codeForLocalErrno(r), text);
  }
  if (sd_bus_error_has_names(error, SD_BUS_ERROR_NAME_HAS_NO_OWNER, SD_BUS_ERROR_SERVICE_UNKNOWN)) {
    return makeResult(kResultServerNotRunning, text);
  }
  // The errno is -ETIMEDOUT for all of these; the name and the clock tell a crash from a slow
  // peer.
  if (sd_bus_error_has_name(error, SD_BUS_ERROR_NO_REPLY)) {
    return makeResult(deadlinePassed ? kResultTimeout : kResultServerGone, text);
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
  return makeResult(kResultServerNotRunning,
                    std::string("no system bus: ") + std::strerror(r < 0 ? -r : r));
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
    return makeResult(kResultBadReply,
                      std::string("reply value outside the mapping: ") + std::strerror(-r));
  }
  Result result = makeResult(code, message != nullptr ? message : "");
  if (result.ok()) {
    value = std::move(decoded);
  }
  return result;
}

Result callSync(sd_bus* bus, const char* destination, const char* path, const char* interface,
                const char* member, const MessageBuilder& build, MessagePtr& reply) {
  sd_bus_message* raw = nullptr;
  int r = sd_bus_message_new_method_call(bus, &raw, destination, path, interface, member);
  if (r < 0) {
    return resultFromFailure(bus, nullptr, r);
  }
  MessagePtr call(raw);
  r = sd_bus_message_set_auto_start(call.get(), 0);
  if (r < 0) {
    return resultFromFailure(bus, nullptr, r);
  }
  r = build ? build(call.get()) : 0;
  if (r < 0) {
    return makeResult(kResultInvalidRequest,
                      std::string("request cannot be encoded: ") + std::strerror(-r));
  }
  sd_bus_error error = SD_BUS_ERROR_NULL;
  sd_bus_message* answer = nullptr;
  std::uint64_t deadline = callDeadline(bus);
  r = sd_bus_call(bus, call.get(), 0, &error, &answer);
  if (r < 0) {
    Result result = resultFromFailure(bus, &error, r, monotonicUsec() >= deadline);
    sd_bus_error_free(&error);
    return result;
  }
  reply.reset(answer);
  return Result{};
}

}  // namespace halvex::bus
