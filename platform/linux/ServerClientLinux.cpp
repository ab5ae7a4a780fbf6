// SPDX-License-Identifier: MIT
// The server's client framework over D-Bus (see docs/dbus-protocol.md).
//
// Every Manager works on the process's one connection (detail/ProcessBus.h): a request is sent in
// the bus's I/O context, which decodes the reply into plain values; the completion goes to the
// manager's WorkQueue. A synchronous command is the same call with the caller waiting for its
// outcome, which the I/O context hands over directly, so waiting on the WorkQueue cannot
// deadlock. Events are detail/ServerWatch.h's business.
//
// Destroying a Manager completes every command still pending with kResultConnectionLost (on the
// queue, as always) and drops events not yet delivered, before the destructor returns.
#include <atomic>
#include <cstdint>
#include <future>
#include <string>
#include <utility>

#include "detail/BusSupport.h"
#include "detail/CallBounds.h"
#include "detail/ProcessBus.h"
#include "detail/ServerWatch.h"
#include "platform/ServerClient.h"
#include "platform/linux/MessageCodec.h"

namespace halvex::client {

namespace {

using bus::ProcessBus;

// Commands accepted but not yet completed, per manager. dbus-daemon refuses more than its own
// limit of pending replies anyway; this one bounds what piles up on our side before that.
constexpr std::size_t kMaxPendingCommands = 1024;

using Done = std::function<void(Result, MessageValue)>;

struct CommandCall {
  std::string command;
  MessageDict request;
  Done done;
};

bus::CallPlan commandPlan(const std::string& command) {
  return {bus::kServerName,
          bus::kServerPath,
          bus::kServerInterface,
          bus::kServerPerformCommand,
          bus::serverCommandBound(command),
          "server",
          std::string(bus::kServerPerformCommand) + " " + command};
}

}  // namespace

class ManagerCore : public std::enable_shared_from_this<ManagerCore> {
 public:
  ManagerCore(std::string client, WorkQueue queue)
      : client_(std::move(client)),
        clientSendable_(bus::isSendableName(client_)),
        queue_(queue),
        events_(std::make_shared<ServerWatch>(client_, std::move(queue))) {}

  void start() { events_->start(); }

  ServerWatch& events() { return *events_; }

  // Waits until every pending command has completed (posted to the queue) and nothing of the
  // manager's is left on the bus.
  void shutdown() {
    events_->closeDelivery();
    // Shared: the waiter may wake and return before set_value() has.
    auto done = std::make_shared<std::promise<void>>();
    std::future<void> finished = done->get_future();
    // The closure lets go of the core before it reports, so that the core goes with the
    // Manager, on the caller's thread, together with its queue handle.
    ProcessBus::instance().post([self = shared_from_this(), done]() mutable {
      self->events_->close();
      ProcessBus::instance().cancel(self.get(),
                                    bus::makeResult(kResultConnectionLost, "client closed"));
      self.reset();
      done->set_value();
    });
    finished.wait();
  }

  // Any thread. done runs exactly once: in the bus's I/O context, or on the caller's thread when
  // the command is refused before it got there.
  void submit(std::string command, MessageDict request, Done done) {
    if (!clientSendable_ || !bus::isSendableName(command)) {
      done(bus::makeResult(kResultInvalidRequest, "client or command name cannot be sent"),
           MessageValue());
      return;
    }
    if (inFlight_.fetch_add(1) >= kMaxPendingCommands) {
      inFlight_.fetch_sub(1);
      done(bus::makeResult(kResultLimitsExceeded, "too many commands pending"), MessageValue());
      return;
    }
    auto call = std::make_shared<CommandCall>(
        CommandCall{std::move(command), std::move(request), std::move(done)});
    bus::CallPlan plan = commandPlan(call->command);
    ProcessBus::instance().request(
        std::move(plan),
        [this, call](sd_bus_message* message) {
          return appendRequest(message, call->command, call->request);
        },
        [this, call](const Result& failure, sd_bus_message* reply) {
          MessageValue value;
          Result result = reply != nullptr ? bus::readOutcome(reply, value) : failure;
          Result logged = result;
          inFlight_.fetch_sub(1);
          call->done(std::move(result), std::move(value));
          return logged;
        },
        this);
  }

  Result performSync(const std::string& command, const MessageDict& request, MessageValue& reply) {
    if (!clientSendable_ || !bus::isSendableName(command)) {
      return bus::makeResult(kResultInvalidRequest, "client or command name cannot be sent");
    }
    MessageValue value;
    Result result = ProcessBus::instance().call(
        commandPlan(command),
        [&](sd_bus_message* message) { return appendRequest(message, command, request); },
        [&value](sd_bus_message* answer) { return bus::readOutcome(answer, value); });
    reply = std::move(value);
    return result;
  }

  void postCompletion(const std::shared_ptr<Completion>& box, Result result, MessageValue reply) {
    queue_.post([box, result = std::move(result), reply = std::move(reply)]() mutable {
      // Moved out so that the caller's completion, and everything it holds, is released on the
      // queue right after it ran, whichever thread drops the box last.
      Completion completion = std::move(*box);
      *box = nullptr;
      if (completion) {
        completion(std::move(result), std::move(reply));
      }
    });
  }

 private:
  int appendRequest(sd_bus_message* message, const std::string& command,
                    const MessageDict& request) const {
    int r = sd_bus_message_append(message, "ss", client_.c_str(), command.c_str());
    return r < 0 ? r : bus::appendDict(message, request);
  }

  const std::string client_;
  const bool clientSendable_;
  const WorkQueue queue_;
  const std::shared_ptr<ServerWatch> events_;
  std::atomic<std::size_t> inFlight_{0};
};

class Manager {
 public:
  Manager(std::string client, WorkQueue queue)
      : core_(std::make_shared<ManagerCore>(std::move(client), std::move(queue))) {
    core_->start();
  }
  ~Manager() { core_->shutdown(); }
  Manager(const Manager&) = delete;
  Manager& operator=(const Manager&) = delete;

  ManagerCore& core() { return *core_; }

 private:
  std::shared_ptr<ManagerCore> core_;
};

std::shared_ptr<Manager> CreateManager(const std::string& clientName, WorkQueue queue) {
  return std::make_shared<Manager>(clientName, std::move(queue));
}

void RegisterEventHandler(const std::shared_ptr<Manager>& manager, const std::string& event,
                          EventHandler handler) {
  if (manager) {
    manager->core().events().setHandler(event, std::move(handler));
  }
}

void EventsOff(const std::shared_ptr<Manager>& manager) {
  if (manager) {
    manager->core().events().eventsOff();
  }
}

void EventsOn(const std::shared_ptr<Manager>& manager) {
  if (manager) {
    manager->core().events().eventsOn();
  }
}

Result PerformCommand(const std::shared_ptr<Manager>& manager, const std::string& command,
                      const MessageDict& request, MessageValue& reply) {
  reply = MessageValue();
  if (!manager) {
    return bus::makeResult(kResultInvalidRequest, "no manager");
  }
  return manager->core().performSync(command, request, reply);
}

void PerformCommand(const std::shared_ptr<Manager>& manager, const std::string& command,
                    Completion completion, const MessageDict& request) {
  if (!manager) {
    // No queue to run it on; running it here is the only way it still runs once.
    if (completion) {
      completion(bus::makeResult(kResultInvalidRequest, "no manager"), MessageValue());
    }
    return;
  }
  ManagerCore& core = manager->core();
  auto box = std::make_shared<Completion>(std::move(completion));
  // The I/O context only ever sees the box, so the caller's completion can never be released
  // there; the ManagerCore outlives every call it completes.
  core.submit(command, request, [&core, box](Result result, MessageValue value) {
    core.postCompletion(box, std::move(result), std::move(value));
  });
}

}  // namespace halvex::client
