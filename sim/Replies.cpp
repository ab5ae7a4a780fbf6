// SPDX-License-Identifier: MIT
// Building, timing and sending the replies of the Perform methods.
#include "sim/Replies.h"

#include <unistd.h>

#include <cstdio>
#include <ctime>
#include <system_error>
#include <utility>

#include "platform/SystemLog.h"
#include "platform/linux/MessageCodec.h"
#include "sim/Endpoint.h"
#include "sim/Scheduler.h"

namespace halvex::sim {
namespace {

// A reply's value in the journal is cut after this many bytes.
constexpr std::size_t kMaxLoggedValue = 240;

// The status of a fault "exit": neither success nor the bad-scenario status 2.
constexpr int kFaultExitStatus = 3;

std::string localTimestamp() {
  const std::time_t now = std::time(nullptr);
  std::tm local{};
  localtime_r(&now, &local);
  char text[32];
  const std::size_t n = std::strftime(text, sizeof text, "%Y-%m-%d-%H-%M-%S", &local);
  return std::string(text, n);
}

// "code 0, reply {...}" for the journal; a failure code also in the hexadecimal it is known by.
std::string summary(const Reply& reply) {
  std::string text = "code " + std::to_string(reply.code);
  if (reply.code != 0) {
    char hex[16];
    std::snprintf(hex, sizeof hex, " (0x%08X)", static_cast<std::uint32_t>(reply.code));
    text += hex;
  }
  std::string value = describe(reply.value);
  if (value.size() > kMaxLoggedValue) {
    value = value.substr(0, kMaxLoggedValue) + "...";
  }
  return text + ", reply " + value;
}

// The reply's TimestampString, or nullopt for none.
std::optional<std::string> replyTimestamp(const Answer& answer, bool stampedByDefault) {
  switch (answer.stamp) {
    case Stamp::kText: return answer.timestamp;
    case Stamp::kNone: return std::nullopt;
    case Stamp::kDefault: break;
  }
  return stampedByDefault ? std::optional(localTimestamp()) : std::nullopt;
}

}  // namespace

Reply makeReply(std::string asked, const Answer& answer, MessageDict dict,
                const std::string& text) {
  Reply reply;
  reply.asked = std::move(asked);
  reply.code = answer.result;
  switch (answer.reply) {
    case ReplyKind::kDict: reply.value = MessageValue::dict(std::move(dict)); break;
    case ReplyKind::kNull: break;
    case ReplyKind::kString: reply.value = MessageValue::string(text); break;
    case ReplyKind::kInt64: reply.value = MessageValue::int64(0); break;
    case ReplyKind::kBool: reply.value = MessageValue::boolean(true); break;
  }
  return reply;
}

Reply stampedReply(std::string asked, const Answer& answer, const char* key,
                   bool stampedByDefault) {
  const std::optional<std::string> stamp = replyTimestamp(answer, stampedByDefault);
  // Without one the tool reads an empty time stamp, and so does the log set.
  const std::string timestamp = stamp.value_or("");
  MessageDict dict;
  if (stamp) {
    dict.set(key, MessageValue::string(timestamp));
  }
  Reply reply = makeReply(std::move(asked), answer, std::move(dict), timestamp);
  reply.timestamp = timestamp;
  return reply;
}

int readRequest(sd_bus_message* call, sd_bus_error* error, MessageDict& request,
                const Endpoint& endpoint, const std::string& asked) {
  if (bus::readDict(call, request) < 0) {
    return endpoint.refuse(error, asked, SD_BUS_ERROR_INVALID_ARGS,
                           "the request holds a value outside the message types");
  }
  return 0;
}

Replier::Replier(Scheduler& scheduler, const LogSetWriter& writer, bool logsAreWritten)
    : scheduler_(scheduler), writer_(writer), logsAreWritten_(logsAreWritten) {}

void Replier::respond(const Endpoint& endpoint, sd_bus_message* call, const Answer& answer,
                      Reply reply) {
  switch (answer.fault) {
    case Fault::kExit:
      // The request is already in the log (written unbuffered), and the journal has its entry
      // once the call returns; nothing else may run.
      endpoint.journal().log(LogLevel::kInfo, reply.asked + ": exit");
      ::_exit(kFaultExitStatus);
    case Fault::kNeverAnswer:
      endpoint.journal().log(LogLevel::kInfo, reply.asked + ": never answered");
      scheduler_.hold(&endpoint, keep(call));
      return;
    case Fault::kNone: break;
  }
  if (answer.delayMs == 0) {
    send(endpoint, call, reply);
    return;
  }
  // The kept reference holds call for as long as the work, and so the lambda, lives.
  scheduler_.after(
      &endpoint, answer.delayMs,
      [this, &endpoint, call, reply = std::move(reply)] { send(endpoint, call, reply); },
      keep(call));
}

void Replier::send(const Endpoint& endpoint, sd_bus_message* call, const Reply& reply) const {
  std::string entry = reply.asked + ": " + summary(reply);
  if (reply.logSet && writer_.write(*reply.logSet, reply.description) && logsAreWritten_) {
    entry += ", logs at " + reply.logSet->written;
  }
  sd_bus_message* raw = nullptr;
  int r = sd_bus_message_new_method_return(call, &raw);
  MessagePtr message(raw);
  if (r >= 0) {
    r = sd_bus_message_append(raw, "is", reply.code, reply.code == 0 ? "" : "simulated failure");
  }
  if (r >= 0) {
    r = bus::appendVariant(raw, reply.value);
  }
  if (r >= 0) {
    r = sd_bus_send(nullptr, raw, nullptr);
  }
  if (r < 0) {
    const std::string reason = std::generic_category().message(-r);
    std::fprintf(stderr, "halvex-sim: cannot send a reply: %s\n", reason.c_str());
    endpoint.journal().log(LogLevel::kError, entry + ", not sent: " + reason);
    return;
  }
  endpoint.journal().log(LogLevel::kInfo, entry);
}

}  // namespace halvex::sim
