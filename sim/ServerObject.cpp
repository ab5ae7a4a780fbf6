// SPDX-License-Identifier: MIT
// PerformCommand, Subscribe and Event, and the server's coming and going.
#include "sim/ServerObject.h"

#include <cerrno>
#include <string>
#include <string_view>
#include <utility>

#include "platform/ServerProtocol.h"
#include "platform/linux/BusProtocol.h"
#include "platform/linux/MessageCodec.h"
#include "sim/Replies.h"
#include "sim/RequestLog.h"

namespace halvex::sim {
namespace {

constexpr ObjectNames kNames{bus::kServerName, bus::kServerPath, bus::kServerInterface, "server"};

}  // namespace

// Argument names are those of data/dbus/interfaces/*.xml, which a test holds equal to these.
const sd_bus_vtable ServerObject::kVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES(bus::kServerPerformCommand, "ssa{sv}",
                             SD_BUS_PARAM(client) SD_BUS_PARAM(command) SD_BUS_PARAM(request),
                             "isv", SD_BUS_PARAM(code) SD_BUS_PARAM(message) SD_BUS_PARAM(reply),
                             &ServerObject::onPerformCommand, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES(bus::kServerSubscribe, "s", SD_BUS_PARAM(client), "a(sv)",
                             SD_BUS_PARAM(events), &ServerObject::onSubscribe,
                             SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_SIGNAL_WITH_NAMES(bus::kServerEvent, "sv", SD_BUS_PARAM(name) SD_BUS_PARAM(payload), 0),
    SD_BUS_VTABLE_END};

ServerObject::ServerObject(Server scenario, const DeviceObject& device, const Services& services)
    : scenario_(std::move(scenario)),
      device_(device),
      services_(services),
      endpoint_(kNames, kVtable, this, services, [this] {
        state_ = State::kPresent;
        settle();
      }) {}

bool ServerObject::appear() {
  if (scenario_.appearAfterMs == 0) {
    start();
    return true;
  }
  appearTimer_ = services_.scheduler.after(nullptr, scenario_.appearAfterMs, [this] {
    appearTimer_ = nullptr;
    if (state_ == State::kAbsent) {
      start();
    }
  });
  return false;
}

void ServerObject::setPresent(bool present, MessagePtr call, const Logger& journal) {
  if (appearTimer_ != nullptr) {
    services_.scheduler.cancel(std::exchange(appearTimer_, nullptr));
  }
  waiters_.push_back({std::move(call), present, &journal});
  settle();
}

void ServerObject::start() {
  state_ = State::kAcquiring;
  try {
    endpoint_.connect();
  } catch (...) {
    endpoint_.close();
    state_ = State::kAbsent;
    throw;
  }
}

void ServerObject::stop() {
  state_ = State::kReleasing;
  // Requests still waiting are dropped unanswered: once the connection closes, their callers
  // get NoReply from the bus, as from a server that went away.
  services_.scheduler.drop(&endpoint_);
  endpoint_.release([this] {
    // Close the connection outside the bus' own callback.
    services_.scheduler.after(nullptr, 0, [this] {
      endpoint_.close();
      state_ = State::kAbsent;
      settle();
    });
  });
}

void ServerObject::settle() {
  while (!waiters_.empty()) {
    if (state_ == State::kAcquiring || state_ == State::kReleasing) {
      return;
    }
    const bool present = state_ == State::kPresent;
    const Waiter& waiter = waiters_.front();
    if (waiter.present == present) {
      sd_bus_reply_method_return(waiter.call.get(), "");
      waiter.journal->log(LogLevel::kInfo, present
                                               ? "SetServerPresent true: the server is on the bus"
                                               : "SetServerPresent false: the server is away");
      waiters_.pop_front();
      continue;
    }
    if (waiter.present) {
      start();
    } else {
      stop();
    }
    return;
  }
}

int ServerObject::emit(const char* name, const MessageValue& payload) {
  if (state_ != State::kPresent) {
    return -ENOTCONN;
  }
  sd_bus_message* raw = nullptr;
  int r = sd_bus_message_new_signal(endpoint_.bus(), &raw, kNames.path, kNames.interface,
                                    bus::kServerEvent);
  MessagePtr message(raw);
  if (r >= 0) {
    r = sd_bus_message_append(raw, "s", name);
  }
  if (r >= 0) {
    r = bus::appendVariant(raw, payload);
  }
  if (r >= 0) {
    r = sd_bus_send(endpoint_.bus(), raw, nullptr);
  }
  return r;
}

int ServerObject::onPerformCommand(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<ServerObject*>(userdata);
    const char* client = nullptr;
    const char* command = nullptr;
    int r = sd_bus_message_read(call, "ss", &client, &command);
    if (r < 0) {
      return r;
    }
    const std::string asked = std::string("PerformCommand ") + command + " from " + client;
    MessageDict request;
    if (r = readRequest(call, error, request, self->endpoint_, asked); r < 0) {
      return r;
    }
    self->services_.log.write({{"service", "server"},
                               {"method", bus::kServerPerformCommand},
                               {"client", client},
                               {"command", command},
                               {"keys", describeKeys(request)}});

    const Server& configured = self->scenario_;
    Replier& replies = self->services_.replies;
    if (std::string_view(command) == kCommandGetTraceProperty) {
      const std::string trace = request.getString(kKeyTraceName);
      const std::string name = request.getString(kKeyTracePropertyName);
      const PropertyAnswer property = configured.propertyAnswer(trace, name);
      MessageDict dict;
      if (property.value) {
        dict.set(kKeyTracePropertyValue, MessageValue::string(*property.value));
      }
      replies.respond(self->endpoint_, call, property.answer,
                      makeReply(asked + " " + trace + "." + name, property.answer, std::move(dict),
                                property.value.value_or("")));
      return 1;
    }

    const Answer answer = configured.commandAnswer(command);
    const bool dump = std::string_view(command) == kCommandTraceDumpState;
    Reply reply = stampedReply(asked, answer, kKeyTimestampString, dump);
    if (dump && answer.result == 0) {
      // The tool prints a path for "tel" and "core" only with a dictionary reply; for "bb" it
      // prints one whatever the reply, with an empty time stamp when it cannot read one.
      const bool isDict = answer.reply == ReplyKind::kDict;
      const std::string action = request.getString(kKeyTraceAction);
      reply.logSet =
          logSetForDump(request, isDict ? reply.timestamp : "", self->device_.vendorSeenByTool());
      if (!isDict && action != kCollectBasebandLogs) {
        reply.logSet.reset();
      }
      reply.description = "Collected by the simulated server: " + action + ", reason \"" +
                          request.getString(kKeyTraceDumpStateReason) + "\", time stamp \"" +
                          reply.timestamp + "\"";
    }
    replies.respond(self->endpoint_, call, answer, std::move(reply));
    return 1;
  });
}

int ServerObject::onSubscribe(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<ServerObject*>(userdata);
    const char* client = nullptr;
    int r = sd_bus_message_read(call, "s", &client);
    if (r < 0) {
      return r;
    }
    self->services_.log.write(
        {{"service", "server"}, {"method", bus::kServerSubscribe}, {"client", client}});

    const std::optional<StateEvent>& state = self->scenario_.state;
    const bool inReply = state && state->when == StateWhen::kSubscribe;
    const bool later = state && state->when == StateWhen::kAfter;
    sd_bus_message* raw = nullptr;
    r = sd_bus_message_new_method_return(call, &raw);
    MessagePtr reply(raw);
    if (r >= 0) {
      r = sd_bus_message_open_container(raw, 'a', "(sv)");
    }
    if (r >= 0 && inReply) {
      r = sd_bus_message_open_container(raw, 'r', "sv");
      if (r >= 0) {
        r = sd_bus_message_append(raw, "s", kEventServerStateChange);
      }
      if (r >= 0) {
        r = bus::appendVariant(raw, state->payload);
      }
      if (r >= 0) {
        r = sd_bus_message_close_container(raw);
      }
    }
    if (r >= 0) {
      r = sd_bus_message_close_container(raw);
    }
    if (r >= 0) {
      r = sd_bus_send(nullptr, raw, nullptr);
    }
    if (r < 0) {
      return r;
    }

    std::string events = "no event";
    if (inReply) {
      events = "the state event " + describe(state->payload);
    }
    if (later) {
      events = "the state event to follow in " + std::to_string(state->afterMs) + " ms";
    }
    self->endpoint_.journal().log(LogLevel::kInfo,
                                  std::string("Subscribe from ") + client + ": " + events);
    if (later) {
      self->services_.scheduler.after(&self->endpoint_, state->afterMs, [self] {
        self->emit(kEventServerStateChange, self->scenario_.state->payload);
      });
    }
    return 1;
  });
}

}  // namespace halvex::sim
