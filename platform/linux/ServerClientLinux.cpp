// SPDX-License-Identifier: MIT
// The server's client framework over D-Bus (see docs/dbus-protocol.md).
//
// Every Manager works on the process's one connection (detail/ProcessBus.h): the calling threads
// hand their requests to the bus's I/O context, which builds and sends the calls, decodes replies
// and signals into plain values, and posts completions and events to the manager's WorkQueue. A
// synchronous command is the same call with the caller waiting for its outcome, which the I/O
// context hands over directly, so waiting on the WorkQueue cannot deadlock.
//
// Destroying a Manager completes every command still pending with kResultConnectionLost (on the
// queue, as always) and drops events not yet delivered, before the destructor returns.
//
// When the connection breaks, a manager with events on delivers the stopped state and tries to
// reconnect every second; any command also reconnects on demand.
#include <atomic>
#include <chrono>
#include <cstdint>
#include <future>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "platform/linux/MessageCodec.h"
#include "platform/linux/detail/BusSupport.h"
#include "platform/linux/detail/CallBounds.h"
#include "platform/linux/detail/ProcessBus.h"

namespace halvex::client {

namespace {

using bus::ProcessBus;

// Commands accepted but not yet completed, per manager. dbus-daemon refuses more than its own
// limit of pending replies anyway; this one bounds what piles up on our side before that.
constexpr std::size_t kMaxPendingCommands = 1024;
// Events posted to the queue but not yet run; a flood beyond that is dropped.
constexpr std::size_t kMaxUndeliveredEvents = 1024;
// Events taken from one Subscribe reply. Beyond it only the server's last state event is kept,
// so that a server listing too much still gets its state across.
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

struct SlotReleaser {
  void operator()(sd_bus_slot* slot) const { sd_bus_slot_unref(slot); }
};
using SlotPtr = std::unique_ptr<sd_bus_slot, SlotReleaser>;

bus::CallPlan commandPlan(const std::string& command) {
  return {bus::kServerName,
          bus::kServerPath,
          bus::kServerInterface,
          "PerformCommand",
          bus::serverCommandBound(command),
          "server",
          "PerformCommand " + command};
}

// Reads a Subscribe reply "a(sv)". False for any other shape, or an entry outside the mapping.
bool readEventList(sd_bus_message* reply,
                   std::vector<std::pair<std::string, MessageValue>>& events) {
  if (sd_bus_message_has_signature(reply, "a(sv)") <= 0 ||
      sd_bus_message_enter_container(reply, 'a', "(sv)") <= 0) {
    return false;
  }
  std::optional<MessageValue> lateState;
  int r = 0;
  while ((r = sd_bus_message_enter_container(reply, 'r', "sv")) > 0) {
    const char* name = nullptr;
    MessageValue payload;
    if (sd_bus_message_read(reply, "s", &name) <= 0 || bus::readVariant(reply, payload) < 0 ||
        sd_bus_message_exit_container(reply) < 0) {
      return false;
    }
    if (events.size() < kMaxSubscribeEvents) {
      events.emplace_back(name, std::move(payload));
    } else if (std::string_view(name) == kEventServerStateChange) {
      lateState = std::move(payload);
    }
  }
  if (r < 0 || sd_bus_message_exit_container(reply) < 0) {
    return false;
  }
  if (lateState) {
    events.emplace_back(kEventServerStateChange, std::move(*lateState));
  }
  return true;
}

}  // namespace

class ManagerCore : public std::enable_shared_from_this<ManagerCore>,
                    public bus::ConnectionListener {
 public:
  ManagerCore(std::string client, WorkQueue queue)
      : client_(std::move(client)),
        clientSendable_(bus::isSendableName(client_)),
        queue_(std::move(queue)),
        hub_(std::make_shared<EventHub>()) {}

  void start() {
    ProcessBus::instance().post(
        [self = shared_from_this()] { ProcessBus::instance().addListener(self); });
  }

  // Waits until every pending command has completed (posted to the queue) and the manager's
  // matches and timer are gone.
  void shutdown() {
    hub_->close();
    auto done = std::make_shared<std::promise<void>>();
    std::future<void> finished = done->get_future();
    // The closure lets go of the core before it reports, so that the core goes with the
    // Manager, on the caller's thread, together with its queue handle.
    ProcessBus::instance().post([self = shared_from_this(), done]() mutable {
      self->closeOnBus();
      self.reset();
      done->set_value();
    });
    finished.wait();
  }

  // Any thread. done runs exactly once: in the bus's I/O context, or on the caller's thread when
  // the command is refused before it got there.
  void submit(std::string command, MessageDict request, Done done) {
    if (inFlight_.fetch_add(1) >= kMaxPendingCommands) {
      inFlight_.fetch_sub(1);
      done(bus::makeResult(kResultLimitsExceeded, "too many commands pending"), MessageValue());
      return;
    }
    auto call = std::make_shared<CommandCall>(
        CommandCall{std::move(command), std::move(request), std::move(done)});
    ProcessBus::instance().send([self = shared_from_this(), call] { self->startCommand(call); });
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

  void setHandler(const std::string& event, EventHandler handler) {
    hub_->setHandler(event, std::move(handler));
  }

  void eventsOff() { hub_->off(); }

  void eventsOn() {
    hub_->on();
    // Repeated calls before the I/O context gets to them need one start only.
    if (!startQueued_.exchange(true)) {
      ProcessBus::instance().post([self = shared_from_this()] {
        self->startQueued_.store(false);
        self->startEvents();
      });
    }
  }

  // --- I/O context ---

  void connected(sd_bus* bus) override {
    // An owner seen on a connection that went without our noticing is unknown now; the new
    // connection's owner query tells whether it is still there.
    if (!owner_.empty()) {
      owner_.clear();
      postStopped();
    }
    if (hub_->token() != 0) {
      watch(bus);
    }
  }

  void disconnected() override {
    ownerMatch_.reset();
    eventMatch_.reset();
    if (!owner_.empty()) {
      owner_.clear();
      postStopped();
    }
    if (hub_->token() != 0) {
      scheduleReconnect();
    }
  }

 private:
  int appendRequest(sd_bus_message* message, const std::string& command,
                    const MessageDict& request) const {
    int r = sd_bus_message_append(message, "ss", client_.c_str(), command.c_str());
    return r < 0 ? r : bus::appendDict(message, request);
  }

  void finish(CommandCall& call, Result result, MessageValue value) {
    inFlight_.fetch_sub(1);
    call.done(std::move(result), std::move(value));
  }

  void closeOnBus() {
    closed_ = true;
    ProcessBus& bus = ProcessBus::instance();
    bus.removeListener(this);
    ownerMatch_.reset();
    eventMatch_.reset();
    reconnect_.reset();
    bus.cancel(this, bus::makeResult(kResultConnectionLost, "client closed"));
  }

  void startCommand(const std::shared_ptr<CommandCall>& call) {
    if (closed_) {
      finish(*call, bus::makeResult(kResultConnectionLost, "client closed"), {});
      return;
    }
    if (!clientSendable_ || !bus::isSendableName(call->command)) {
      finish(*call, bus::makeResult(kResultInvalidRequest, "client or command name cannot be sent"),
             {});
      return;
    }
    ProcessBus::instance().callAsync(
        commandPlan(call->command),
        [this, &call](sd_bus_message* message) {
          return appendRequest(message, call->command, call->request);
        },
        [this, call](const Result& failure, sd_bus_message* reply) {
          MessageValue value;
          Result result = reply != nullptr ? bus::readOutcome(reply, value) : failure;
          Result logged = result;
          finish(*call, std::move(result), std::move(value));
          return logged;
        },
        this);
  }

  void startEvents() {
    if (closed_ || hub_->token() == 0) {
      return;
    }
    const std::uint64_t watchedBefore = matchEpoch_;
    sd_bus* bus = ProcessBus::instance().connection();
    if (bus == nullptr) {
      scheduleReconnect();
      return;
    }
    if (matchEpoch_ != ProcessBus::instance().epoch()) {
      watch(bus);
    } else if (matchEpoch_ == watchedBefore) {
      // Watched since an earlier EventsOn: ask again, so that the state is delivered anew. (A
      // connection opened just now told connected(), which has asked already.)
      subscribeWanted_ = true;
      queryOwner();
    }
  }

  // Installs the matches on bus and asks who owns the server's name now.
  void watch(sd_bus* bus) {
    matchEpoch_ = ProcessBus::instance().epoch();
    // The matches go first: the bus handles our messages in order, so no owner change after the
    // owner query can slip by unseen. A match that cannot be installed costs us its signals but
    // not the connection, which sd-bus would close without an install callback.
    sd_bus_slot* slot = nullptr;
    if (sd_bus_add_match_async(bus, &slot, kOwnerChangedMatch, &ManagerCore::onOwnerChanged,
                               &ManagerCore::onMatchInstalled, this) >= 0) {
      ownerMatch_.reset(slot);
    }
    slot = nullptr;
    if (sd_bus_match_signal_async(bus, &slot, nullptr, bus::kServerPath, bus::kServerInterface,
                                  "Event", &ManagerCore::onEvent, &ManagerCore::onMatchInstalled,
                                  this) >= 0) {
      eventMatch_.reset(slot);
    }
    subscribeWanted_ = true;
    queryOwner();
  }

  void scheduleReconnect() {
    if (closed_ || reconnect_) {
      return;
    }
    reconnect_ = ProcessBus::instance().runAfter(kReconnectDelay, [weak = weak_from_this()] {
      if (auto self = weak.lock()) {
        self->reconnect_.reset();
        if (!self->closed_ && self->hub_->token() != 0) {
          self->startEvents();
        }
      }
    });
  }

  void queryOwner() {
    const std::uint64_t epoch = ProcessBus::instance().epoch();
    ProcessBus::instance().callAsync(
        {bus::kBusDriverName,
         bus::kBusDriverPath,
         bus::kBusDriverInterface,
         "GetNameOwner",
         bus::callBounds().subscribe,
         nullptr,
         {}},
        [](sd_bus_message* message) {
          return sd_bus_message_append(message, "s", bus::kServerName);
        },
        [this, epoch](const Result& failure, sd_bus_message* reply) {
          if (epoch != ProcessBus::instance().epoch() || closed_) {
            return failure;
          }
          const char* owner = nullptr;
          if (reply != nullptr && sd_bus_message_read(reply, "s", &owner) > 0) {
            ownerSeen(owner);
          } else if (reply == nullptr && failure.code == kResultServerNotRunning) {
            ownerSeen("");
          }
          return failure;
        },
        this);
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
    const std::uint64_t token = hub_->token();
    const std::uint64_t epoch = ProcessBus::instance().epoch();
    // Addressed to the owner's unique name: if that process goes, the answer cannot come from
    // its successor, which gets a Subscribe of its own.
    ProcessBus::instance().callAsync(
        {owner_.c_str(), bus::kServerPath, bus::kServerInterface, "Subscribe",
         bus::callBounds().subscribe, "server", "Subscribe"},
        [this](sd_bus_message* message) {
          return sd_bus_message_append(message, "s", client_.c_str());
        },
        [this, target = owner_, token, epoch](const Result& failure, sd_bus_message* reply) {
          if (reply == nullptr) {
            return failure;
          }
          std::vector<std::pair<std::string, MessageValue>> events;
          if (!readEventList(reply, events)) {
            return bus::makeResult(kResultBadReply, "Subscribe reply of the wrong shape");
          }
          if (epoch == ProcessBus::instance().epoch() && target == owner_ && !closed_) {
            for (auto& [name, payload] : events) {
              postEvent(token, name, std::move(payload));
            }
          }
          return Result{};
        },
        this);
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

  // I/O context only.
  bool closed_ = false;
  std::string owner_;
  bool subscribeWanted_ = false;
  std::uint64_t matchEpoch_ = 0;
  SlotPtr ownerMatch_;
  SlotPtr eventMatch_;
  ProcessBus::Timer reconnect_;
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
