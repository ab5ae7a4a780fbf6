// SPDX-License-Identifier: MIT
// Deferred work as sd_event sources: a defer source for "next iteration", a monotonic timer
// otherwise, none for a request that is only kept.
#include "sim/Scheduler.h"

#include <ctime>
#include <system_error>
#include <utility>

namespace halvex::sim {

struct Scheduler::Work {
  Scheduler* scheduler;
  const Endpoint* owner;
  MessagePtr call;
  SourcePtr source;
  std::function<void()> fire;
};

Scheduler::Scheduler(sd_event* event, Failed failed) : event_(event), failed_(std::move(failed)) {}

Scheduler::~Scheduler() = default;

Scheduler::Work* Scheduler::after(const Endpoint* owner, std::uint32_t delayMs,
                                  std::function<void()> fire, MessagePtr call) {
  auto item = std::make_unique<Work>(Work{this, owner, std::move(call), {}, std::move(fire)});
  Work* raw = item.get();
  sd_event_source* source = nullptr;
  int r = 0;
  if (raw->fire && delayMs == 0) {
    r = sd_event_add_defer(event_, &source, &Scheduler::onDefer, raw);
  } else if (raw->fire) {
    std::uint64_t now = 0;
    sd_event_now(event_, CLOCK_MONOTONIC, &now);
    r = sd_event_add_time(event_, &source, CLOCK_MONOTONIC, now + std::uint64_t{delayMs} * 1000U,
                          1000U, &Scheduler::onTimer, raw);
  }
  if (r < 0) {
    throw std::system_error(-r, std::generic_category(), "cannot schedule");
  }
  raw->source.reset(source);
  work_.push_back(std::move(item));
  return raw;
}

void Scheduler::hold(const Endpoint* owner, MessagePtr call) {
  after(owner, 0, nullptr, std::move(call));
}

void Scheduler::cancel(Work* work) {
  work_.remove_if([work](const std::unique_ptr<Work>& w) { return w.get() == work; });
}

void Scheduler::drop(const Endpoint* owner) {
  work_.remove_if([owner](const std::unique_ptr<Work>& w) { return w->owner == owner; });
}

void Scheduler::clear() {
  work_.clear();
}

int Scheduler::onTimer(sd_event_source* source, std::uint64_t, void* userdata) {
  return onDefer(source, userdata);
}

int Scheduler::onDefer(sd_event_source*, void* userdata) {
  auto* item = static_cast<Work*>(userdata);
  Scheduler* scheduler = item->scheduler;
  std::unique_ptr<Work> owned;
  for (auto it = scheduler->work_.begin(); it != scheduler->work_.end(); ++it) {
    if (it->get() == item) {
      owned = std::move(*it);
      scheduler->work_.erase(it);
      break;
    }
  }
  try {
    if (owned) {
      owned->fire();
    }
  } catch (const std::exception& e) {
    scheduler->failed_(item->owner, e.what());
  }
  return 0;
}

}  // namespace halvex::sim
