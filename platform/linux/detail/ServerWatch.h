// SPDX-License-Identifier: MIT
// Follows the server for one manager while its events are on: who owns the server's name, the
// Event signals of that owner (and of nobody else), and the state to deliver when the server
// comes and goes. Events are posted to the manager's queue through its EventHub.
//
// Whenever the server (re)appears while events are on, it is asked to Subscribe, and its answer
// is delivered; when it leaves the bus, or the connection breaks, the stopped state is. A broken
// connection is reopened every second while events are on (with a run loop serving it).
// The matches live on the connection (ProcessBus::addMatch) and go with it.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

#include "detail/EventHub.h"
#include "detail/Private.h"
#include "detail/ProcessBus.h"
#include "platform/WorkQueue.h"

namespace halvex::client {

class ServerWatch final : public std::enable_shared_from_this<ServerWatch>,
                          public bus::ConnectionListener {
 public:
  ServerWatch(std::string client, WorkQueue queue);

  // --- any thread ---
  // Starts listening to the connection's life.
  void start();
  void setHandler(const std::string& event, EventHandler handler);
  void eventsOff();
  void eventsOn();
  // Delivery off for good; the handlers go on this thread.
  void closeDelivery();

  // --- I/O context ---
  // Nothing more is asked or watched: matches, timer and calls go.
  void close();
  void connected(sd_bus* bus) override;
  void disconnected() override;

 private:
  void startEvents();
  void watch();
  void scheduleReconnect();
  void queryOwner();
  void ownerSeen(const std::string& owner);
  // The owner is unknown from now on; the stopped state goes out if one was known.
  void forgetOwner();
  void subscribe();
  void postStopped();
  void postEvent(std::uint64_t token, std::string event, MessageValue payload);

  static int onOwnerChanged(sd_bus_message* message, void* userdata, sd_bus_error* error);
  static int onEvent(sd_bus_message* message, void* userdata, sd_bus_error* error);

  const std::string client_;
  const bool clientSendable_;
  const WorkQueue queue_;
  const std::shared_ptr<EventHub> hub_;
  std::atomic<bool> startQueued_{false};

  // I/O context only.
  bool closed_ = false;
  std::string owner_;
  bool subscribeWanted_ = false;
  std::uint64_t matchEpoch_ = 0;  // the connection the matches are on; 0: none
  bus::ProcessBus::Timer reconnect_;
};

}  // namespace halvex::client
