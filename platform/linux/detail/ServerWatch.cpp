// SPDX-License-Identifier: MIT
#include "detail/ServerWatch.h"

#include <chrono>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

#include "detail/BusSupport.h"
#include "detail/CallBounds.h"
#include "platform/ServerProtocol.h"
#include "platform/linux/MessageCodec.h"

namespace halvex::client {

namespace {

using bus::ProcessBus;

// Events taken from one Subscribe reply. Beyond it only the server's last state event is kept,
// so that a server listing too much still gets its state across.
constexpr std::size_t kMaxSubscribeEvents = 256;

constexpr auto kReconnectDelay = std::chrono::seconds(1);

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

ServerWatch::ServerWatch(std::string client, WorkQueue queue)
    : client_(std::move(client)),
      clientSendable_(bus::isSendableName(client_)),
      queue_(std::move(queue)),
      hub_(std::make_shared<EventHub>()) {}

void ServerWatch::start() {
  ProcessBus::instance().post(
      [self = shared_from_this()] { ProcessBus::instance().addListener(self); });
}

void ServerWatch::setHandler(const std::string& event, EventHandler handler) {
  hub_->setHandler(event, std::move(handler));
}

void ServerWatch::eventsOff() {
  hub_->off();
}

void ServerWatch::eventsOn() {
  hub_->on();
  // Repeated calls before the I/O context gets to them need one start only.
  if (!startQueued_.exchange(true)) {
    ProcessBus::instance().post([self = shared_from_this()] {
      self->startQueued_.store(false);
      self->startEvents();
    });
  }
}

void ServerWatch::closeDelivery() {
  hub_->close();
}

void ServerWatch::close() {
  closed_ = true;
  ProcessBus& bus = ProcessBus::instance();
  bus.removeListener(this);
  bus.removeMatches(this);
  matchEpoch_ = 0;
  reconnect_.reset();
  bus.cancel(this, bus::makeResult(kResultConnectionLost, "client closed"));
}

void ServerWatch::connected(sd_bus*) {
  // An owner seen on a connection that went without our noticing is unknown now; the new
  // connection's owner query tells whether it is still there.
  forgetOwner();
  if (hub_->token() != 0) {
    watch();
  }
}

void ServerWatch::disconnected() {
  matchEpoch_ = 0;
  // A timer of a loop that has stopped never fires; the next loop gets a timer of its own.
  reconnect_.reset();
  forgetOwner();
  if (hub_->token() != 0) {
    scheduleReconnect();
  }
}

void ServerWatch::forgetOwner() {
  if (!owner_.empty()) {
    owner_.clear();
    postStopped();
  }
}

void ServerWatch::startEvents() {
  if (closed_ || hub_->token() == 0) {
    return;
  }
  ProcessBus& bus = ProcessBus::instance();
  const std::uint64_t watchedBefore = matchEpoch_;
  if (bus.connection() == nullptr) {
    scheduleReconnect();
    return;
  }
  if (matchEpoch_ != bus.epoch()) {
    watch();
  } else if (matchEpoch_ == watchedBefore) {
    // Watched since an earlier EventsOn: ask again, so that the state is delivered anew. (A
    // connection opened just now told connected(), which has asked already.)
    subscribeWanted_ = true;
    queryOwner();
  }
}

// Installs the matches on the connection and asks who owns the server's name now.
void ServerWatch::watch() {
  ProcessBus& bus = ProcessBus::instance();
  matchEpoch_ = bus.epoch();
  // The matches go first: the bus handles our messages in order, so no owner change after the
  // owner query can slip by unseen.
  // Never destroyed: the loop may still use them while the process exits.
  static const auto* const ownerRule = new std::string(bus::ownerChangedRule(bus::kServerName));
  static const auto* const eventRule = new std::string(
      bus::signalRule(nullptr, bus::kServerPath, bus::kServerInterface, bus::kServerEvent));
  bus.addMatch(this, ownerRule->c_str(), &ServerWatch::onOwnerChanged, this);
  bus.addMatch(this, eventRule->c_str(), &ServerWatch::onEvent, this);
  subscribeWanted_ = true;
  queryOwner();
}

void ServerWatch::scheduleReconnect() {
  if (closed_ || reconnect_) {
    return;
  }
  reconnect_ = ProcessBus::instance().runAfter(kReconnectDelay, [weak = weak_from_this()] {
    if (auto self = weak.lock()) {
      self->reconnect_.reset();
      self->startEvents();
    }
  });
}

void ServerWatch::queryOwner() {
  const std::uint64_t epoch = ProcessBus::instance().epoch();
  ProcessBus::instance().request(
      {bus::kBusDriverName,
       bus::kBusDriverPath,
       bus::kBusDriverInterface,
       "GetNameOwner",
       bus::callBounds().subscribe,
       nullptr,
       {}},
      [](sd_bus_message* message) { return sd_bus_message_append(message, "s", bus::kServerName); },
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
void ServerWatch::ownerSeen(const std::string& owner) {
  // A new owner is subscribed to at once; the same one again only when a subscription is owed.
  const bool changed = owner != owner_;
  if (changed) {
    forgetOwner();
    owner_ = owner;
  }
  if (!owner_.empty() && (changed || subscribeWanted_) && hub_->token() != 0) {
    subscribe();
  }
}

void ServerWatch::subscribe() {
  subscribeWanted_ = false;
  if (!clientSendable_) {
    return;
  }
  const std::uint64_t token = hub_->token();
  const std::uint64_t epoch = ProcessBus::instance().epoch();
  // Addressed to the owner's unique name: if that process goes, the answer cannot come from
  // its successor, which gets a Subscribe of its own.
  ProcessBus::instance().request(
      {owner_.c_str(), bus::kServerPath, bus::kServerInterface, bus::kServerSubscribe,
       bus::callBounds().subscribe, "server", bus::kServerSubscribe},
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

void ServerWatch::postStopped() {
  MessageDict payload;
  payload.set(kKeyServerState, MessageValue::string(bus::kServerStateStopped));
  postEvent(hub_->token(), kEventServerStateChange, MessageValue::dict(std::move(payload)));
}

void ServerWatch::postEvent(std::uint64_t token, std::string event, MessageValue payload) {
  if (token == 0 || hub_->token() != token || !hub_->reserve()) {
    return;
  }
  queue_.post([hub = hub_, token, event = std::move(event), payload = std::move(payload)]() {
    hub->deliver(token, event, payload);
  });
}

int ServerWatch::onOwnerChanged(sd_bus_message* message, void* userdata, sd_bus_error*) {
  const char* name = nullptr;
  const char* previous = nullptr;
  const char* current = nullptr;
  if (sd_bus_message_read(message, "sss", &name, &previous, &current) > 0 &&
      std::string_view(name) == bus::kServerName) {
    static_cast<ServerWatch*>(userdata)->ownerSeen(current);
  }
  return 0;
}

int ServerWatch::onEvent(sd_bus_message* message, void* userdata, sd_bus_error*) {
  auto* self = static_cast<ServerWatch*>(userdata);
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

}  // namespace halvex::client
