// SPDX-License-Identifier: MIT
// The server's client framework over D-Bus (see docs/dbus-protocol.md).
//
// Each Manager runs one BusThread: a private connection and its event loop on an I/O thread of
// its own. The calling threads only queue work for it; it builds and sends the calls, decodes
// replies and signals into plain values, and posts completions and events to the manager's
// WorkQueue. A synchronous command is the same call with the caller waiting for the outcome,
// which the I/O thread hands over directly, so waiting on the WorkQueue cannot deadlock.
//
// Destroying a Manager completes every command still pending with kResultConnectionLost (on the
// queue, as always) and drops events not yet delivered; it closes the connection and ends the
// I/O thread before it returns, unless the last reference went on the I/O thread itself.
//
// After our own connection breaks, a manager with events on delivers the stopped state and
// tries to reconnect every second; any command also reconnects on demand.
#include <atomic>
#include <chrono>
#include <cstdint>
#include <future>
#include <map>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "platform/linux/MessageCodec.h"
#include "platform/linux/detail/BusSupport.h"
#include "platform/linux/detail/BusThread.h"

namespace halvex::client {

namespace {

using bus::BusThread;

// Commands accepted but not yet completed, per manager. dbus-daemon refuses more than its own
// limit of pending replies anyway; this one bounds what piles up on our side before that.
constexpr std::size_t kMaxPendingCommands = 1024;
// Events posted to the queue but not yet run; a flood beyond that is dropped.
constexpr std::size_t kMaxUndeliveredEvents = 1024;
// Events in one Subscribe reply.
constexpr std::size_t kMaxSubscribeEvents = 256;

constexpr auto kReconnectDelay = std::chrono::seconds(1);

constexpr char kServerStateStopped[] = "Stopped";

constexpr char kOwnerChangedMatch[] =
    "type='signal',sender='org.freedesktop.DBus',path='/org/freedesktop/DBus',"
    "interface='org.freedesktop.DBus',member='NameOwnerChanged',arg0='org.halvex.Server'";

using Done = std::function<void(Result, MessageValue)>;

// Handlers and the on/off state of delivery, shared with the closures queued for delivery so
// that they can tell, when they finally run, whether their event still counts.
class EventHub {
 public:
  // Nonzero while events are on; changes with every EventsOff, so an event stamped with the token
  // current when it was received is dropped if delivery was switched off since.
  std::uint64_t token() const {
    std::uint64_t state = state_.load();
    return (state & 1) != 0 ? state : 0;
  }

  void on() {
    std::uint64_t state = state_.load();
    while (!state_.compare_exchange_weak(state, state | 1)) {
    }
  }

  void off() {
    std::uint64_t state = state_.load();
    while (!state_.compare_exchange_weak(state, ((state >> 1) + 1) << 1)) {
    }
  }

  void setHandler(const std::string& event, EventHandler handler) {
    EventHandler previous;
    std::lock_guard lock(mutex_);
    if (closed_) {
      return;
    }
    EventHandler& slot = handlers_[event];
    previous = std::exchange(slot, std::move(handler));
  }

  // Off for good; the handlers go with the manager, on this thread.
  void close() {
    off();
    std::map<std::string, EventHandler> handlers;
    {
      std::lock_guard lock(mutex_);
      closed_ = true;
      handlers.swap(handlers_);
    }
  }

  // Counts an event about to be queued; false, counting nothing, when too many are queued.
  bool reserve() {
    if (undelivered_.fetch_add(1) < kMaxUndeliveredEvents) {
      return true;
    }
    release();
    return false;
  }

  // Runs on the manager's queue.
  void deliver(std::uint64_t token, const std::string& event, MessageValue payload) {
    release();
    if (token == 0 || state_.load() != token) {
      return;
    }
    EventHandler handler;
    {
      std::lock_guard lock(mutex_);
      auto it = handlers_.find(event);
      if (closed_ || it == handlers_.end()) {
        return;
      }
      handler = it->second;
    }
    if (handler) {
      handler(std::move(payload), TaskGroup());
    }
  }

 private:
  void release() { undelivered_.fetch_sub(1); }

  std::atomic<std::uint64_t> state_{0};  // generation * 2 + (on ? 1 : 0)
  std::atomic<std::size_t> undelivered_{0};
  std::mutex mutex_;
  std::map<std::string, EventHandler> handlers_;
  bool closed_ = false;
};

struct CommandCall {
  std::string command;
  MessageDict request;
  Done done;
};

}  // namespace

class ManagerCore : public std::enable_shared_from_this<ManagerCore> {
 public:
  ManagerCore(std::string client, WorkQueue queue)
      : client_(std::move(client)),
        clientSendable_(bus::isSendableName(client_)),
        queue_(std::move(queue)),
        hub_(std::make_shared<EventHub>()),
        thread_("halvex-client", BusThread::Hooks{[this](sd_bus* bus) { onConnected(bus); },
                                                  [this] { onDisconnected(); }}) {}

  void start() { thread_.start(shared_from_this()); }

  void shutdown() {
    thread_.stop();
    hub_->close();
  }

  // Any thread. done runs exactly once: on the I/O thread, or on the caller's when the command
  // is refused before it got there.
  void submit(std::string command, MessageDict request, Done done) {
    if (inFlight_.fetch_add(1) >= kMaxPendingCommands) {
      inFlight_.fetch_sub(1);
      done(bus::makeResult(kResultLimitsExceeded, "too many commands pending"), MessageValue());
      return;
    }
    auto call = std::make_shared<CommandCall>(
        CommandCall{std::move(command), std::move(request), std::move(done)});
    if (!thread_.post([this, call] { startCommand(call); })) {
      finish(*call, bus::makeResult(kResultBusError, "client event loop unavailable"), {});
    }
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

  void setHandler(const std::string& event, EventHandler handler) {
    hub_->setHandler(event, std::move(handler));
  }

  void eventsOff() { hub_->off(); }

  void eventsOn() {
    hub_->on();
    // Repeated calls before the I/O thread gets to them need one start only.
    if (!startQueued_.exchange(true)) {
      if (!thread_.post([this] {
            startQueued_.store(false);
            startEvents();
          })) {
        startQueued_.store(false);
      }
    }
  }

 private:
  void finish(CommandCall& call, Result result, MessageValue value) {
    inFlight_.fetch_sub(1);
    call.done(std::move(result), std::move(value));
  }

  // --- I/O thread ---

  void startCommand(const std::shared_ptr<CommandCall>& call) {
    if (!clientSendable_ || !bus::isSendableName(call->command)) {
      finish(*call, bus::makeResult(kResultInvalidRequest, "client or command name cannot be sent"),
             {});
      return;
    }
    thread_.callAsync(
        bus::kServerName, bus::kServerPath, bus::kServerInterface, "PerformCommand",
        [this, &call](sd_bus_message* message) {
          int r = sd_bus_message_append(message, "ss", client_.c_str(), call->command.c_str());
          return r < 0 ? r : bus::appendDict(message, call->request);
        },
        [this, call](const Result& failure, sd_bus_message* reply) {
          MessageValue value;
          Result result = reply != nullptr ? bus::readOutcome(reply, value) : failure;
          finish(*call, std::move(result), std::move(value));
        });
  }

  void startEvents() {
    if (hub_->token() == 0) {
      return;
    }
    subscribeWanted_ = true;
    bool opened = false;
    if (thread_.connection(&opened) == nullptr) {
      scheduleReconnect();
    } else if (!opened) {
      // A fresh connection asks for the owner itself, in onConnected.
      queryOwner();
    }
  }

  void scheduleReconnect() {
    thread_.runAfter(kReconnectDelay, [this] {
      if (hub_->token() != 0 && thread_.connection() == nullptr) {
        scheduleReconnect();
      }
    });
  }

  void onConnected(sd_bus* bus) {
    // An owner seen on a connection that went without its Disconnected signal (we noticed first)
    // is unknown now; the new connection's owner query tells whether it is still there.
    if (!owner_.empty()) {
      owner_.clear();
      postStopped();
    }
    // The matches go first: the bus handles our messages in order, so no owner change after the
    // owner query can slip by unseen. A match that cannot be installed costs us its signals but
    // not the connection, which sd-bus would close without an install callback.
    sd_bus_add_match_async(bus, nullptr, kOwnerChangedMatch, &ManagerCore::onOwnerChanged,
                           &ManagerCore::onMatchInstalled, this);
    sd_bus_match_signal_async(bus, nullptr, nullptr, bus::kServerPath, bus::kServerInterface,
                              "Event", &ManagerCore::onEvent, &ManagerCore::onMatchInstalled, this);
    if (hub_->token() != 0) {
      subscribeWanted_ = true;
      queryOwner();
    }
  }

  void onDisconnected() {
    if (!owner_.empty()) {
      owner_.clear();
      postStopped();
    }
    if (hub_->token() != 0) {
      scheduleReconnect();
    }
  }

  void queryOwner() {
    std::uint64_t epoch = thread_.epoch();
    thread_.callAsync(
        bus::kBusDriverName, bus::kBusDriverPath, bus::kBusDriverInterface, "GetNameOwner",
        [](sd_bus_message* message) {
          return sd_bus_message_append(message, "s", bus::kServerName);
        },
        [this, epoch](const Result& failure, sd_bus_message* reply) {
          if (epoch != thread_.epoch()) {
            return;
          }
          const char* owner = nullptr;
          if (reply != nullptr && sd_bus_message_read(reply, "s", &owner) > 0) {
            ownerSeen(owner);
          } else if (reply == nullptr && failure.code == kResultServerNotRunning) {
            ownerSeen("");
          }
        });
  }

  // owner is the unique name now owning the server's name, empty when nobody does.
  void ownerSeen(const std::string& owner) {
    if (owner == owner_) {
      if (!owner_.empty() && subscribeWanted_ && hub_->token() != 0) {
        subscribe();
      }
      return;
    }
    if (!owner_.empty()) {
      postStopped();
    }
    owner_ = owner;
    if (!owner_.empty() && hub_->token() != 0) {
      subscribe();
    }
  }

  void subscribe() {
    subscribeWanted_ = false;
    if (!clientSendable_) {
      return;
    }
    std::string target = owner_;
    std::uint64_t token = hub_->token();
    std::uint64_t epoch = thread_.epoch();
    // Addressed to the owner's unique name: if that process goes, the answer cannot come from
    // its successor, which gets a Subscribe of its own.
    thread_.callAsync(
        target.c_str(), bus::kServerPath, bus::kServerInterface, "Subscribe",
        [this](sd_bus_message* message) {
          return sd_bus_message_append(message, "s", client_.c_str());
        },
        [this, target, token, epoch](const Result&, sd_bus_message* reply) {
          if (reply == nullptr || epoch != thread_.epoch() || target != owner_) {
            return;
          }
          std::vector<std::pair<std::string, MessageValue>> events;
          if (readEventList(reply, events)) {
            for (auto& [name, payload] : events) {
              postEvent(token, name, std::move(payload));
            }
          }
        });
  }

  static bool readEventList(sd_bus_message* reply,
                            std::vector<std::pair<std::string, MessageValue>>& events) {
    if (sd_bus_message_has_signature(reply, "a(sv)") <= 0 ||
        sd_bus_message_enter_container(reply, 'a', "(sv)") <= 0) {
      return false;
    }
    int r = 0;
    while ((r = sd_bus_message_enter_container(reply, 'r', "sv")) > 0) {
      const char* name = nullptr;
      MessageValue payload;
      if (events.size() >= kMaxSubscribeEvents || sd_bus_message_read(reply, "s", &name) <= 0 ||
          bus::readVariant(reply, payload) < 0 || sd_bus_message_exit_container(reply) < 0) {
        return false;
      }
      events.emplace_back(name, std::move(payload));
    }
    return r == 0 && sd_bus_message_exit_container(reply) >= 0;
  }

  void postStopped() {
    MessageDict payload;
    payload.set(kKeyServerState, MessageValue::string(kServerStateStopped));
    postEvent(hub_->token(), kEventServerStateChange, MessageValue::dict(std::move(payload)));
  }

  void postEvent(std::uint64_t token, std::string event, MessageValue payload) {
    if (token == 0 || hub_->token() != token || !hub_->reserve()) {
      return;
    }
    queue_.post([hub = hub_, token, event = std::move(event), payload = std::move(payload)]() {
      hub->deliver(token, event, payload);
    });
  }

  static int onMatchInstalled(sd_bus_message*, void*, sd_bus_error*) { return 0; }

  static int onOwnerChanged(sd_bus_message* message, void* userdata, sd_bus_error*) {
    const char* name = nullptr;
    const char* previous = nullptr;
    const char* current = nullptr;
    if (sd_bus_message_read(message, "sss", &name, &previous, &current) > 0 &&
        std::string_view(name) == bus::kServerName) {
      static_cast<ManagerCore*>(userdata)->ownerSeen(current);
    }
    return 0;
  }

  static int onEvent(sd_bus_message* message, void* userdata, sd_bus_error*) {
    auto* self = static_cast<ManagerCore*>(userdata);
    const char* sender = sd_bus_message_get_sender(message);
    // Anyone may send a signal with the server's path and interface; only its owner counts.
    if (self->owner_.empty() || sender == nullptr || self->owner_ != sender ||
        sd_bus_message_has_signature(message, "sv") <= 0) {
      return 0;
    }
    const char* event = nullptr;
    MessageValue payload;
    if (sd_bus_message_read(message, "s", &event) > 0 && bus::readVariant(message, payload) == 0) {
      self->postEvent(self->hub_->token(), event, std::move(payload));
    }
    return 0;
  }

  const std::string client_;
  const bool clientSendable_;
  const WorkQueue queue_;
  const std::shared_ptr<EventHub> hub_;
  std::atomic<std::size_t> inFlight_{0};
  std::atomic<bool> startQueued_{false};

  // I/O thread only.
  std::string owner_;
  bool subscribeWanted_ = false;

  // Last, so that it is the first to go: its thread may still use everything above.
  BusThread thread_;
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
    manager->core().setHandler(event, std::move(handler));
  }
}

void EventsOff(const std::shared_ptr<Manager>& manager) {
  if (manager) {
    manager->core().eventsOff();
  }
}

void EventsOn(const std::shared_ptr<Manager>& manager) {
  if (manager) {
    manager->core().eventsOn();
  }
}

Result PerformCommand(const std::shared_ptr<Manager>& manager, const std::string& command,
                      const MessageDict& request, MessageValue& reply) {
  reply = MessageValue();
  std::shared_ptr<Manager> keep = manager;
  if (!keep) {
    return bus::makeResult(kResultInvalidRequest, "no manager");
  }
  // Shared with the I/O thread, which may still hold its side when this thread wakes up.
  auto outcome = std::make_shared<std::promise<std::pair<Result, MessageValue>>>();
  auto future = outcome->get_future();
  keep->core().submit(command, request, [outcome](Result result, MessageValue value) {
    outcome->set_value({std::move(result), std::move(value)});
  });
  auto [result, value] = future.get();
  reply = std::move(value);
  return result;
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
  // The I/O thread only ever sees the box, so the caller's completion can never be released
  // there; the ManagerCore outlives every call it completes.
  core.submit(command, request, [&core, box](Result result, MessageValue value) {
    core.postCompletion(box, std::move(result), std::move(value));
  });
}

}  // namespace halvex::client
