// SPDX-License-Identifier: MIT
#include "detail/EventHub.h"

#include <utility>

namespace halvex::client {

std::uint64_t EventHub::token() const {
  std::uint64_t state = state_.load();
  return (state & 1) != 0 ? state : 0;
}

void EventHub::on() {
  std::uint64_t state = state_.load();
  while (!state_.compare_exchange_weak(state, state | 1)) {
  }
}

void EventHub::off() {
  std::uint64_t state = state_.load();
  while (!state_.compare_exchange_weak(state, ((state >> 1) + 1) << 1)) {
  }
}

void EventHub::setHandler(const std::string& event, EventHandler handler) {
  // The handler replaced goes after the lock: destroying it may run anything.
  EventHandler previous;
  MutexLock lock(mutex_);
  if (closed_) {
    return;
  }
  previous = std::exchange(handlers_[event], std::move(handler));
}

void EventHub::close() {
  off();
  std::map<std::string, EventHandler> handlers;
  MutexLock lock(mutex_);
  closed_ = true;
  handlers.swap(handlers_);
}

bool EventHub::reserve() {
  if (undelivered_.fetch_add(1) < kMaxUndelivered) {
    return true;
  }
  release();
  return false;
}

void EventHub::deliver(std::uint64_t token, const std::string& event, MessageValue payload) {
  release();
  if (token == 0 || state_.load() != token) {
    return;
  }
  EventHandler handler;
  {
    MutexLock lock(mutex_);
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

}  // namespace halvex::client
