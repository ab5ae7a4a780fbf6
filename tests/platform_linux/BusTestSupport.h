// SPDX-License-Identifier: MIT
// Waiting helpers for the backend tests: everything the backend delivers arrives on other
// threads, so tests collect it here and wait with a failsafe time-out.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <future>
#include <mutex>
#include <string>
#include <vector>

#include "platform/MessageDict.h"
#include "platform/Result.h"
#include "platform/WorkQueue.h"

namespace halvex::test {

inline constexpr std::chrono::seconds kFailsafe{15};

// One delivery: a completion (name is the tag the test gave it) or an event (name is the event).
struct Delivery {
  std::string name;
  Result result;
  MessageValue value;
  bool onQueue = false;
};

class Mailbox {
 public:
  void add(Delivery delivery) {
    {
      std::lock_guard lock(mutex_);
      items_.push_back(std::move(delivery));
    }
    changed_.notify_all();
  }

  // True once at least count deliveries named name (any, when empty) have arrived.
  bool waitFor(std::size_t count, const std::string& name = {}) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, kFailsafe, [&] { return countLocked(name) >= count; });
  }

  std::size_t count(const std::string& name = {}) {
    std::lock_guard lock(mutex_);
    return countLocked(name);
  }

  std::vector<Delivery> all(const std::string& name = {}) {
    std::lock_guard lock(mutex_);
    std::vector<Delivery> out;
    for (const Delivery& item : items_) {
      if (name.empty() || item.name == name) {
        out.push_back(item);
      }
    }
    return out;
  }

 private:
  std::size_t countLocked(const std::string& name) const {
    std::size_t n = 0;
    for (const Delivery& item : items_) {
      if (name.empty() || item.name == name) {
        ++n;
      }
    }
    return n;
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Delivery> items_;
};

// True once everything posted to queue before the call has run.
inline bool drain(const WorkQueue& queue) {
  auto done = std::make_shared<std::promise<void>>();
  auto future = done->get_future();
  queue.post([done] { done->set_value(); });
  return future.wait_for(kFailsafe) == std::future_status::ready;
}

}  // namespace halvex::test
