// SPDX-License-Identifier: MIT
#include "platform/linux/detail/ProcessBus.h"

#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <utility>

#include "platform/SystemLog.h"

namespace halvex::bus {

namespace {

// Expiry runs this close to a call's deadline; nothing here needs it sharper.
constexpr std::uint64_t kExpiryAccuracyUsec = 1000;

// True on the thread that is the I/O context right now: the loop's, or a direct user's while it
// holds the bus's lock. Work it posts runs at once, and it must not wait for itself.
thread_local bool tIoContext = false;
// True while a caller borrows the connection from a sleeping loop: sd-bus is ours, sd-event not.
thread_local bool tBorrowed = false;
// Set by a borrower's call that found the connection broken: the loop must send it instead.
thread_local bool tBorrowAbandoned = false;

class IoScope {
 public:
  IoScope() { tIoContext = true; }
  ~IoScope() { tIoContext = false; }
  IoScope(const IoScope&) = delete;
  IoScope& operator=(const IoScope&) = delete;
};

std::string describeOutcome(const std::string& label, const Result& result, std::uint64_t usec) {
  char numbers[64];
  std::snprintf(numbers, sizeof numbers, ": code 0x%08" PRIX32 " in %" PRIu64 ".%03" PRIu64 " ms",
                static_cast<std::uint32_t>(result.code), usec / 1000, usec % 1000);
  std::string text = label + numbers;
  if (!result.message.empty()) {
    text += ": ";
    text += result.message;
  }
  return text;
}

}  // namespace

struct ProcessBus::Pending {
  ProcessBus* bus = nullptr;
  std::uint64_t id = 0;
  std::uint64_t started = 0;
  std::uint64_t deadline = 0;
  sd_bus_slot* slot = nullptr;
  const void* owner = nullptr;
  const char* category = nullptr;
  std::string label;
  ReplyHandler done;
};

ProcessBus& ProcessBus::instance() {
  static ProcessBus* const bus = new ProcessBus;
  return *bus;
}

ProcessBus::ProcessBus() : log_(LogServer::create()) {
  wakeFd_ = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
  setUpEvent();
}

void ProcessBus::setUpEvent() {
  // Without a loop the bus still works directly; run() then reports the failure.
  if (sd_event_new(&event_) < 0) {
    event_ = nullptr;
    return;
  }
  if (wakeFd_ < 0 ||
      sd_event_add_io(event_, &wakeSource_, wakeFd_, EPOLLIN, &ProcessBus::onWake, this) < 0 ||
      sd_event_add_defer(event_, &dropSource_, &ProcessBus::onDeferredDrop, this) < 0 ||
      sd_event_source_set_enabled(dropSource_, SD_EVENT_OFF) < 0) {
    tearDownEvent();
  }
}

void ProcessBus::tearDownEvent() {
  wakeSource_ = sd_event_source_disable_unref(wakeSource_);
  dropSource_ = sd_event_source_disable_unref(dropSource_);
  expirySource_ = sd_event_source_disable_unref(expirySource_);
  armedDeadline_ = 0;
  event_ = sd_event_unref(event_);
}

int ProcessBus::run(const std::function<void()>& claimed) {
  {
    std::lock_guard io(ioMutex_);
    if (event_ == nullptr || wakeSource_ == nullptr) {
      return -ENOMEM;
    }
    if (claimed_) {
      return -EBUSY;
    }
    claimed_ = true;
    std::lock_guard inbox(inboxMutex_);
    inboxOpen_ = true;
  }
  if (claimed) {
    claimed();
  }
  // sd_event_loop() by hand, so that the lock is held for everything but the wait itself: while
  // the loop sleeps in epoll, a caller may borrow the connection to send (see borrow()).
  std::unique_lock io(ioMutex_);
  IoScope scope;
  int r = 0;
  while (r >= 0 && sd_event_get_state(event_) != SD_EVENT_FINISHED) {
    r = sd_event_prepare(event_);
    if (r == 0) {
      io.unlock();
      r = sd_event_wait(event_, UINT64_MAX);
      io.lock();
    }
    if (r > 0) {
      r = sd_event_dispatch(event_);
    }
  }
  // Hand the bus back. Direct users wait on the lock until every queued closure and pending call
  // has finished, so that nothing sent through the loop is left without its completion.
  {
    std::lock_guard inbox(inboxMutex_);
    inboxOpen_ = false;
  }
  closing_ = true;
  dropConnection(r < 0 ? "run loop failed" : "run loop stopped");
  drainInbox();
  closing_ = false;
  // A loop that has exited cannot run again; a later run() gets a fresh one.
  tearDownEvent();
  setUpEvent();
  claimed_ = false;
  return r < 0 ? r : 0;
}

void ProcessBus::stop() {
  bool wasEmpty = false;
  {
    std::lock_guard lock(inboxMutex_);
    if (!inboxOpen_) {
      return;
    }
    wasEmpty = inbox_.empty();
    inbox_.push_back([this] { sd_event_exit(event_, 0); });
  }
  if (wasEmpty) {
    wake();
  }
}

bool ProcessBus::enqueue(Task& task) {
  bool wasEmpty = false;
  {
    std::lock_guard lock(inboxMutex_);
    if (!inboxOpen_) {
      return false;
    }
    wasEmpty = inbox_.empty();
    inbox_.push_back(std::move(task));
  }
  // One wake-up per batch: the loop drains the whole inbox when it wakes.
  if (wasEmpty) {
    wake();
  }
  return true;
}

void ProcessBus::post(Task task) {
  if (tIoContext) {
    task();
    return;
  }
  for (;;) {
    if (enqueue(task)) {
      return;
    }
    std::lock_guard io(ioMutex_);
    // A loop may have claimed the bus between the two looks; then it takes the work.
    if (!claimed_) {
      IoScope scope;
      task();
      return;
    }
  }
}

bool ProcessBus::borrow(const Task& send) {
  bool wakeLoop = false;
  {
    std::lock_guard io(ioMutex_);
    // Only a call on an open connection: anything that would touch the loop itself (a new
    // connection to attach, a timer to move) is the loop's own work.
    if (!claimed_ || closing_ || bus_ == nullptr || sd_bus_is_ready(bus_) <= 0) {
      return false;
    }
    IoScope scope;
    tBorrowed = true;
    send();
    tBorrowed = false;
    if (std::exchange(tBorrowAbandoned, false)) {
      return false;
    }
    // The loop sleeps with the events it computed before: a message left queued needs it to
    // wait for POLLOUT, and an earlier deadline needs its timer moved. (A borrower never drops
    // the connection: bus_ is still the one checked above.)
    wakeLoop = rearmWanted_ || (sd_bus_get_events(bus_) & POLLOUT) != 0;
  }
  if (wakeLoop) {
    wake();
  }
  return true;
}

void ProcessBus::send(Task task) {
  if (!borrow(task)) {
    post(std::move(task));
  }
}

Result ProcessBus::call(const CallPlan& plan, const MessageBuilder& build, const Decoder& decode) {
  if (tIoContext) {
    return makeResult(kResultBusError, "synchronous call from the bus's own context");
  }
  struct Outcome {
    std::atomic<bool> done{false};
    Result result;
  };
  // Shared with the completion: the waiter may wake and return before notify_one() has.
  auto outcome = std::make_shared<Outcome>();
  Task send = [this, &plan, &build, &decode, outcome] {
    callAsync(plan, build, [&decode, outcome](const Result& failure, sd_bus_message* reply) {
      outcome->result = reply != nullptr ? decode(reply) : failure;
      outcome->done.store(true, std::memory_order_release);
      outcome->done.notify_one();
      return outcome->result;
    });
  };
  for (;;) {
    if (borrow(send) || enqueue(send)) {
      outcome->done.wait(false, std::memory_order_acquire);
      return outcome->result;
    }
    std::lock_guard io(ioMutex_);
    if (!claimed_) {
      IoScope scope;
      send();
      pumpUntil(outcome->done);
      return outcome->result;
    }
  }
}

void ProcessBus::pumpUntil(const std::atomic<bool>& done) {
  while (!done.load(std::memory_order_relaxed)) {
    if (bus_ == nullptr) {
      // Only a call that already completed can leave us here; stay safe regardless.
      return;
    }
    int r = sd_bus_process(bus_, nullptr);
    if (r > 0) {
      continue;
    }
    if (r < 0 || sd_bus_is_open(bus_) <= 0) {
      dropConnection("connection lost");
      continue;
    }
    const std::uint64_t now = monotonicUsec();
    expireDue(now);
    const std::uint64_t next = earliestDeadline();
    if (done.load(std::memory_order_relaxed) || bus_ == nullptr) {
      continue;
    }
    r = sd_bus_wait(bus_, next == UINT64_MAX ? UINT64_MAX : (next > now ? next - now : 0));
    if (r < 0 && r != -EINTR) {
      dropConnection("connection lost");
    }
  }
}

void ProcessBus::wake() {
  std::uint64_t one = 1;
  // Cannot fail short of a full counter, which a drained inbox never leaves behind.
  [[maybe_unused]] ssize_t written = write(wakeFd_, &one, sizeof one);
}

int ProcessBus::onWake(sd_event_source*, int fd, std::uint32_t, void* userdata) {
  std::uint64_t count = 0;
  [[maybe_unused]] ssize_t got = read(fd, &count, sizeof count);
  auto* self = static_cast<ProcessBus*>(userdata);
  self->drainInbox();
  if (self->rearmWanted_) {
    self->rearmWanted_ = false;
    self->armExpiry(self->earliestDeadline());
  }
  return 0;
}

void ProcessBus::drainInbox() {
  std::deque<Task> batch;
  {
    std::lock_guard lock(inboxMutex_);
    batch.swap(inbox_);
  }
  for (Task& task : batch) {
    task();
    // Released at once, not with the batch: what a task holds may have to go before the next
    // task runs (a manager's shutdown hands back its last reference this way).
    task = nullptr;
  }
}

sd_bus* ProcessBus::connection() {
  if (closing_) {
    lastOpenFailure_ = makeResult(kResultConnectionLost, "run loop stopped");
    return nullptr;
  }
  if (bus_ != nullptr) {
    const int open = sd_bus_is_open(bus_);
    if (open > 0) {
      return bus_;
    }
    dropConnection(open == -ECHILD ? "connection inherited across fork" : "connection lost");
  }
  sd_bus* bus = nullptr;
  int r = sd_bus_open_system(&bus);
  if (r < 0) {
    lastOpenFailure_ = resultFromOpenFailure(r);
    return nullptr;
  }
  if (event_ != nullptr) {
    r = sd_bus_attach_event(bus, event_, SD_EVENT_PRIORITY_NORMAL);
  }
  if (r >= 0) {
    r = sd_bus_add_filter(bus, nullptr, &ProcessBus::onFilter, this);
  }
  if (r < 0) {
    sd_bus_detach_event(bus);
    sd_bus_close_unref(bus);
    lastOpenFailure_ = resultFromErrno(nullptr, r);
    return nullptr;
  }
  bus_ = bus;
  ++epoch_;
  for (const auto& listener : liveListeners()) {
    listener->connected(bus_);
  }
  return bus_;
}

void ProcessBus::dropConnection(const char* why) {
  // sd_bus_close() forgets pending calls without running their callbacks, so they are collected
  // first and completed here, after the connection is gone, in the order they were sent.
  std::vector<std::unique_ptr<Pending>> orphans;
  orphans.reserve(pending_.size());
  for (auto& [id, pending] : pending_) {
    pending->slot = sd_bus_slot_unref(pending->slot);
    orphans.push_back(std::move(pending));
  }
  pending_.clear();
  const bool hadConnection = bus_ != nullptr;
  if (hadConnection) {
    sd_bus_detach_event(bus_);
    // No flush: it could block on a peer that stopped reading, and nothing queued matters now.
    bus_ = sd_bus_close_unref(bus_);
  }
  for (auto& orphan : orphans) {
    complete(std::move(orphan), makeResult(kResultConnectionLost, why), nullptr);
  }
  if (hadConnection) {
    for (const auto& listener : liveListeners()) {
      listener->disconnected();
    }
  }
}

void ProcessBus::callAsync(const CallPlan& plan, const MessageBuilder& build, ReplyHandler done,
                           const void* owner) {
  auto pending = std::make_unique<Pending>();
  pending->bus = this;
  pending->started = monotonicUsec();
  pending->deadline = pending->started + static_cast<std::uint64_t>(plan.timeout.count());
  pending->owner = owner;
  pending->category = plan.category;
  pending->label = plan.label;
  pending->done = std::move(done);

  // A connection can break without our noticing until we write to it. A request that fails to
  // go out for that reason reached no one, so it goes once more on a fresh connection, which
  // tells whether there is a bus at all. A borrower may not open connections: it leaves the
  // request to the loop.
  for (bool retried = false;; retried = true) {
    sd_bus* bus = connection();
    if (bus == nullptr) {
      complete(std::move(pending), lastOpenFailure_, nullptr);
      return;
    }
    sd_bus_message* raw = nullptr;
    int r = sd_bus_message_new_method_call(bus, &raw, plan.destination, plan.path, plan.interface,
                                           plan.member);
    if (r < 0) {
      complete(std::move(pending), resultFromErrno(bus, r), nullptr);
      return;
    }
    MessagePtr message(raw);
    r = sd_bus_message_set_auto_start(message.get(), 0);
    if (r < 0) {
      complete(std::move(pending), resultFromErrno(bus, r), nullptr);
      return;
    }
    r = build ? build(message.get()) : 0;
    if (r < 0) {
      complete(std::move(pending),
               makeResult(kResultInvalidRequest,
                          std::string("request cannot be encoded: ") + std::strerror(-r)),
               nullptr);
      return;
    }
    // No time-out of sd-bus's own (UINT64_MAX): the deadline above is the only one.
    r = sd_bus_call_async(bus, &pending->slot, message.get(), &ProcessBus::onReply, pending.get(),
                          UINT64_MAX);
    if (r >= 0) {
      break;
    }
    if (sd_bus_is_open(bus) > 0 || retried) {
      complete(std::move(pending), resultFromErrno(bus, r), nullptr);
      return;
    }
    if (tBorrowed) {
      tBorrowAbandoned = true;
      return;
    }
    dropConnection("connection lost");
  }
  pending->id = ++nextCallId_;
  armExpiry(pending->deadline);
  const std::uint64_t id = pending->id;
  pending_.emplace(id, std::move(pending));
}

void ProcessBus::cancel(const void* owner, const Result& why) {
  std::vector<std::unique_ptr<Pending>> cancelled;
  for (auto it = pending_.begin(); it != pending_.end();) {
    if (it->second->owner == owner) {
      it->second->slot = sd_bus_slot_unref(it->second->slot);
      cancelled.push_back(std::move(it->second));
      it = pending_.erase(it);
    } else {
      ++it;
    }
  }
  for (auto& pending : cancelled) {
    complete(std::move(pending), why, nullptr);
  }
}

void ProcessBus::complete(std::unique_ptr<Pending> pending, const Result& failure,
                          sd_bus_message* reply) {
  const Result outcome = pending->done(failure, reply);
  if (pending->category != nullptr) {
    const std::uint64_t took = monotonicUsec() - pending->started;
    log_->write(LogContext(kLogSubsystem, pending->category),
                outcome.ok() ? LogLevel::kDebug : LogLevel::kWarning,
                describeOutcome(pending->label, outcome, took));
  }
}

int ProcessBus::onReply(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  auto* target = static_cast<Pending*>(userdata);
  ProcessBus* self = target->bus;
  auto node = self->pending_.extract(target->id);
  if (node.empty()) {
    return 0;
  }
  std::unique_ptr<Pending> pending = std::move(node.mapped());
  // sd-bus holds its own reference to the slot while this callback runs.
  pending->slot = sd_bus_slot_unref(pending->slot);
  sd_bus* bus = sd_bus_message_get_bus(reply);
  if (sd_bus_message_is_method_error(reply, nullptr) > 0) {
    self->complete(std::move(pending), resultFromErrorReply(bus, reply), nullptr);
  } else {
    self->complete(std::move(pending), Result{}, reply);
  }
  return 0;
}

std::uint64_t ProcessBus::earliestDeadline() const {
  std::uint64_t earliest = UINT64_MAX;
  for (const auto& [id, pending] : pending_) {
    earliest = std::min(earliest, pending->deadline);
  }
  return earliest;
}

void ProcessBus::expireDue(std::uint64_t now) {
  std::vector<std::unique_ptr<Pending>> expired;
  for (auto it = pending_.begin(); it != pending_.end();) {
    if (it->second->deadline <= now) {
      it->second->slot = sd_bus_slot_unref(it->second->slot);
      expired.push_back(std::move(it->second));
      it = pending_.erase(it);
    } else {
      ++it;
    }
  }
  for (auto& pending : expired) {
    const auto limit = pending->deadline - pending->started;
    complete(std::move(pending),
             makeResult(kResultTimeout, "no answer within " + std::to_string(limit / 1000) + " ms"),
             nullptr);
  }
}

void ProcessBus::armExpiry(std::uint64_t deadline) {
  // The timer is only ever moved earlier here; when it fires it finds the next deadline itself,
  // so a steady stream of calls that answer in time re-arms nothing.
  if (event_ == nullptr || (armedDeadline_ != 0 && armedDeadline_ <= deadline)) {
    return;
  }
  if (tBorrowed) {
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
  self->expireDue(monotonicUsec());
  const std::uint64_t next = self->earliestDeadline();
  if (next != UINT64_MAX) {
    self->armExpiry(next);
  }
  return 0;
}

int ProcessBus::onFilter(sd_bus_message* message, void* userdata, sd_bus_error*) {
  auto* self = static_cast<ProcessBus*>(userdata);
  // Closing the connection from inside its own dispatch is not safe; the next loop iteration
  // (or the pump of a direct call, which checks after every step) does it.
  if (sd_bus_message_is_signal(message, "org.freedesktop.DBus.Local", "Disconnected") > 0 &&
      self->dropSource_ != nullptr) {
    sd_event_source_set_enabled(self->dropSource_, SD_EVENT_ONESHOT);
  }
  return 0;
}

int ProcessBus::onDeferredDrop(sd_event_source*, void* userdata) {
  auto* self = static_cast<ProcessBus*>(userdata);
  if (self->bus_ != nullptr && sd_bus_is_open(self->bus_) <= 0) {
    self->dropConnection("connection lost");
  }
  return 0;
}

void ProcessBus::addListener(const std::shared_ptr<ConnectionListener>& listener) {
  listeners_.push_back(listener);
}

void ProcessBus::removeListener(const ConnectionListener* listener) {
  std::erase_if(listeners_, [listener](const std::weak_ptr<ConnectionListener>& entry) {
    const auto alive = entry.lock();
    return alive == nullptr || alive.get() == listener;
  });
}

std::vector<std::shared_ptr<ConnectionListener>> ProcessBus::liveListeners() {
  // A copy: a listener may add or remove listeners while it is told.
  std::vector<std::shared_ptr<ConnectionListener>> live;
  std::erase_if(listeners_, [&live](const std::weak_ptr<ConnectionListener>& entry) {
    auto alive = entry.lock();
    if (alive == nullptr) {
      return true;
    }
    live.push_back(std::move(alive));
    return false;
  });
  return live;
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
