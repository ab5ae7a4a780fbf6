// SPDX-License-Identifier: MIT
// The daemon's setup: the loop and its stop signals, the kept processes, the four objects and
// which of them come onto the bus at start, and telling whoever waits once their names are owned.
#include "sim/Daemon.h"

#include <signal.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <stdexcept>
#include <system_error>
#include <utility>
#include <vector>

#include "platform/SystemLog.h"
#include "sim/BusHandles.h"
#include "sim/ControlObject.h"
#include "sim/DeviceObject.h"
#include "sim/Endpoint.h"
#include "sim/HelperObject.h"
#include "sim/LogSetWriter.h"
#include "sim/ProcessKeeper.h"
#include "sim/Replies.h"
#include "sim/RequestLog.h"
#include "sim/Scheduler.h"
#include "sim/ServerObject.h"

namespace halvex::sim {
namespace {

EventPtr newEventLoop() {
  sd_event* raw = nullptr;
  if (const int r = sd_event_new(&raw); r < 0) {
    throw std::system_error(-r, std::generic_category(), "cannot create an event loop");
  }
  return EventPtr(raw);
}

}  // namespace

struct Daemon::Impl {
  Impl(const Scenario& scenario, DaemonOptions optionsIn);
  ~Impl();

  void checkReady();
  // Connects endpoint now, as one whose name must be owned before the daemon is ready.
  void connectAtStart(Endpoint& endpoint);

  static int onBusMessage(sd_bus_message* message, void* userdata, sd_bus_error* error);

  DaemonOptions options;
  RequestLog log;
  LogSetWriter writer;
  ProcessKeeper keeper;
  // Declared before what refers to it, so it is destroyed after: connections detach from the
  // loop, messages from their connections.
  EventPtr event = newEventLoop();
  // Work that belongs to no endpoint fails under the control interface, whose connection lasts.
  Scheduler scheduler{event.get(), [this](const Endpoint* owner, const std::string& message) {
                        (owner != nullptr ? *owner : control.endpoint()).fatal(message);
                      }};
  Replier replies{scheduler, writer, !options.logRoot.empty()};
  Services services{.event = event.get(),
                    .journal = LogServer::create(),
                    .scheduler = scheduler,
                    .replies = replies,
                    .log = log,
                    .nameOwned = [this] { checkReady(); }};
  DeviceObject device;
  HelperObject helper;
  ServerObject server;
  ControlObject control{server, device, services};
  std::vector<const Endpoint*> presentAtStart;
  bool readySent = false;
};

Daemon::Impl::Impl(const Scenario& scenario, DaemonOptions optionsIn)
    : options(std::move(optionsIn)),
      log(options.requestLog),
      writer(options.logRoot),
      device(scenario.device, services),
      helper(scenario.helper, device, services),
      server(scenario.server, device, services) {
  // sd-event takes signals through a signalfd, so they must be blocked first. A null handler
  // makes the loop exit with status 0.
  sigset_t stops;
  sigemptyset(&stops);
  sigaddset(&stops, SIGTERM);
  sigaddset(&stops, SIGINT);
  pthread_sigmask(SIG_BLOCK, &stops, nullptr);
  sd_event_add_signal(event.get(), nullptr, SIGTERM, nullptr, nullptr);
  sd_event_add_signal(event.get(), nullptr, SIGINT, nullptr, nullptr);

  if (!writer.prepare()) {
    throw std::runtime_error("cannot prepare the log root");
  }
  keeper.start(scenario.processes);

  connectAtStart(control.endpoint());
  // If the bus goes, nothing here can be reached any more: say so, then end.
  sd_bus_add_filter(control.endpoint().bus(), nullptr, &Impl::onBusMessage, this);
  sd_bus_set_exit_on_disconnect(control.endpoint().bus(), 1);
  if (scenario.device.present) {
    connectAtStart(device.endpoint());
  }
  if (scenario.helper.present) {
    connectAtStart(helper.endpoint());
  }
  if (scenario.server.present && server.appear()) {
    presentAtStart.push_back(&server.endpoint());
  }
}

Daemon::Impl::~Impl() {
  server.dropWaiters();
  scheduler.clear();
}

void Daemon::Impl::connectAtStart(Endpoint& endpoint) {
  endpoint.connect();
  presentAtStart.push_back(&endpoint);
}

int Daemon::Impl::onBusMessage(sd_bus_message* message, void* userdata, sd_bus_error*) {
  // sd-bus makes up this signal when the connection ends; exit-on-disconnect then ends the loop.
  if (sd_bus_message_is_signal(message, "org.freedesktop.DBus.Local", "Disconnected") > 0) {
    static_cast<Impl*>(userdata)->control.endpoint().journal().log(LogLevel::kError,
                                                                   "the bus went away; exiting");
  }
  return 0;
}

void Daemon::Impl::checkReady() {
  if (readySent) {
    return;
  }
  std::string names;
  for (const Endpoint* endpoint : presentAtStart) {
    if (!endpoint->owned()) {
      return;
    }
    names += (names.empty() ? "" : ", ") + std::string(endpoint->name());
  }
  readySent = true;
  // The service manager first, so that whoever the descriptor wakes finds both told.
  const std::string status = "READY=1\nSTATUS=Serving " + names + " from " + options.scenarioPath;
  sd_notify(0, status.c_str());
  if (options.readyFd < 0) {
    return;
  }
  const char line[] = "ready\n";
  // Whoever waits may have gone; SIGPIPE is ignored, so a failed write is only that.
  [[maybe_unused]] const ssize_t n = ::write(options.readyFd, line, sizeof line - 1);
  ::close(options.readyFd);
  options.readyFd = -1;
}

Daemon::Daemon(const Scenario& scenario, DaemonOptions options)
    : impl_(std::make_unique<Impl>(scenario, std::move(options))) {}

Daemon::~Daemon() = default;

int Daemon::run() {
  const int r = sd_event_loop(impl_->event.get());
  sd_notify(0, "STOPPING=1");
  return r < 0 ? 1 : r;
}

}  // namespace halvex::sim
