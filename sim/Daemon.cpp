// SPDX-License-Identifier: MIT
#include "sim/Daemon.h"

#include <signal.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <deque>
#include <functional>
#include <list>
#include <stdexcept>
#include <utility>
#include <vector>

#include "platform/ServerProtocol.h"
#include "platform/linux/MessageCodec.h"
#include "sim/LogSetWriter.h"
#include "sim/ProcessKeeper.h"
#include "sim/RequestLog.h"

namespace halvex::sim {
namespace {

// Names from docs/dbus-protocol.md and docs/simulator.md.
constexpr char kServerName[] = "org.halvex.Server";
constexpr char kServerPath[] = "/org/halvex/Server";
constexpr char kServerInterface[] = "org.halvex.Server1";
constexpr char kHelperName[] = "org.halvex.Helper";
constexpr char kHelperPath[] = "/org/halvex/Helper";
constexpr char kHelperInterface[] = "org.halvex.Helper1";
constexpr char kDeviceName[] = "org.halvex.Device";
constexpr char kDevicePath[] = "/org/halvex/Device";
constexpr char kDeviceInterface[] = "org.halvex.Device1";
constexpr char kControlName[] = "org.halvex.Simulator";
constexpr char kControlPath[] = "/org/halvex/Simulator";
constexpr char kControlInterface[] = "org.halvex.Simulator1";
constexpr char kErrorNoState[] = "org.halvex.Simulator.Error.NoState";
constexpr char kErrorServerAbsent[] = "org.halvex.Simulator.Error.ServerAbsent";

// The status of a fault "exit": neither success nor the bad-scenario status 2.
constexpr int kFaultExitStatus = 3;

struct BusClose {
  void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
struct SlotUnref {
  void operator()(sd_bus_slot* slot) const { sd_bus_slot_unref(slot); }
};
struct MessageUnref {
  void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
struct SourceUnref {
  void operator()(sd_event_source* source) const { sd_event_source_disable_unref(source); }
};
struct EventUnref {
  void operator()(sd_event* event) const { sd_event_unref(event); }
};
using BusPtr = std::unique_ptr<sd_bus, BusClose>;
using SlotPtr = std::unique_ptr<sd_bus_slot, SlotUnref>;
using MessagePtr = std::unique_ptr<sd_bus_message, MessageUnref>;
using SourcePtr = std::unique_ptr<sd_event_source, SourceUnref>;
using EventPtr = std::unique_ptr<sd_event, EventUnref>;

// C callbacks must not let an exception through; the only ones expected are allocation
// failures, answered as such.
template <typename Body>
int guarded(sd_bus_error* error, Body body) noexcept {
  try {
    return body();
  } catch (const std::exception& e) {
    return sd_bus_error_set(error, SD_BUS_ERROR_FAILED, e.what());
  }
}

// Reads the request dictionary that ends every Perform method; a value outside the message types
// is the caller's mistake and answered as such.
int readRequest(sd_bus_message* call, sd_bus_error* error, MessageDict& request) {
  if (bus::readDict(call, request) < 0) {
    return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS,
                            "the request holds a value outside the message types");
  }
  return 0;
}

MessagePtr keep(sd_bus_message* message) {
  return MessagePtr(sd_bus_message_ref(message));
}

std::string localTimestamp() {
  const std::time_t now = std::time(nullptr);
  std::tm local{};
  localtime_r(&now, &local);
  char text[32];
  const std::size_t n = std::strftime(text, sizeof text, "%Y-%m-%d-%H-%M-%S", &local);
  return std::string(text, n);
}

// What a request is answered with once its time comes.
struct Reply {
  std::int32_t code = 0;
  MessageValue value;
  std::optional<LogSet> logSet;  // written just before the reply goes out
  std::string description;
};

Reply makeReply(const Answer& answer, MessageDict dict, const std::string& text) {
  Reply reply;
  reply.code = answer.result;
  switch (answer.reply) {
    case ReplyKind::kDict:
      reply.value = MessageValue::dict(std::move(dict));
      break;
    case ReplyKind::kNull:
      break;
    case ReplyKind::kString:
      reply.value = MessageValue::string(text);
      break;
    case ReplyKind::kInt64:
      reply.value = MessageValue::int64(0);
      break;
    case ReplyKind::kBool:
      reply.value = MessageValue::boolean(true);
      break;
  }
  return reply;
}

}  // namespace

struct Daemon::Impl {
  struct Endpoint {
    Impl* impl;
    const char* name;
    const char* path;
    const char* interface;
    const sd_bus_vtable* vtable;
    BusPtr bus;
    SlotPtr vtableSlot;
    SlotPtr nameSlot;
    bool owned = false;
  };

  // Work for later: a timer, a task for the next loop iteration, or a request kept unanswered.
  // Work owned by an endpoint is dropped with that endpoint's connection.
  struct Deferred {
    Impl* impl;
    Endpoint* owner;
    MessagePtr call;
    SourcePtr source;
    std::function<void(Deferred&)> fire;
  };

  enum class ServerState { kAbsent, kAcquiring, kPresent, kReleasing };

  Impl(Scenario scenarioIn, DaemonOptions optionsIn);
  ~Impl();

  // Setup and names.
  void connect(Endpoint& endpoint);
  void checkReady();
  void fatal(const std::string& message);
  Deferred* defer(Endpoint* owner, std::uint32_t delayMs, std::function<void(Deferred&)> fire,
                  MessagePtr call = nullptr);
  void dropDeferred(Endpoint* owner);
  void removeDeferred(Deferred* item);
  void settleServer();
  void startServer();
  void stopServer();

  // Answers.
  void respond(Endpoint& endpoint, sd_bus_message* call, const Answer& answer, Reply reply);
  void sendReply(sd_bus_message* call, const Reply& reply);
  int emitEvent(const char* name, const MessageValue& payload);
  std::int64_t vendorSeenByTool() const {
    return scenario.device.present ? scenario.device.radioVendor : 0;
  }

  // sd-bus and sd-event callbacks; userdata is the Impl or an Endpoint.
  static int onNameAcquired(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  static int onNameReleased(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  static int onTimer(sd_event_source* source, std::uint64_t usec, void* userdata);
  static int onDefer(sd_event_source* source, void* userdata);
  static int onPerformCommand(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onSubscribe(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onHelperPerform(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onGetIdentity(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onEmitState(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onEmitEvent(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onSetServerPresent(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onQuit(sd_bus_message* call, void* userdata, sd_bus_error* error);

  static const sd_bus_vtable kServerVtable[];
  static const sd_bus_vtable kHelperVtable[];
  static const sd_bus_vtable kDeviceVtable[];
  static const sd_bus_vtable kControlVtable[];

  Scenario scenario;
  DaemonOptions options;
  RequestLog log;
  LogSetWriter writer;
  ProcessKeeper keeper;
  // Declared before what refers to it, so it is destroyed after: connections detach from the
  // loop, messages from their connections.
  EventPtr event;
  Endpoint server{this, kServerName, kServerPath, kServerInterface, kServerVtable, {}, {}, {}};
  Endpoint helper{this, kHelperName, kHelperPath, kHelperInterface, kHelperVtable, {}, {}, {}};
  Endpoint device{this, kDeviceName, kDevicePath, kDeviceInterface, kDeviceVtable, {}, {}, {}};
  Endpoint control{this, kControlName, kControlPath, kControlInterface, kControlVtable, {}, {}, {}};
  std::list<std::unique_ptr<Deferred>> deferred;
  ServerState serverState = ServerState::kAbsent;
  // SetServerPresent calls waiting for the server to reach the state they asked for, in order.
  std::deque<std::pair<MessagePtr, bool>> serverWaiters;
  Deferred* appearTimer = nullptr;
  std::vector<Endpoint*> presentAtStart;
  bool readySent = false;
};

// Handlers may reply later: they return 1 once the request is theirs, whether or not answered.
const sd_bus_vtable Daemon::Impl::kServerVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("PerformCommand", "ssa{sv}", "isv", &Impl::onPerformCommand,
                  SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("Subscribe", "s", "a(sv)", &Impl::onSubscribe, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_SIGNAL("Event", "sv", 0), SD_BUS_VTABLE_END};

const sd_bus_vtable Daemon::Impl::kHelperVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("Perform", "sisa{sv}", "isv", &Impl::onHelperPerform, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END};

const sd_bus_vtable Daemon::Impl::kDeviceVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("GetIdentity", "", "a{sv}", &Impl::onGetIdentity, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END};

const sd_bus_vtable Daemon::Impl::kControlVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("EmitState", "", "", &Impl::onEmitState, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("EmitEvent", "sv", "", &Impl::onEmitEvent, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("SetServerPresent", "b", "", &Impl::onSetServerPresent,
                  SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("Quit", "", "", &Impl::onQuit, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END};

Daemon::Impl::Impl(Scenario scenarioIn, DaemonOptions optionsIn)
    : scenario(std::move(scenarioIn)),
      options(std::move(optionsIn)),
      log(options.requestLog),
      writer(options.logRoot) {
  sd_event* rawEvent = nullptr;
  if (const int r = sd_event_new(&rawEvent); r < 0) {
    throw std::runtime_error(std::string("cannot create an event loop: ") + std::strerror(-r));
  }
  event.reset(rawEvent);

  // sd-event takes signals through a signalfd, so they must be blocked first. A null handler
  // makes the loop exit with status 0.
  sigset_t stops;
  sigemptyset(&stops);
  sigaddset(&stops, SIGTERM);
  sigaddset(&stops, SIGINT);
  sigprocmask(SIG_BLOCK, &stops, nullptr);
  sd_event_add_signal(event.get(), nullptr, SIGTERM, nullptr, nullptr);
  sd_event_add_signal(event.get(), nullptr, SIGINT, nullptr, nullptr);

  if (!writer.prepare())
    throw std::runtime_error("cannot prepare the log root");
  keeper.start(scenario.processes);

  connect(control);
  // If the bus goes, nothing here can be reached any more.
  sd_bus_set_exit_on_disconnect(control.bus.get(), 1);
  presentAtStart.push_back(&control);
  if (scenario.device.present) {
    connect(device);
    presentAtStart.push_back(&device);
  }
  if (scenario.helper.present) {
    connect(helper);
    presentAtStart.push_back(&helper);
  }
  if (scenario.server.present && scenario.server.appearAfterMs == 0) {
    startServer();
    presentAtStart.push_back(&server);
  } else if (scenario.server.present) {
    appearTimer = defer(nullptr, scenario.server.appearAfterMs, [this](Deferred&) {
      appearTimer = nullptr;
      if (serverState == ServerState::kAbsent)
        startServer();
    });
  }
}

Daemon::Impl::~Impl() {
  serverWaiters.clear();
  deferred.clear();
}

void Daemon::Impl::connect(Endpoint& endpoint) {
  sd_bus* raw = nullptr;
  int r = sd_bus_open_system(&raw);
  if (r < 0) {
    throw std::runtime_error(std::string("cannot connect to the system bus: ") + std::strerror(-r));
  }
  endpoint.bus.reset(raw);
  sd_bus_slot* slot = nullptr;
  r = sd_bus_attach_event(raw, event.get(), SD_EVENT_PRIORITY_NORMAL);
  if (r >= 0) {
    r = sd_bus_add_object_vtable(raw, &slot, endpoint.path, endpoint.interface, endpoint.vtable,
                                 this);
  }
  endpoint.vtableSlot.reset(slot);
  slot = nullptr;
  if (r >= 0) {
    r = sd_bus_request_name_async(raw, &slot, endpoint.name, 0, &Impl::onNameAcquired, &endpoint);
  }
  endpoint.nameSlot.reset(slot);
  if (r < 0) {
    throw std::runtime_error(std::string("cannot serve ") + endpoint.name + ": " +
                             std::strerror(-r));
  }
}

void Daemon::Impl::fatal(const std::string& message) {
  std::fprintf(stderr, "halvex-sim: %s\n", message.c_str());
  sd_event_exit(event.get(), 1);
}

void Daemon::Impl::checkReady() {
  if (readySent || options.readyFd < 0)
    return;
  for (const Endpoint* endpoint : presentAtStart) {
    if (!endpoint->owned)
      return;
  }
  readySent = true;
  const char line[] = "ready\n";
  // Whoever waits may have gone; SIGPIPE is ignored, so a failed write is only that.
  [[maybe_unused]] const ssize_t n = ::write(options.readyFd, line, sizeof line - 1);
  ::close(options.readyFd);
  options.readyFd = -1;
}

Daemon::Impl::Deferred* Daemon::Impl::defer(Endpoint* owner, std::uint32_t delayMs,
                                            std::function<void(Deferred&)> fire, MessagePtr call) {
  auto item =
      std::make_unique<Deferred>(Deferred{this, owner, std::move(call), {}, std::move(fire)});
  Deferred* raw = item.get();
  sd_event_source* source = nullptr;
  int r = 0;
  // Without fire it is a request kept unanswered, and needs no source.
  if (raw->fire && delayMs == 0) {
    r = sd_event_add_defer(event.get(), &source, &Impl::onDefer, raw);
  } else if (raw->fire) {
    std::uint64_t now = 0;
    sd_event_now(event.get(), CLOCK_MONOTONIC, &now);
    r = sd_event_add_time(event.get(), &source, CLOCK_MONOTONIC,
                          now + std::uint64_t{delayMs} * 1000U, 1000U, &Impl::onTimer, raw);
  }
  if (r < 0) {
    throw std::runtime_error(std::string("cannot schedule: ") + std::strerror(-r));
  }
  raw->source.reset(source);
  deferred.push_back(std::move(item));
  return raw;
}

void Daemon::Impl::removeDeferred(Deferred* item) {
  deferred.remove_if([item](const std::unique_ptr<Deferred>& d) { return d.get() == item; });
}

void Daemon::Impl::dropDeferred(Endpoint* owner) {
  deferred.remove_if([owner](const std::unique_ptr<Deferred>& d) { return d->owner == owner; });
}

int Daemon::Impl::onTimer(sd_event_source* source, std::uint64_t, void* userdata) {
  return onDefer(source, userdata);
}

int Daemon::Impl::onDefer(sd_event_source*, void* userdata) {
  auto* item = static_cast<Deferred*>(userdata);
  Impl* impl = item->impl;
  // Take it off the list first: fire may add or drop other work.
  std::unique_ptr<Deferred> owned;
  for (auto it = impl->deferred.begin(); it != impl->deferred.end(); ++it) {
    if (it->get() == item) {
      owned = std::move(*it);
      impl->deferred.erase(it);
      break;
    }
  }
  try {
    if (owned)
      owned->fire(*owned);
  } catch (const std::exception& e) {
    impl->fatal(e.what());
  }
  return 0;
}

int Daemon::Impl::onNameAcquired(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  auto* endpoint = static_cast<Endpoint*>(userdata);
  Impl* impl = endpoint->impl;
  std::uint32_t outcome = 0;
  if (const sd_bus_error* error = sd_bus_message_get_error(reply)) {
    impl->fatal(std::string("cannot own ") + endpoint->name + ": " + error->message);
    return 0;
  }
  // 1: now the owner; 4: already was. Anything else means someone else has it.
  if (sd_bus_message_read(reply, "u", &outcome) < 0 || (outcome != 1 && outcome != 4)) {
    impl->fatal(std::string(endpoint->name) + " is already owned on this bus");
    return 0;
  }
  endpoint->owned = true;
  if (endpoint == &impl->server) {
    impl->serverState = ServerState::kPresent;
    impl->settleServer();
  }
  impl->checkReady();
  return 0;
}

int Daemon::Impl::onNameReleased(sd_bus_message*, void* userdata, sd_bus_error*) {
  auto* impl = static_cast<Impl*>(userdata);
  // The bus has released the name (or failed to, and closing releases it anyway). Close the
  // connection outside its own callback.
  impl->defer(nullptr, 0, [impl](Deferred&) {
    impl->server.nameSlot.reset();
    impl->server.vtableSlot.reset();
    impl->server.bus.reset();
    impl->server.owned = false;
    impl->serverState = ServerState::kAbsent;
    impl->settleServer();
  });
  return 0;
}

void Daemon::Impl::startServer() {
  serverState = ServerState::kAcquiring;
  try {
    connect(server);
  } catch (...) {
    server.nameSlot.reset();
    server.vtableSlot.reset();
    server.bus.reset();
    serverState = ServerState::kAbsent;
    throw;
  }
}

void Daemon::Impl::stopServer() {
  serverState = ServerState::kReleasing;
  // Requests still waiting are dropped unanswered: once the connection closes, their callers
  // get NoReply from the bus, as from a server that went away.
  dropDeferred(&server);
  sd_bus_slot* slot = nullptr;
  const int r =
      sd_bus_release_name_async(server.bus.get(), &slot, kServerName, &Impl::onNameReleased, this);
  server.nameSlot.reset(slot);
  if (r < 0)
    onNameReleased(nullptr, this, nullptr);
}

void Daemon::Impl::settleServer() {
  while (!serverWaiters.empty()) {
    if (serverState == ServerState::kAcquiring || serverState == ServerState::kReleasing)
      return;
    const bool present = serverState == ServerState::kPresent;
    auto& [call, want] = serverWaiters.front();
    if (want == present) {
      sd_bus_reply_method_return(call.get(), "");
      serverWaiters.pop_front();
      continue;
    }
    if (want) {
      startServer();
    } else {
      stopServer();
    }
    return;
  }
}

void Daemon::Impl::respond(Endpoint& endpoint, sd_bus_message* call, const Answer& answer,
                           Reply reply) {
  switch (answer.fault) {
    case Fault::kExit:
      // The request is already in the log (written unbuffered); nothing else may run.
      ::_exit(kFaultExitStatus);
    case Fault::kNeverAnswer:
      defer(&endpoint, 0, nullptr, keep(call));
      return;
    case Fault::kNone:
      break;
  }
  if (answer.delayMs == 0) {
    sendReply(call, reply);
    return;
  }
  defer(
      &endpoint, answer.delayMs,
      [this, reply = std::move(reply)](Deferred& item) { sendReply(item.call.get(), reply); },
      keep(call));
}

void Daemon::Impl::sendReply(sd_bus_message* call, const Reply& reply) {
  if (reply.logSet)
    writer.write(*reply.logSet, reply.description);
  sd_bus_message* raw = nullptr;
  int r = sd_bus_message_new_method_return(call, &raw);
  MessagePtr message(raw);
  if (r >= 0) {
    r = sd_bus_message_append(raw, "is", reply.code, reply.code == 0 ? "" : "simulated failure");
  }
  if (r >= 0)
    r = bus::appendVariant(raw, reply.value);
  if (r >= 0)
    r = sd_bus_send(nullptr, raw, nullptr);
  if (r < 0)
    std::fprintf(stderr, "halvex-sim: cannot send a reply: %s\n", std::strerror(-r));
}

int Daemon::Impl::emitEvent(const char* name, const MessageValue& payload) {
  if (serverState != ServerState::kPresent)
    return -ENOTCONN;
  sd_bus_message* raw = nullptr;
  int r = sd_bus_message_new_signal(server.bus.get(), &raw, kServerPath, kServerInterface, "Event");
  MessagePtr message(raw);
  if (r >= 0)
    r = sd_bus_message_append(raw, "s", name);
  if (r >= 0)
    r = bus::appendVariant(raw, payload);
  if (r >= 0)
    r = sd_bus_send(server.bus.get(), raw, nullptr);
  return r;
}

int Daemon::Impl::onPerformCommand(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* impl = static_cast<Impl*>(userdata);
    const char* client = nullptr;
    const char* command = nullptr;
    int r = sd_bus_message_read(call, "ss", &client, &command);
    if (r < 0)
      return r;
    MessageDict request;
    if (r = readRequest(call, error, request); r < 0)
      return r;
    impl->log.write({{"service", "server"},
                     {"method", "PerformCommand"},
                     {"client", client},
                     {"command", command},
                     {"keys", describeKeys(request)}});

    const Server& answers = impl->scenario.server;
    if (std::string_view(command) == kCommandGetTraceProperty) {
      const PropertyAnswer property = answers.propertyAnswer(
          request.getString(kKeyTraceName), request.getString(kKeyTracePropertyName));
      MessageDict dict;
      if (property.value)
        dict.set(kKeyTracePropertyValue, MessageValue::string(*property.value));
      impl->respond(impl->server, call, property.answer,
                    makeReply(property.answer, std::move(dict), property.value.value_or("")));
      return 1;
    }

    const Answer answer = answers.commandAnswer(command);
    const bool dump = std::string_view(command) == kCommandTraceDumpState;
    const std::string timestamp = answer.timestamp.value_or(dump ? localTimestamp() : "");
    MessageDict dict;
    if (dump || answer.timestamp)
      dict.set(kKeyTimestampString, MessageValue::string(timestamp));
    Reply reply = makeReply(answer, std::move(dict), timestamp);
    if (dump && answer.result == 0) {
      // The tool prints a path for "tel" and "core" only with a dictionary reply; for "bb" it
      // prints one whatever the reply, with an empty time stamp when it cannot read one.
      const bool isDict = answer.reply == ReplyKind::kDict;
      reply.logSet = logSetForDump(request, isDict ? timestamp : "", impl->vendorSeenByTool());
      if (!isDict && request.getString(kKeyTraceAction) != kCollectBasebandLogs) {
        reply.logSet.reset();
      }
      reply.description =
          "Collected by the simulated server: " + request.getString(kKeyTraceAction) +
          ", reason \"" + request.getString(kKeyTraceDumpStateReason) + "\", time stamp \"" +
          timestamp + "\"";
    }
    impl->respond(impl->server, call, answer, std::move(reply));
    return 1;
  });
}

int Daemon::Impl::onSubscribe(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* impl = static_cast<Impl*>(userdata);
    const char* client = nullptr;
    int r = sd_bus_message_read(call, "s", &client);
    if (r < 0)
      return r;
    impl->log.write({{"service", "server"}, {"method", "Subscribe"}, {"client", client}});

    const std::optional<StateEvent>& state = impl->scenario.server.state;
    sd_bus_message* raw = nullptr;
    r = sd_bus_message_new_method_return(call, &raw);
    MessagePtr reply(raw);
    if (r >= 0)
      r = sd_bus_message_open_container(raw, 'a', "(sv)");
    if (r >= 0 && state && state->when == StateWhen::kSubscribe) {
      r = sd_bus_message_open_container(raw, 'r', "sv");
      if (r >= 0)
        r = sd_bus_message_append(raw, "s", kEventServerStateChange);
      if (r >= 0)
        r = bus::appendVariant(raw, state->payload);
      if (r >= 0)
        r = sd_bus_message_close_container(raw);
    }
    if (r >= 0)
      r = sd_bus_message_close_container(raw);
    if (r >= 0)
      r = sd_bus_send(nullptr, raw, nullptr);
    if (r < 0)
      return r;

    if (state && state->when == StateWhen::kAfter) {
      impl->defer(&impl->server, state->afterMs, [impl](Deferred&) {
        impl->emitEvent(kEventServerStateChange, impl->scenario.server.state->payload);
      });
    }
    return 1;
  });
}

int Daemon::Impl::onHelperPerform(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* impl = static_cast<Impl*>(userdata);
    const char* service = nullptr;
    std::int32_t task = 0;
    const char* command = nullptr;
    int r = sd_bus_message_read(call, "sis", &service, &task, &command);
    if (r < 0)
      return r;
    MessageDict request;
    if (r = readRequest(call, error, request); r < 0)
      return r;
    impl->log.write({{"service", "helper"},
                     {"method", "Perform"},
                     {"client", service},
                     {"task", task},
                     {"command", command},
                     {"keys", describeKeys(request)}});

    if (std::string_view(command) != helper::kCommandVarniskStatus) {
      impl->respond(impl->helper, call, Answer{}, makeReply(Answer{}, {}, ""));
      return 1;
    }
    const Answer& answer = impl->scenario.helper.status;
    const std::string timestamp = answer.timestamp.value_or(localTimestamp());
    MessageDict dict;
    dict.set(helper::kKeyTimestampString, MessageValue::string(timestamp));
    Reply reply = makeReply(answer, std::move(dict), timestamp);
    // The tool prints the folder of that time stamp; make sure it is there.
    if (answer.result == 0 && answer.reply == ReplyKind::kDict && !timestamp.empty()) {
      reply.logSet = logSetForHelper(timestamp, impl->vendorSeenByTool());
      reply.description =
          "Last collection reported by the simulated helper, time stamp \"" + timestamp + "\"";
    }
    impl->respond(impl->helper, call, answer, std::move(reply));
    return 1;
  });
}

int Daemon::Impl::onGetIdentity(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* impl = static_cast<Impl*>(userdata);
    impl->log.write({{"service", "device"}, {"method", "GetIdentity"}});
    const Device& d = impl->scenario.device;
    MessageDict identity;
    identity.set("RadioType", MessageValue::int64(d.radioType));
    identity.set("RadioVendor", MessageValue::int64(d.radioVendor));
    identity.set("ProductType", MessageValue::int64(d.productType));
    identity.set("InternalBuild", MessageValue::boolean(d.internalBuild));
    identity.set("CarrierBuild", MessageValue::boolean(d.carrierBuild));
    identity.set("VendorBuild", MessageValue::boolean(d.vendorBuild));
    identity.set("TraceAllowed", MessageValue::boolean(d.traceAllowed));
    sd_bus_message* raw = nullptr;
    int r = sd_bus_message_new_method_return(call, &raw);
    MessagePtr reply(raw);
    if (r >= 0)
      r = bus::appendDict(raw, identity);
    if (r >= 0)
      r = sd_bus_send(nullptr, raw, nullptr);
    return r < 0 ? r : 1;
  });
}

int Daemon::Impl::onEmitState(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* impl = static_cast<Impl*>(userdata);
    const std::optional<StateEvent>& state = impl->scenario.server.state;
    if (!state)
      return sd_bus_error_set(error, kErrorNoState, "the scenario has no state event");
    if (impl->emitEvent(kEventServerStateChange, state->payload) < 0) {
      return sd_bus_error_set(error, kErrorServerAbsent, "the server is not on the bus");
    }
    return sd_bus_reply_method_return(call, "");
  });
}

int Daemon::Impl::onEmitEvent(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* impl = static_cast<Impl*>(userdata);
    const char* name = nullptr;
    int r = sd_bus_message_read(call, "s", &name);
    if (r < 0)
      return r;
    MessageValue payload;
    if (bus::readVariant(call, payload) < 0) {
      return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS,
                              "the payload holds a value outside the message types");
    }
    if (impl->emitEvent(name, payload) < 0) {
      return sd_bus_error_set(error, kErrorServerAbsent, "the server is not on the bus");
    }
    return sd_bus_reply_method_return(call, "");
  });
}

int Daemon::Impl::onSetServerPresent(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* impl = static_cast<Impl*>(userdata);
    int present = 0;
    const int r = sd_bus_message_read(call, "b", &present);
    if (r < 0)
      return r;
    // An explicit choice overrides the scenario's delayed appearance.
    if (impl->appearTimer != nullptr) {
      impl->removeDeferred(std::exchange(impl->appearTimer, nullptr));
    }
    impl->serverWaiters.emplace_back(keep(call), present != 0);
    impl->settleServer();
    return 1;
  });
}

int Daemon::Impl::onQuit(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* impl = static_cast<Impl*>(userdata);
    const int r = sd_bus_reply_method_return(call, "");
    sd_event_exit(impl->event.get(), 0);
    return r < 0 ? r : 1;
  });
}

Daemon::Daemon(Scenario scenario, DaemonOptions options)
    : impl_(std::make_unique<Impl>(std::move(scenario), std::move(options))) {}

Daemon::~Daemon() = default;

int Daemon::run() {
  const int r = sd_event_loop(impl_->event.get());
  return r < 0 ? 1 : r;
}

}  // namespace halvex::sim
