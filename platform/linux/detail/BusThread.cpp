// SPDX-License-Identifier: MIT
#include "platform/linux/detail/BusThread.h"

#include <pthread.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <utility>
#include <vector>

namespace halvex::bus {

BusThread::BusThread(std::string name, Hooks hooks)
    : name_(std::move(name)), hooks_(std::move(hooks)) {}

BusThread::~BusThread() {
  if (thread_.joinable()) {
    stop();
  }
  sd_event_source_unref(timer_);
  sd_event_source_unref(wakeSource_);
  sd_event_unref(event_);
  if (wakeFd_ >= 0) {
    close(wakeFd_);
  }
}

bool BusThread::start(std::shared_ptr<void> owner) {
  wakeFd_ = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
  if (wakeFd_ < 0 || sd_event_new(&event_) < 0 ||
      sd_event_add_io(event_, &wakeSource_, wakeFd_, EPOLLIN, &BusThread::onWake, this) < 0) {
    return false;
  }
  {
    std::lock_guard lock(mutex_);
    accepting_ = true;
  }
  thread_ = std::thread([this, owner = std::move(owner)]() mutable { run(std::move(owner)); });
  return true;
}

void BusThread::run(std::shared_ptr<void> owner) {
  threadId_.store(std::this_thread::get_id());
  pthread_setname_np(pthread_self(), name_.substr(0, 15).c_str());
  int r = sd_event_loop(event_);
  // Normally the loop ends through the closure stop() queues. If it failed instead, refuse new
  // work and finish what was queued, so that every pending completion still runs.
  {
    std::lock_guard lock(mutex_);
    accepting_ = false;
  }
  stopping_ = true;
  dropConnection(r < 0 ? "event loop failed" : "client closed");
  drainInbox();
  // The owner may go with this reference; it must not outlive the loop's last use of this.
  owner.reset();
}

bool BusThread::post(Task task) {
  bool wake = false;
  {
    std::lock_guard lock(mutex_);
    if (!accepting_) {
      return false;
    }
    wake = inbox_.empty();
    inbox_.push_back(std::move(task));
  }
  if (wake) {
    std::uint64_t one = 1;
    // Cannot fail short of a full counter, which a drained inbox never leaves behind.
    [[maybe_unused]] ssize_t written = write(wakeFd_, &one, sizeof one);
  }
  return true;
}

void BusThread::stop() {
  bool wake = false;
  {
    std::lock_guard lock(mutex_);
    if (accepting_) {
      accepting_ = false;
      wake = inbox_.empty();
      inbox_.push_back([this] {
        stopping_ = true;
        timerTask_ = nullptr;
        if (timer_ != nullptr) {
          sd_event_source_set_enabled(timer_, SD_EVENT_OFF);
        }
        dropConnection("client closed");
        sd_event_exit(event_, 0);
      });
    }
  }
  if (wake) {
    std::uint64_t one = 1;
    [[maybe_unused]] ssize_t written = write(wakeFd_, &one, sizeof one);
  }
  if (!thread_.joinable()) {
    return;
  }
  if (isCurrent()) {
    thread_.detach();
  } else {
    thread_.join();
  }
}

bool BusThread::isCurrent() const {
  return threadId_.load() == std::this_thread::get_id();
}

int BusThread::onWake(sd_event_source*, int fd, std::uint32_t, void* userdata) {
  std::uint64_t count = 0;
  [[maybe_unused]] ssize_t got = read(fd, &count, sizeof count);
  static_cast<BusThread*>(userdata)->drainInbox();
  return 0;
}

void BusThread::drainInbox() {
  std::deque<Task> batch;
  {
    std::lock_guard lock(mutex_);
    batch.swap(inbox_);
  }
  for (Task& task : batch) {
    task();
  }
}

sd_bus* BusThread::connection(bool* opened) {
  if (opened != nullptr) {
    *opened = false;
  }
  if (stopping_) {
    lastOpenFailure_ = makeResult(kResultConnectionLost, "client closed");
    return nullptr;
  }
  if (bus_ != nullptr && sd_bus_is_open(bus_) > 0) {
    return bus_;
  }
  if (bus_ != nullptr) {
    dropConnection("connection lost");
  }
  sd_bus* bus = nullptr;
  int r = sd_bus_open_system(&bus);
  if (r < 0) {
    lastOpenFailure_ = resultFromOpenFailure(r);
    return nullptr;
  }
  r = sd_bus_attach_event(bus, event_, SD_EVENT_PRIORITY_NORMAL);
  if (r >= 0) {
    r = sd_bus_add_filter(bus, nullptr, &BusThread::onFilter, this);
  }
  if (r < 0) {
    sd_bus_detach_event(bus);
    sd_bus_close_unref(bus);
    lastOpenFailure_ = resultFromFailure(nullptr, nullptr, r);
    return nullptr;
  }
  bus_ = bus;
  ++epoch_;
  if (opened != nullptr) {
    *opened = true;
  }
  if (hooks_.connected) {
    hooks_.connected(bus_);
  }
  return bus_;
}

void BusThread::dropConnection(const char* why) {
  // sd_bus_close() forgets pending calls without running their callbacks, so they are collected
  // first and completed here, after the connection is gone, in the order they were sent.
  std::vector<std::unique_ptr<Pending>> orphans;
  orphans.reserve(pending_.size());
  for (auto& [id, pending] : pending_) {
    sd_bus_slot_unref(pending->slot);
    pending->slot = nullptr;
    orphans.push_back(std::move(pending));
  }
  pending_.clear();
  if (bus_ != nullptr) {
    sd_bus_detach_event(bus_);
    // No flush: it could block on a peer that stopped reading, and nothing queued matters now.
    sd_bus_close_unref(bus_);
    bus_ = nullptr;
  }
  for (auto& orphan : orphans) {
    orphan->done(makeResult(kResultConnectionLost, why), nullptr);
  }
}

void BusThread::callAsync(const char* destination, const char* path, const char* interface,
                          const char* member, const MessageBuilder& build, ReplyHandler done) {
  sd_bus* bus = connection();
  if (bus == nullptr) {
    done(lastOpenFailure_, nullptr);
    return;
  }
  sd_bus_message* raw = nullptr;
  int r = sd_bus_message_new_method_call(bus, &raw, destination, path, interface, member);
  if (r < 0) {
    done(resultFromFailure(bus, nullptr, r), nullptr);
    return;
  }
  MessagePtr call(raw);
  r = sd_bus_message_set_auto_start(call.get(), 0);
  if (r < 0) {
    done(resultFromFailure(bus, nullptr, r), nullptr);
    return;
  }
  r = build ? build(call.get()) : 0;
  if (r < 0) {
    done(makeResult(kResultInvalidRequest,
                    std::string("request cannot be encoded: ") + std::strerror(-r)),
         nullptr);
    return;
  }
  auto pending = std::make_unique<Pending>();
  pending->owner = this;
  pending->id = ++nextCallId_;
  pending->deadline = callDeadline(bus);
  r = sd_bus_call_async(bus, &pending->slot, call.get(), &BusThread::onReply, pending.get(), 0);
  if (r < 0) {
    done(resultFromFailure(bus, nullptr, r), nullptr);
    return;
  }
  pending->done = std::move(done);
  std::uint64_t id = pending->id;
  pending_.emplace(id, std::move(pending));
}

void BusThread::runAfter(std::chrono::microseconds delay, Task task) {
  if (stopping_) {
    return;
  }
  auto usec = static_cast<std::uint64_t>(delay.count());
  int r = 0;
  if (timer_ == nullptr) {
    r = sd_event_add_time_relative(event_, &timer_, CLOCK_MONOTONIC, usec, 0, &BusThread::onTimer,
                                   this);
  } else {
    r = sd_event_source_set_time_relative(timer_, usec);
    if (r >= 0) {
      r = sd_event_source_set_enabled(timer_, SD_EVENT_ONESHOT);
    }
  }
  if (r >= 0) {
    timerTask_ = std::move(task);
  }
}

int BusThread::onTimer(sd_event_source*, std::uint64_t, void* userdata) {
  auto* self = static_cast<BusThread*>(userdata);
  Task task = std::move(self->timerTask_);
  self->timerTask_ = nullptr;
  if (task) {
    task();
  }
  return 0;
}

int BusThread::onReply(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  auto* target = static_cast<Pending*>(userdata);
  BusThread* self = target->owner;
  auto node = self->pending_.extract(target->id);
  if (node.empty()) {
    return 0;
  }
  std::unique_ptr<Pending> pending = std::move(node.mapped());
  // sd-bus holds its own reference to the slot while this callback runs.
  sd_bus_slot_unref(pending->slot);
  pending->slot = nullptr;
  if (sd_bus_message_is_method_error(reply, nullptr) > 0) {
    pending->done(
        resultFromFailure(sd_bus_message_get_bus(reply), sd_bus_message_get_error(reply),
                          -sd_bus_message_get_errno(reply), monotonicUsec() >= pending->deadline),
        nullptr);
  } else {
    pending->done(Result{}, reply);
  }
  return 0;
}

int BusThread::onFilter(sd_bus_message* message, void* userdata, sd_bus_error*) {
  auto* self = static_cast<BusThread*>(userdata);
  if (sd_bus_message_is_signal(message, "org.freedesktop.DBus.Local", "Disconnected") > 0 &&
      self->hooks_.disconnected) {
    self->hooks_.disconnected();
  }
  return 0;
}

}  // namespace halvex::bus
