// SPDX-License-Identifier: MIT
// The process's one connection to the system bus, and the sd-event loop that serves it.
//
// Every service of the host backend (the client managers, the helper clients, the device
// queries) shares this connection: opening one costs authentication and Hello, which a one-shot
// tool would otherwise pay once per service. Who may touch it when, and how requests from other
// threads reach it, is the hand-over's business (HandOver.h); the calls out and their deadlines
// are the table's (PendingCalls.h).
//
// Every request ends exactly once, with its outcome, within its bound (CallBounds.h), whatever
// becomes of the loop:
//   - a loop serves the connection: the loop reads the answer, or completes the request when its
//     deadline passes;
//   - no loop does (none was started, it could not start, or it stopped): the caller that sends
//     a request serves the connection itself until the request has completed, so request() then
//     returns only after done has run;
//   - the loop stops: requests still out, and those queued for it, complete with
//     kResultConnectionLost before run() returns; later ones are served directly.
// sd-bus's own time-out, which the environment can change, plays no part. Each request is
// logged to the system log with its outcome and duration, written outside every lock.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "detail/BusSupport.h"
#include "detail/HandOver.h"
#include "detail/PendingCalls.h"
#include "detail/Private.h"
#include "platform/Result.h"

namespace halvex::bus {

// What one call is: where it goes, how long it may take, and how it is named in the log.
struct CallPlan {
  const char* destination;
  const char* path;
  const char* interface;
  const char* member;
  std::chrono::microseconds timeout;
  const char* category;  // log category: "server", "helper", "device"; null: not logged
  std::string label;     // what the log names the call, e.g. "PerformCommand TraceDumpState"
};

// Told about the connection's life, in the I/O context.
class ConnectionListener {
 public:
  virtual ~ConnectionListener() = default;
  // A new connection was opened.
  virtual void connected(sd_bus* bus) = 0;
  // The connection broke or was closed; its pending calls have completed and its matches are
  // gone.
  virtual void disconnected() = 0;
};

class Wakeup;

class ProcessBus final : private HandOver::Keeper {
 public:
  using Task = HandOver::Task;
  using ReplyHandler = PendingCalls::ReplyHandler;
  // Turns a method return into the caller's values, in the I/O context.
  using Decoder = std::function<Result(sd_bus_message* reply)>;

  // The one instance. It is never destroyed: the process may exit while the loop still runs. At
  // exit, log entries still waiting are written.
  static ProcessBus& instance();

  ProcessBus(const ProcessBus&) = delete;
  ProcessBus& operator=(const ProcessBus&) = delete;

  // Serves the connection on this thread until stop(). Returns a negative errno when the loop
  // could not start (-EBUSY: another thread runs one) or failed, 0 after stop(). When it
  // returns, every request it had taken has completed, the connection is closed, and callers
  // serve their requests directly again; a later run() may claim the connection anew. claimed,
  // when given, runs once the loop has claimed the connection, before it serves anything.
  int run(const std::function<void()>& claimed = {});

  // Any thread: makes run() return. A no-op when no loop runs.
  void stop();

  // Any thread: runs task in the I/O context (see HandOver::post), at once when this thread is
  // the I/O context already.
  void post(Task task);

  // Any thread: sends the call, auto-start off. done runs exactly once with the outcome, in the
  // I/O context, or on this thread when the request could not get there; from the I/O context
  // it may run before request() returns, and with no loop it always has. owner tags the call
  // for cancel(); it may be null.
  void request(CallPlan plan, MessageBuilder build, ReplyHandler done, const void* owner);

  // Any thread but the I/O context: sends the call and blocks until it completes, sleeping.
  // decode runs on the method return in the I/O context; its Result is returned. While the loop
  // sleeps, the caller sends the call itself and reads the connection for its answer for a
  // while (10 ms), masking the connection from the loop meanwhile: a quick answer then
  // wakes no other thread. Whatever else arrives meanwhile is dispatched on the caller's thread,
  // as the I/O context, and what only the loop may do is left to it.
  Result call(CallPlan plan, MessageBuilder build, const Decoder& decode);

  // Any thread but the loop's: when no loop serves the connection, reads and dispatches what has
  // arrived without waiting, so that signals already sent are acted upon; with a loop, which
  // reads as things arrive, nothing.
  void catchUp();

  // --- I/O context only ---

  // The open connection, opening a new one when there is none or the old one broke (listeners
  // hear of both). Null when no bus can be reached.
  sd_bus* connection();

  // Counts connections opened, so that a late answer can tell whether it belongs to the current.
  std::uint64_t epoch() const { return epoch_; }

  // Completes owner's pending calls now with why.
  void cancel(const void* owner, const Result& why);

  // Installs a match on the current connection for owner, without waiting for the bus to
  // confirm it. It lasts until removeMatches(owner) or the connection goes. A match that cannot
  // be installed costs its signals, not the connection.
  void addMatch(const void* owner, const char* rule, sd_bus_message_handler_t callback,
                void* userdata);
  void removeMatches(const void* owner);

  void addListener(const std::shared_ptr<ConnectionListener>& listener);
  void removeListener(const ConnectionListener* listener);

  // Runs task once after delay while the loop runs; null with no loop. Dropping the returned
  // source, in the I/O context, cancels it.
  struct SourceReleaser {
    void operator()(sd_event_source* source) const { sd_event_source_disable_unref(source); }
  };
  using Timer = std::unique_ptr<sd_event_source, SourceReleaser>;
  Timer runAfter(std::chrono::microseconds delay, Task task);

 private:
  struct Match {
    const void* owner;
    sd_bus_slot* slot;
  };

  ProcessBus();

  // HandOver::Keeper
  bool lendable() override;
  bool wakeAfterLending() override;
  void serveDirectly() override;
  void flushLog() override;

  int setUpLoop();
  void tearDownLoop();
  // Puts the connection in the loop's sight, or takes it out.
  void attachBus();
  void detachBus();
  // Takes the connection out of the loop's sight, or puts it back; false when it cannot.
  bool maskBus(bool masked);
  // A borrower's wait for its own answer, up to 10 ms, the connection masked.
  void awaitAnswer(const Wakeup& answered);
  // Reads and dispatches one message; drops the connection when it broke.
  void dispatchBus();
  // Completes a request that never got to the I/O context in time.
  void finishLate(const CallPlan& plan, ReplyHandler done);
  // Sends the call now. False, leaving done alone, when a borrower must leave it to the loop.
  bool send(const CallPlan& plan, const MessageBuilder& build, ReplyHandler& done,
            const void* owner);
  void dropConnection(const char* why);
  void armExpiry(std::uint64_t deadline);
  std::vector<std::shared_ptr<ConnectionListener>> liveListeners();

  static int onWake(sd_event_source* source, int fd, std::uint32_t revents, void* userdata);
  static int onReply(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  static int onExpiry(sd_event_source* source, std::uint64_t usec, void* userdata);
  static int onBusPrepare(sd_event_source* source, void* userdata);
  static int onBusReady(sd_event_source* source, int fd, std::uint32_t revents, void* userdata);
  static int onBusTimer(sd_event_source* source, std::uint64_t usec, void* userdata);
  static int onTimer(sd_event_source* source, std::uint64_t usec, void* userdata);

  LogOutbox log_;
  HandOver handOver_;

  // I/O context only.
  PendingCalls pending_;
  sd_event* event_ = nullptr;  // while a loop runs
  sd_event_source* wakeSource_ = nullptr;
  sd_event_source* expirySource_ = nullptr;
  // The loop sees the connection through an epoll set of our own, so that a borrower can take it
  // out of the loop's sight without touching sd-event, which only the loop's thread may.
  int busWatch_ = -1;
  std::uint32_t busEvents_ = 0;  // what busWatch_ waits for on the connection now
  sd_event_source* busSource_ = nullptr;
  sd_event_source* busTimer_ = nullptr;  // sd-bus's own time-outs, and work already read
  bool dispatching_ = false;             // a borrower dispatches while it waits for its answer
  std::uint64_t armedDeadline_ = 0;      // 0: the expiry timer is off
  bool rearmWanted_ = false;             // a borrower set an earlier deadline than the timer's
  sd_bus* bus_ = nullptr;
  bool closing_ = false;  // run() is ending: nothing opens a connection
  std::uint64_t epoch_ = 0;
  std::vector<Match> matches_;
  std::vector<std::weak_ptr<ConnectionListener>> listeners_;
  Result lastOpenFailure_;
};

}  // namespace halvex::bus
