// SPDX-License-Identifier: MIT
// The sd-event loop that serves the connection while one runs: its life, its wake-ups, the
// expiry of calls past their deadline, and timers.
#include <sys/epoll.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "detail/ProcessBus.h"

namespace halvex::bus {

namespace {

// Expiry runs this close to a call's deadline; nothing here needs it sharper.
constexpr std::uint64_t kExpiryAccuracyUsec = 1000;

}  // namespace

int ProcessBus::run(const std::function<void()>& claimed) {
  if (handOver_.wakeFdError() != 0) {
    return -handOver_.wakeFdError();
  }
  if (!handOver_.claim()) {
    return -EBUSY;
  }
  int r = setUpLoop();
  if (r < 0) {
    tearDownLoop();
    handOver_.release();
    return r;
  }
  handOver_.open();
  if (claimed) {
    claimed();
  }
  // sd_event_loop() by hand, so that the I/O context is let go of for the wait alone: while the
  // loop sleeps in epoll, a caller may borrow the connection to send.
  while (r >= 0 && sd_event_get_state(event_) != SD_EVENT_FINISHED) {
    r = sd_event_prepare(event_);
    if (r == 0) {
      r = handOver_.sleep([this] { return sd_event_wait(event_, UINT64_MAX); });
    }
    if (r > 0) {
      r = sd_event_dispatch(event_);
    }
  }
  // Whatever the loop took on completes before the connection goes back to direct use.
  handOver_.close();
  closing_ = true;
  dropConnection(r < 0 ? "run loop failed" : "run loop stopped");
  handOver_.drain();
  closing_ = false;
  tearDownLoop();
  handOver_.release();
  return r < 0 ? r : 0;
}

int ProcessBus::setUpLoop() {
  int r = sd_event_new(&event_);
  if (r < 0) {
    event_ = nullptr;
    return r;
  }
  busWatch_ = epoll_create1(EPOLL_CLOEXEC);
  if (busWatch_ < 0) {
    return -errno;
  }
  r = sd_event_add_io(event_, &wakeSource_, handOver_.wakeFd(), EPOLLIN, &ProcessBus::onWake, this);
  if (r >= 0) {
    r = sd_event_add_io(event_, &busSource_, busWatch_, EPOLLIN, &ProcessBus::onBusReady, this);
  }
  if (r >= 0) {
    r = sd_event_source_set_prepare(busSource_, &ProcessBus::onBusPrepare);
  }
  if (r >= 0) {
    r = sd_event_add_time(event_, &busTimer_, CLOCK_MONOTONIC, 0, 0, &ProcessBus::onBusTimer, this);
  }
  if (r >= 0) {
    r = sd_event_source_set_enabled(busTimer_, SD_EVENT_OFF);
  }
  if (r >= 0 && bus_ != nullptr) {
    attachBus();
  }
  return r;
}

void ProcessBus::tearDownLoop() {
  wakeSource_ = sd_event_source_disable_unref(wakeSource_);
  busSource_ = sd_event_source_disable_unref(busSource_);
  busTimer_ = sd_event_source_disable_unref(busTimer_);
  expirySource_ = sd_event_source_disable_unref(expirySource_);
  if (busWatch_ >= 0) {
    close(busWatch_);
    busWatch_ = -1;
  }
  busEvents_ = 0;
  armedDeadline_ = 0;
  rearmWanted_ = false;
  event_ = sd_event_unref(event_);
}

void ProcessBus::attachBus() {
  if (busWatch_ < 0) {
    return;
  }
  epoll_event watched{};
  watched.events = busEvents_ = EPOLLIN;
  epoll_ctl(busWatch_, EPOLL_CTL_ADD, sd_bus_get_fd(bus_), &watched);
}

void ProcessBus::detachBus() {
  if (busWatch_ >= 0) {
    epoll_ctl(busWatch_, EPOLL_CTL_DEL, sd_bus_get_fd(bus_), nullptr);
  }
}

// What sd_bus_attach_event() would do before each wait, with busWatch_ standing in for the
// connection's descriptor (sd_bus_get_fd(3) describes this way of hooking a connection up).
int ProcessBus::onBusPrepare(sd_event_source*, void* userdata) {
  auto* self = static_cast<ProcessBus*>(userdata);
  if (self->bus_ == nullptr) {
    return sd_event_source_set_enabled(self->busTimer_, SD_EVENT_OFF);
  }
  const int events = sd_bus_get_events(self->bus_);
  std::uint64_t until = UINT64_MAX;
  if (events < 0 || sd_bus_get_timeout(self->bus_, &until) < 0) {
    // Broken: the next dispatch finds out and drops it.
    until = 0;
  } else if (static_cast<std::uint32_t>(events) != self->busEvents_) {
    epoll_event watched{};
    watched.events = self->busEvents_ = static_cast<std::uint32_t>(events);
    epoll_ctl(self->busWatch_, EPOLL_CTL_MOD, sd_bus_get_fd(self->bus_), &watched);
  }
  if (until == UINT64_MAX) {
    return sd_event_source_set_enabled(self->busTimer_, SD_EVENT_OFF);
  }
  int r = sd_event_source_set_time(self->busTimer_, until);
  return r < 0 ? r : sd_event_source_set_enabled(self->busTimer_, SD_EVENT_ONESHOT);
}

int ProcessBus::onBusReady(sd_event_source*, int, std::uint32_t, void* userdata) {
  static_cast<ProcessBus*>(userdata)->dispatchBus();
  return 0;
}

int ProcessBus::onBusTimer(sd_event_source*, std::uint64_t, void* userdata) {
  static_cast<ProcessBus*>(userdata)->dispatchBus();
  return 0;
}

void ProcessBus::stop() {
  Task exit = [this] { sd_event_exit(event_, 0); };
  handOver_.enqueue(exit);
}

int ProcessBus::onWake(sd_event_source*, int, std::uint32_t, void* userdata) {
  auto* self = static_cast<ProcessBus*>(userdata);
  self->handOver_.drain();
  if (self->rearmWanted_) {
    self->rearmWanted_ = false;
    self->armExpiry(self->pending_.earliestDeadline());
  }
  return 0;
}

void ProcessBus::armExpiry(std::uint64_t deadline) {
  // The timer is only ever moved earlier here; when it fires it finds the next deadline itself,
  // so a steady stream of calls that answer in time re-arms nothing. With no loop, whoever
  // serves the connection directly expires calls itself.
  if (event_ == nullptr || deadline == UINT64_MAX ||
      (armedDeadline_ != 0 && armedDeadline_ <= deadline)) {
    return;
  }
  if (HandOver::borrowing()) {
    rearmWanted_ = true;
    return;
  }
  int r = 0;
  if (expirySource_ == nullptr) {
    r = sd_event_add_time(event_, &expirySource_, CLOCK_MONOTONIC, deadline, kExpiryAccuracyUsec,
                          &ProcessBus::onExpiry, this);
  } else {
    r = sd_event_source_set_time(expirySource_, deadline);
    if (r >= 0) {
      r = sd_event_source_set_enabled(expirySource_, SD_EVENT_ONESHOT);
    }
  }
  if (r >= 0) {
    armedDeadline_ = deadline;
  }
}

int ProcessBus::onExpiry(sd_event_source*, std::uint64_t, void* userdata) {
  auto* self = static_cast<ProcessBus*>(userdata);
  self->armedDeadline_ = 0;
  self->pending_.expire();
  self->armExpiry(self->pending_.earliestDeadline());
  return 0;
}

ProcessBus::Timer ProcessBus::runAfter(std::chrono::microseconds delay, Task task) {
  if (event_ == nullptr || closing_) {
    return nullptr;
  }
  auto* owned = new Task(std::move(task));
  sd_event_source* source = nullptr;
  int r = sd_event_add_time_relative(event_, &source, CLOCK_MONOTONIC,
                                     static_cast<std::uint64_t>(delay.count()), 0,
                                     &ProcessBus::onTimer, owned);
  if (r < 0) {
    delete owned;
    return nullptr;
  }
  sd_event_source_set_destroy_callback(source,
                                       [](void* userdata) { delete static_cast<Task*>(userdata); });
  return Timer(source);
}

int ProcessBus::onTimer(sd_event_source*, std::uint64_t, void* userdata) {
  (*static_cast<Task*>(userdata))();
  return 0;
}

}  // namespace halvex::bus
