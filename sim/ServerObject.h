// SPDX-License-Identifier: MIT
// The baseband-manager server, org.halvex.Server1 at /org/halvex/Server: PerformCommand answered
// as the scenario says, Subscribe with the state event (in the reply or as a later Event signal),
// and the server's presence on the bus, which the scenario may delay and the control interface
// changes. Coming and going takes the bus a round trip each, so presence is a small state
// machine, and calls asking for a presence are answered, in order, once it holds. Runs on the
// daemon's loop.
#pragma once

#include <deque>
#include <optional>

#include "sim/DeviceObject.h"
#include "sim/Endpoint.h"
#include "sim/Scenario.h"
#include "sim/Scheduler.h"

namespace halvex::sim {

class ServerObject {
 public:
  // device tells the radio vendor the log sets are named for.
  ServerObject(Server scenario, const DeviceObject& device, const Services& services);
  ServerObject(const ServerObject&) = delete;
  ServerObject& operator=(const ServerObject&) = delete;

  Endpoint& endpoint() { return endpoint_; }
  // The scenario's state event; unset when it has none.
  const std::optional<StateEvent>& stateEvent() const { return scenario_.state; }

  // Brings the server onto the bus as the scenario says: now, returning true, or once its delay
  // has passed (returning false). Throws std::runtime_error.
  bool appear();
  // Sends the Event signal. Returns a negative errno when it cannot: -ENOTCONN while the server
  // is not on the bus.
  int emit(const char* name, const MessageValue& payload);
  // Answers call, logging in journal, once the server is on the bus (present) or off it. This
  // overrides the scenario's delayed appearance. Throws std::runtime_error.
  void setPresent(bool present, MessagePtr call, const Logger& journal);
  // Drops the calls still waiting for a presence, unanswered, while their connection is open.
  void dropWaiters() { waiters_.clear(); }

 private:
  enum class State { kAbsent, kAcquiring, kPresent, kReleasing };
  struct Waiter {
    MessagePtr call;
    bool present;
    const Logger* journal;
  };

  static int onPerformCommand(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static int onSubscribe(sd_bus_message* call, void* userdata, sd_bus_error* error);
  static const sd_bus_vtable kVtable[];

  void start();
  void stop();
  // Answers the waiters the present state satisfies, then moves towards the next one's wish.
  void settle();

  Server scenario_;
  const DeviceObject& device_;
  const Services& services_;
  Endpoint endpoint_;
  State state_ = State::kAbsent;
  Scheduler::Work* appearTimer_ = nullptr;
  std::deque<Waiter> waiters_;
};

}  // namespace halvex::sim
