// SPDX-License-Identifier: MIT
// The request path and the connection's life; the loop that serves it is in ProcessBusLoop.cpp.
#include "detail/ProcessBus.h"

#include <poll.h>
#include <sys/epoll.h>

#include <cerrno>
#include <cstdlib>
#include <utility>

#include "detail/Wakeup.h"

namespace halvex::bus {

namespace {

// How long a caller waiting for its own answer reads the connection itself before it leaves
// that to the loop: far above a round trip to a live peer, far below what would hold up the
// loop's other work noticeably.
constexpr std::uint64_t kAnswerHereUsec = 10'000;

int ignoreInstallFailure(sd_bus_message*, void*, sd_bus_error*) {
  return 0;
}

}  // namespace

ProcessBus& ProcessBus::instance() {
  static ProcessBus* const bus = [] {
    auto* created = new ProcessBus;
    // The shell thread ends the process with exit() as soon as its last answer is printed; the
    // entries of the last requests may not be written yet.
    std::atexit([] { instance().flushLog(); });
    return created;
  }();
  return *bus;
}

ProcessBus::ProcessBus()
    : log_(LogServer::create()), handOver_(*this), pending_(&monotonicUsec, log_) {}

void ProcessBus::post(Task task) {
  handOver_.post(std::move(task));
}

void ProcessBus::request(CallPlan plan, MessageBuilder build, ReplyHandler done,
                         const void* owner) {
  if (HandOver::inIoContext()) {
    send(plan, build, done, owner);
    return;
  }
  const auto by = std::chrono::steady_clock::now() + plan.timeout;
  struct Request {
    CallPlan plan;
    MessageBuilder build;
    ReplyHandler done;
    const void* owner;
  };
  // Shared, not moved into the task: a borrower that must leave the request to the loop hands
  // the same task on, handler and all.
  auto held =
      std::make_shared<Request>(Request{std::move(plan), std::move(build), std::move(done), owner});
  if (!handOver_.send([this, held] { send(held->plan, held->build, held->done, held->owner); },
                      by)) {
    finishLate(held->plan, std::move(held->done));
  }
}

void ProcessBus::finishLate(const CallPlan& plan, ReplyHandler done) {
  // No loop, and another caller kept the connection past this request's bound.
  pending_.finish(pending_.start(plan.timeout, plan.category, plan.label, std::move(done), nullptr),
                  makeResult(kResultTimeout, "the connection stayed busy with another request"),
                  nullptr);
  flushLog();
}

Result ProcessBus::call(CallPlan plan, MessageBuilder build, const Decoder& decode) {
  if (HandOver::inIoContext()) {
    return makeResult(kResultBusError, "synchronous call from the bus's own context");
  }
  struct Outcome {
    Wakeup done;
    Result result;
  };
  // Shared with the handler: the waiter may wake and return before set() has.
  auto outcome = std::make_shared<Outcome>();
  ReplyHandler done = [&decode, outcome](const Result& failure, sd_bus_message* reply) {
    Result result = reply != nullptr ? decode(reply) : failure;
    outcome->result = result;
    outcome->done.set();
    return result;
  };
  // Everything the task refers to lives until the outcome is set, which only the task's call
  // can do.
  const auto by = std::chrono::steady_clock::now() + plan.timeout;
  Task task = [&] {
    // Masked before the call goes out, so that not even a quick answer wakes the loop.
    const bool here = HandOver::borrowing() && maskBus(true);
    if (send(plan, build, done, nullptr) && here) {
      awaitAnswer(outcome->done);
    }
    if (here) {
      maskBus(false);
    }
  };
  if (!handOver_.send(std::move(task), by)) {
    finishLate(plan, std::move(done));
  }
  outcome->done.wait();
  return std::move(outcome->result);
}

bool ProcessBus::maskBus(bool masked) {
  epoll_event watched{};
  watched.events = masked ? 0 : busEvents_;
  return bus_ != nullptr && busWatch_ >= 0 &&
         epoll_ctl(busWatch_, EPOLL_CTL_MOD, sd_bus_get_fd(bus_), &watched) == 0;
}

void ProcessBus::awaitAnswer(const Wakeup& answered) {
  dispatching_ = true;
  // The answer cannot be there yet: wait first, then read (sd_bus_wait returns at once when
  // something read earlier waits to be dispatched).
  const std::uint64_t until = monotonicUsec() + kAnswerHereUsec;
  while (!answered.isSet()) {
    const std::uint64_t now = monotonicUsec();
    if (now >= until || sd_bus_wait(bus_, until - now) < 0) {
      break;
    }
    int r = 0;
    while (!answered.isSet() && (r = sd_bus_process(bus_, nullptr)) > 0) {
    }
    if (r < 0 || sd_bus_is_open(bus_) <= 0) {
      break;
    }
  }
  dispatching_ = false;
}

void ProcessBus::catchUp() {
  handOver_.runDirectly([this] {
    if (bus_ == nullptr) {
      return;
    }
    int r = 0;
    while ((r = sd_bus_process(bus_, nullptr)) > 0) {
    }
    if (r < 0 || sd_bus_is_open(bus_) <= 0) {
      dropConnection("connection lost");
    }
  });
}

bool ProcessBus::send(const CallPlan& plan, const MessageBuilder& build, ReplyHandler& done,
                      const void* owner) {
  auto call = pending_.start(plan.timeout, plan.category, plan.label, std::move(done), owner);
  const auto fail = [&](const Result& why) {
    pending_.finish(std::move(call), why, nullptr);
    return true;
  };
  // A connection can break without our noticing until we write to it. A request that fails to
  // go out for that reason reached no one, so it goes once more on a fresh connection, which
  // tells whether there is a bus at all. A borrower may not open connections: it leaves the
  // request to the loop.
  for (bool retried = false;; retried = true) {
    sd_bus* bus = connection();
    if (bus == nullptr) {
      return fail(lastOpenFailure_);
    }
    sd_bus_message* raw = nullptr;
    int r = sd_bus_message_new_method_call(bus, &raw, plan.destination, plan.path, plan.interface,
                                           plan.member);
    if (r < 0) {
      return fail(resultFromErrno(bus, r));
    }
    MessagePtr message(raw);
    r = sd_bus_message_set_auto_start(message.get(), 0);
    if (r < 0) {
      return fail(resultFromErrno(bus, r));
    }
    r = build ? build(message.get()) : 0;
    if (r < 0) {
      return fail(makeResult(kResultInvalidRequest, "request cannot be encoded: " + errnoText(-r)));
    }
    // No time-out of sd-bus's own (UINT64_MAX): the deadline is the only one.
    r = sd_bus_call_async(bus, &call->slot, message.get(), &ProcessBus::onReply, call.get(),
                          UINT64_MAX);
    if (r >= 0) {
      break;
    }
    if (sd_bus_is_open(bus) > 0 || retried) {
      return fail(resultFromErrno(bus, r));
    }
    if (HandOver::borrowing()) {
      // A call of the borrower's own goes whole to the loop; one that a message dispatched
      // meanwhile started fails, as the loop will find the connection broken anyway.
      if (dispatching_) {
        return fail(resultFromErrno(bus, r));
      }
      done = std::move(call->done);
      HandOver::abandonBorrow();
      return false;
    }
    dropConnection("connection lost");
  }
  armExpiry(call->deadline);
  pending_.insert(std::move(call));
  return true;
}

int ProcessBus::onReply(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  ProcessBus& self = instance();
  auto call = self.pending_.take(static_cast<PendingCalls::Call*>(userdata)->id);
  if (call == nullptr) {
    return 0;
  }
  if (sd_bus_message_is_method_error(reply, nullptr) > 0) {
    self.pending_.finish(std::move(call),
                         resultFromErrorReply(sd_bus_message_get_bus(reply), reply), nullptr);
  } else {
    self.pending_.finish(std::move(call), Result{}, reply);
  }
  return 0;
}

void ProcessBus::serveDirectly() {
  while (!pending_.empty()) {
    if (bus_ == nullptr) {
      // Only a connection that went with its calls can leave this; they completed with it.
      pending_.finishAll(makeResult(kResultConnectionLost, "connection lost"));
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
    pending_.expire();
    const std::uint64_t next = pending_.earliestDeadline();
    if (next == UINT64_MAX) {
      return;
    }
    const std::uint64_t now = pending_.now();
    r = sd_bus_wait(bus_, next > now ? next - now : 0);
    if (r < 0 && r != -EINTR) {
      dropConnection("connection lost");
    }
  }
}

bool ProcessBus::lendable() {
  // Only a call on an open connection: anything that would touch the loop itself (a connection
  // to attach, a timer to move) is the loop's own work.
  return !closing_ && bus_ != nullptr && sd_bus_is_ready(bus_) > 0;
}

bool ProcessBus::wakeAfterLending() {
  // The loop sleeps with what it computed before: a message left to send needs it to wait for
  // POLLOUT, one read but not dispatched (or a broken connection) needs a dispatch now, and an
  // earlier deadline needs its timer moved.
  std::uint64_t until = UINT64_MAX;
  const int events = sd_bus_get_events(bus_);
  return rearmWanted_ || events < 0 || (events & POLLOUT) != 0 ||
         sd_bus_get_timeout(bus_, &until) < 0 || until == 0;
}

void ProcessBus::dispatchBus() {
  if (bus_ == nullptr) {
    return;
  }
  // Out of sd-bus's own dispatch, a connection that broke can be dropped at once.
  if (sd_bus_process(bus_, nullptr) < 0 || sd_bus_is_open(bus_) <= 0) {
    dropConnection("connection lost");
  }
}

void ProcessBus::flushLog() {
  log_.flush();
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
    // Dropping it tells the listeners, who may need the loop: a borrower leaves that to it.
    if (HandOver::borrowing()) {
      lastOpenFailure_ = makeResult(kResultConnectionLost, "connection lost");
      return nullptr;
    }
    dropConnection(open == -ECHILD ? "connection inherited across fork" : "connection lost");
  }
  sd_bus* bus = nullptr;
  int r = sd_bus_open_system(&bus);
  if (r < 0) {
    lastOpenFailure_ = resultFromOpenFailure(r);
    return nullptr;
  }
  bus_ = bus;
  ++epoch_;
  attachBus();
  for (const auto& listener : liveListeners()) {
    listener->connected(bus_);
  }
  return bus_;
}

void ProcessBus::dropConnection(const char* why) {
  const bool hadConnection = bus_ != nullptr;
  if (hadConnection) {
    detachBus();
    // No flush: it could block on a peer that stopped reading, and nothing queued matters now.
    // Closed before the matches go, so that they leave without asking the bus to remove them.
    sd_bus_close(bus_);
  }
  for (const Match& match : matches_) {
    sd_bus_slot_unref(match.slot);
  }
  matches_.clear();
  bus_ = sd_bus_unref(bus_);
  // sd_bus_close() forgets pending calls without running their callbacks: they complete here,
  // after the connection is gone, so that a handler sending anew gets a fresh one.
  pending_.finishAll(makeResult(kResultConnectionLost, why));
  if (hadConnection) {
    for (const auto& listener : liveListeners()) {
      listener->disconnected();
    }
  }
}

void ProcessBus::cancel(const void* owner, const Result& why) {
  pending_.finishOwned(owner, why);
}

void ProcessBus::addMatch(const void* owner, const char* rule, sd_bus_message_handler_t callback,
                          void* userdata) {
  sd_bus_slot* slot = nullptr;
  // An install callback of our own: without one sd-bus closes the connection when the bus
  // refuses the match.
  if (bus_ != nullptr &&
      sd_bus_add_match_async(bus_, &slot, rule, callback, &ignoreInstallFailure, userdata) >= 0) {
    matches_.push_back({owner, slot});
  }
}

void ProcessBus::removeMatches(const void* owner) {
  std::erase_if(matches_, [owner](const Match& match) {
    if (match.owner != owner) {
      return false;
    }
    sd_bus_slot_unref(match.slot);
    return true;
  });
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

}  // namespace halvex::bus
