// SPDX-License-Identifier: MIT
// Work for later on the daemon's sd_event loop: a timer, a task for the next loop iteration, or a
// request kept unanswered. Work may belong to an endpoint and is then dropped with that
// endpoint's connection. Everything runs on the loop's thread; work runs at most once, and is
// off the list by the time it runs, so it may add or drop other work.
#pragma once

#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <string>

#include "sim/BusHandles.h"

namespace halvex::sim {

class Endpoint;

class Scheduler {
 public:
  struct Work;
  // Told of work that threw: owner is the endpoint it belonged to, or null.
  using Failed = std::function<void(const Endpoint* owner, const std::string& message)>;

  Scheduler(sd_event* event, Failed failed);
  ~Scheduler();
  Scheduler(const Scheduler&) = delete;
  Scheduler& operator=(const Scheduler&) = delete;

  // Runs fire after delayMs, or on the next loop iteration for 0, keeping call until then.
  // Throws std::runtime_error when the loop cannot take it.
  Work* after(const Endpoint* owner, std::uint32_t delayMs, std::function<void()> fire,
              MessagePtr call = nullptr);
  // Keeps call unanswered until owner's work is dropped.
  void hold(const Endpoint* owner, MessagePtr call);
  void cancel(Work* work);
  void drop(const Endpoint* owner);
  void clear();

 private:
  static int onTimer(sd_event_source* source, std::uint64_t usec, void* userdata);
  static int onDefer(sd_event_source* source, void* userdata);

  sd_event* event_;
  Failed failed_;
  std::list<std::unique_ptr<Work>> work_;
};

}  // namespace halvex::sim
