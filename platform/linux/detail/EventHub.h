// SPDX-License-Identifier: MIT
// One manager's event handlers and whether delivery is on, shared with the closures queued for
// delivery so that each can tell, when it finally runs on the manager's queue, whether its event
// still counts. Any thread.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <map>
#include <string>

#include "detail/Private.h"
#include "platform/Mutex.h"
#include "platform/ServerClient.h"

namespace halvex::client {

class EventHub {
 public:
  // Events posted to the queue but not yet run; a flood beyond that is dropped.
  static constexpr std::size_t kMaxUndelivered = 1024;

  // Nonzero while events are on; changes with every off(), so an event stamped with the token
  // current when it was received is dropped if delivery was switched off since.
  std::uint64_t token() const;
  void on();
  void off();

  void setHandler(const std::string& event, EventHandler handler) EXCLUDES(mutex_);
  // Off for good; the handlers go on this thread.
  void close() EXCLUDES(mutex_);

  // Counts an event about to be queued; false, counting nothing, when too many are queued.
  bool reserve();
  // Runs on the manager's queue, for an event reserve() counted.
  void deliver(std::uint64_t token, const std::string& event, MessageValue payload)
      EXCLUDES(mutex_);

 private:
  void release() { undelivered_.fetch_sub(1); }

  std::atomic<std::uint64_t> state_{0};  // generation * 2 + (on ? 1 : 0)
  std::atomic<std::size_t> undelivered_{0};
  Mutex mutex_;
  std::map<std::string, EventHandler> handlers_ GUARDED_BY(mutex_);
  bool closed_ GUARDED_BY(mutex_) = false;
};

}  // namespace halvex::client
