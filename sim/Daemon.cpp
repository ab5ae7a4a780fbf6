// SPDX-License-Identifier: MIT
#include "sim/Daemon.h"

#include <signal.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-daemon.h>
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
#include "platform/SystemLog.h"
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

// The journal's subsystem; each endpoint logs under its own category.
constexpr char kLogSubsystem[] = "org.halvex.sim";
// A reply's value in the journal is cut after this many bytes.
constexpr std::size_t kMaxLoggedValue = 240;

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

// Answers a call with an error, saying so in the journal.
int refuse(const Logger& journal, sd_bus_error* error, const std::string& asked, const char* name,
           const char* text) {
  journal.log(LogLevel::kInfo, asked + ": " + name);
  return sd_bus_error_set(error, name, text);
}

// Reads the request dictionary that ends every Perform method; a value outside the message types
// is the caller's mistake and answered as such.
int readRequest(sd_bus_message* call, sd_bus_error* error, MessageDict& request,
                const Logger& journal, const std::string& asked) {
  if (bus::readDict(call, request) < 0) {
    return refuse(journal, error, asked, SD_BUS_ERROR_INVALID_ARGS,
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

// The reply's TimestampString, or nullopt for none; stampedByDefault for a dump and the helper.
std::optional<std::string> replyTimestamp(const Answer& answer, bool stampedByDefault) {
  switch (answer.stamp) {
    case Stamp::kText:
      return answer.timestamp;
    case Stamp::kNone:
      return std::nullopt;
    case Stamp::kDefault:
      break;
  }
  return stampedByDefault ? std::optional(localTimestamp()) : std::nullopt;
}

// What a request is answered with once its time comes.
struct Reply {
  std::string asked;  // the method and command, for the journal
  std::int32_t code = 0;
  MessageValue value;
  std::optional<LogSet> logSet;  // written just before the reply goes out
  std::string description;
};

// "code 0, reply {...}" for the journal; a failure code also in the hexadecimal it is known by.
std::string summary(const Reply& reply) {
  std::string text = "code " + std::to_string(reply.code);
  if (reply.code != 0) {
    char hex[16];
    std::snprintf(hex, sizeof hex, " (0x%08X)", static_cast<std::uint32_t>(reply.code));
    text += hex;
  }
  std::string value = describe(reply.value);
  if (value.size() > kMaxLoggedValue)
    value = value.substr(0, kMaxLoggedValue) + "...";
  return text + ", reply " + value;
}

Reply makeReply(std::string asked, const Answer& answer, MessageDict dict,
                const std::string& text) {
  Reply reply;
  reply.asked = std::move(asked);
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
    const char* category;  // in the journal
    Logger journal{};
    BusPtr bus{};
    SlotPtr vtableSlot{};
    SlotPtr nameSlot{};
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
  // Logs and prints message, then ends the loop with status 1.
  void fatal(const Endpoint& endpoint, const std::string& message);
  Deferred* defer(Endpoint* owner, std::uint32_t delayMs, std::function<void(Deferred&)> fire,
                  MessagePtr call = nullptr);
  void dropDeferred(Endpoint* owner);
  void removeDeferred(Deferred* item);
  void settleServer();
  void startServer();
  void stopServer();

  // Answers.
  void respond(Endpoint& endpoint, sd_bus_message* call, const Answer& answer, Reply reply);
  void sendReply(const Endpoint& endpoint, sd_bus_message* call, const Reply& reply);
  int emitEvent(const char* name, const MessageValue& payload);
  std::int64_t vendorSeenByTool() const {
    return scenario.device.present ? scenario.device.radioVendor : 0;
  }

  // sd-bus and sd-event callbacks; userdata is the Impl or an Endpoint.
  static int onNameAcquired(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  static int onNameReleased(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  static int onTimer(sd_event_source* source, std::uint64_t usec, void* userdata);
  static int onDefer(sd_event_source* source, void* userdata);
  static int onBusMessage(sd_bus_message* message, void* userdata, sd_bus_error* error);
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
  std::shared_ptr<LogServer> journal = LogServer::create();
  Endpoint server{this, kServerName, kServerPath, kServerInterface, kServerVtable, "server"};
  Endpoint helper{this, kHelperName, kHelperPath, kHelperInterface, kHelperVtable, "helper"};
  Endpoint device{this, kDeviceName, kDevicePath, kDeviceInterface, kDeviceVtable, "device"};
  Endpoint control{this, kControlName, kControlPath, kControlInterface, kControlVtable, "control"};
  std::list<std::unique_ptr<Deferred>> deferred;
  ServerState serverState = ServerState::kAbsent;
  // SetServerPresent calls waiting for the server to reach the state they asked for, in order.
  std::deque<std::pair<MessagePtr, bool>> serverWaiters;
  Deferred* appearTimer = nullptr;
  std::vector<Endpoint*> presentAtStart;
  bool readySent = false;
};

// Handlers may reply later: they return 1 once the request is theirs, whether or not answered.
// Argument names are those of data/dbus/interfaces/*.xml, which a test holds equal to these.
const sd_bus_vtable Daemon::Impl::kServerVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES("PerformCommand", "ssa{sv}",
                             SD_BUS_PARAM(client) SD_BUS_PARAM(command) SD_BUS_PARAM(request),
                             "isv", SD_BUS_PARAM(code) SD_BUS_PARAM(message) SD_BUS_PARAM(reply),
                             &Impl::onPerformCommand, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("Subscribe", "s", SD_BUS_PARAM(client), "a(sv)", SD_BUS_PARAM(events),
                             &Impl::onSubscribe, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_SIGNAL_WITH_NAMES("Event", "sv", SD_BUS_PARAM(name) SD_BUS_PARAM(payload), 0),
    SD_BUS_VTABLE_END};

const sd_bus_vtable Daemon::Impl::kHelperVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES("Perform", "sisa{sv}",
                             SD_BUS_PARAM(service) SD_BUS_PARAM(task) SD_BUS_PARAM(command)
                                 SD_BUS_PARAM(request),
                             "isv", SD_BUS_PARAM(code) SD_BUS_PARAM(message) SD_BUS_PARAM(reply),
                             &Impl::onHelperPerform, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END};

const sd_bus_vtable Daemon::Impl::kDeviceVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES("GetIdentity", "", "", "a{sv}", SD_BUS_PARAM(identity),
                             &Impl::onGetIdentity, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END};

const sd_bus_vtable Daemon::Impl::kControlVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("EmitState", "", "", &Impl::onEmitState, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("EmitEvent", "sv", SD_BUS_PARAM(name) SD_BUS_PARAM(payload), "", "",
                             &Impl::onEmitEvent, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_NAMES("SetServerPresent", "b", SD_BUS_PARAM(present), "", "",
                             &Impl::onSetServerPresent, SD_BUS_VTABLE_UNPRIVILEGED),
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
  for (Endpoint* endpoint : {&server, &helper, &device, &control})
    endpoint->journal = Logger({kLogSubsystem, endpoint->category}, journal);

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
  // If the bus goes, nothing here can be reached any more: say so, then end.
  sd_bus_add_filter(control.bus.get(), nullptr, &Impl::onBusMessage, this);
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

void Daemon::Impl::fatal(const Endpoint& endpoint, const std::string& message) {
  endpoint.journal.log(LogLevel::kError, message);
  std::fprintf(stderr, "halvex-sim: %s\n", message.c_str());
  sd_event_exit(event.get(), 1);
}

int Daemon::Impl::onBusMessage(sd_bus_message* message, void* userdata, sd_bus_error*) {
  // sd-bus makes up this signal when the connection ends; exit-on-disconnect then ends the loop.
  if (sd_bus_message_is_signal(message, "org.freedesktop.DBus.Local", "Disconnected") > 0) {
    static_cast<Impl*>(userdata)->control.journal.log(LogLevel::kError,
                                                      "the bus went away; exiting");
  }
  return 0;
}

void Daemon::Impl::checkReady() {
  if (readySent)
    return;
  std::string names;
  for (const Endpoint* endpoint : presentAtStart) {
    if (!endpoint->owned)
      return;
    names += (names.empty() ? "" : ", ") + std::string(endpoint->name);
  }
  readySent = true;
  // The service manager first, so that whoever the descriptor wakes finds both told.
  const std::string status = "READY=1\nSTATUS=Serving " + names + " from " + options.scenarioPath;
  sd_notify(0, status.c_str());
  if (options.readyFd < 0)
    return;
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
    impl->fatal(item->owner != nullptr ? *item->owner : impl->control, e.what());
  }
  return 0;
}

int Daemon::Impl::onNameAcquired(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  auto* endpoint = static_cast<Endpoint*>(userdata);
  Impl* impl = endpoint->impl;
  std::uint32_t outcome = 0;
  if (const sd_bus_error* error = sd_bus_message_get_error(reply)) {
    impl->fatal(*endpoint, std::string("cannot own ") + endpoint->name + ": " + error->message);
    return 0;
  }
  // 1: now the owner; 4: already was. Anything else means someone else has it.
  if (sd_bus_message_read(reply, "u", &outcome) < 0 || (outcome != 1 && outcome != 4)) {
    impl->fatal(*endpoint, std::string(endpoint->name) + " is already owned on this bus");
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
      control.journal.log(LogLevel::kInfo, present
                                               ? "SetServerPresent true: the server is on the bus"
                                               : "SetServerPresent false: the server is away");
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
      // The request is already in the log (written unbuffered), and the journal has its entry
      // once the call returns; nothing else may run.
      endpoint.journal.log(LogLevel::kInfo, reply.asked + ": exit");
      ::_exit(kFaultExitStatus);
    case Fault::kNeverAnswer:
      endpoint.journal.log(LogLevel::kInfo, reply.asked + ": never answered");
      defer(&endpoint, 0, nullptr, keep(call));
      return;
    case Fault::kNone:
      break;
  }
  if (answer.delayMs == 0) {
    sendReply(endpoint, call, reply);
    return;
  }
  defer(
      &endpoint, answer.delayMs,
      [this, &endpoint, reply = std::move(reply)](Deferred& item) {
        sendReply(endpoint, item.call.get(), reply);
      },
      keep(call));
}

void Daemon::Impl::sendReply(const Endpoint& endpoint, sd_bus_message* call, const Reply& reply) {
  std::string entry = reply.asked + ": " + summary(reply);
  if (reply.logSet && writer.write(*reply.logSet, reply.description) && !options.logRoot.empty())
    entry += ", logs at " + reply.logSet->written;
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
  if (r < 0) {
    std::fprintf(stderr, "halvex-sim: cannot send a reply: %s\n", std::strerror(-r));
    endpoint.journal.log(LogLevel::kError, entry + ", not sent: " + std::strerror(-r));
    return;
  }
  endpoint.journal.log(LogLevel::kInfo, entry);
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
    const std::string asked = std::string("PerformCommand ") + command + " from " + client;
    MessageDict request;
    if (r = readRequest(call, error, request, impl->server.journal, asked); r < 0)
      return r;
    impl->log.write({{"service", "server"},
                     {"method", "PerformCommand"},
                     {"client", client},
                     {"command", command},
                     {"keys", describeKeys(request)}});

    const Server& configured = impl->scenario.server;
    if (std::string_view(command) == kCommandGetTraceProperty) {
      const PropertyAnswer property = configured.propertyAnswer(
          request.getString(kKeyTraceName), request.getString(kKeyTracePropertyName));
      MessageDict dict;
      if (property.value)
        dict.set(kKeyTracePropertyValue, MessageValue::string(*property.value));
      impl->respond(impl->server, call, property.answer,
                    makeReply(asked + " " + request.getString(kKeyTraceName) + "." +
                                  request.getString(kKeyTracePropertyName),
                              property.answer, std::move(dict), property.value.value_or("")));
      return 1;
    }

    const Answer answer = configured.commandAnswer(command);
    const bool dump = std::string_view(command) == kCommandTraceDumpState;
    const std::optional<std::string> stamp = replyTimestamp(answer, dump);
    // Without one the tool reads an empty time stamp, and so does the log set.
    const std::string timestamp = stamp.value_or("");
    MessageDict dict;
    if (stamp)
      dict.set(kKeyTimestampString, MessageValue::string(timestamp));
    Reply reply = makeReply(asked, answer, std::move(dict), timestamp);
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

    std::string events = "no event";
    if (state && state->when == StateWhen::kSubscribe)
      events = "the state event " + describe(state->payload);
    if (state && state->when == StateWhen::kAfter)
      events = "the state event to follow in " + std::to_string(state->afterMs) + " ms";
    impl->server.journal.log(LogLevel::kInfo,
                             std::string("Subscribe from ") + client + ": " + events);
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
    const std::string asked =
        std::string("Perform ") + command + " of " + service + ", task " + std::to_string(task);
    MessageDict request;
    if (r = readRequest(call, error, request, impl->helper.journal, asked); r < 0)
      return r;
    impl->log.write({{"service", "helper"},
                     {"method", "Perform"},
                     {"client", service},
                     {"task", task},
                     {"command", command},
                     {"keys", describeKeys(request)}});

    if (std::string_view(command) != helper::kCommandVarniskStatus) {
      impl->respond(impl->helper, call, Answer{}, makeReply(asked, Answer{}, {}, ""));
      return 1;
    }
    const Answer& answer = impl->scenario.helper.status;
    const std::optional<std::string> stamp = replyTimestamp(answer, true);
    const std::string timestamp = stamp.value_or("");
    MessageDict dict;
    if (stamp)
      dict.set(helper::kKeyTimestampString, MessageValue::string(timestamp));
    Reply reply = makeReply(asked, answer, std::move(dict), timestamp);
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
    if (r < 0)
      return r;
    impl->device.journal.log(LogLevel::kInfo,
                             "GetIdentity: " + describe(MessageValue::dict(std::move(identity))));
    return 1;
  });
}

int Daemon::Impl::onEmitState(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* impl = static_cast<Impl*>(userdata);
    const std::optional<StateEvent>& state = impl->scenario.server.state;
    if (!state)
      return refuse(impl->control.journal, error, "EmitState", kErrorNoState,
                    "the scenario has no state event");
    if (impl->emitEvent(kEventServerStateChange, state->payload) < 0) {
      return refuse(impl->control.journal, error, "EmitState", kErrorServerAbsent,
                    "the server is not on the bus");
    }
    impl->control.journal.log(LogLevel::kInfo, "EmitState: sent " + describe(state->payload));
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
    const std::string asked = std::string("EmitEvent ") + name;
    MessageValue payload;
    if (bus::readVariant(call, payload) < 0) {
      return refuse(impl->control.journal, error, asked, SD_BUS_ERROR_INVALID_ARGS,
                    "the payload holds a value outside the message types");
    }
    if (impl->emitEvent(name, payload) < 0)
      return refuse(impl->control.journal, error, asked, kErrorServerAbsent,
                    "the server is not on the bus");
    impl->control.journal.log(LogLevel::kInfo, asked + ": sent " + describe(payload));
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
    impl->control.journal.log(LogLevel::kInfo, "Quit: exiting");
    sd_event_exit(impl->event.get(), 0);
    return r < 0 ? r : 1;
  });
}

Daemon::Daemon(Scenario scenario, DaemonOptions options)
    : impl_(std::make_unique<Impl>(std::move(scenario), std::move(options))) {}

Daemon::~Daemon() = default;

int Daemon::run() {
  const int r = sd_event_loop(impl_->event.get());
  sd_notify(0, "STOPPING=1");
  return r < 0 ? 1 : r;
}

}  // namespace halvex::sim
