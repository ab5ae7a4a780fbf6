// SPDX-License-Identifier: MIT
// The process's one connection to the system bus, and the sd-event loop that serves it.
//
// Every service of the host backend (the client managers, the helper clients, the device
// queries) shares this connection: opening one costs authentication and Hello, which a one-shot
// tool would otherwise pay once per service.
//
// sd-bus objects are not thread-safe, so exactly one context touches the connection at a time:
// the I/O context, and it holds the bus's lock. Until some thread calls run(), that is whichever
// thread takes the lock: work posted then runs at once on the posting thread, and a synchronous
// call pumps the connection itself (the tool's start-up checks run this way, before main enters
// the loop). From run() on, it is the loop's thread, which lets go of the lock only while it
// sleeps in epoll: other threads queue closures for it, except that a request may be sent by its
// caller meanwhile (send(), call()), sparing two thread hand-offs; its reply still comes through
// the loop. Nothing but the loop's thread ever touches the sd-event loop.
//
// Calls carry their own time-outs (CallBounds.h) and are logged to the system log with their
// outcome and duration; sd-bus's default time-out, which the environment can change, plays no
// part. Every call completes exactly once.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/Result.h"
#include "platform/SystemLog.h"
#include "platform/linux/detail/BusSupport.h"

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
  // A new connection was opened (install matches here).
  virtual void connected(sd_bus* bus) = 0;
  // The connection broke or was closed; its pending calls have already completed.
  virtual void disconnected() = 0;
};

class ProcessBus {
 public:
  using Task = std::function<void()>;
  // Exactly one of the two carries the outcome: reply is a method return (valid only during the
  // call) and failure is success; or reply is null and failure says what went wrong.
  // It returns the outcome the caller made of it, which is what the log records.
  using ReplyHandler = std::function<Result(const Result& failure, sd_bus_message* reply)>;
  // Turns a method return into the caller's values, in the I/O context.
  using Decoder = std::function<Result(sd_bus_message* reply)>;

  // The one instance. It is never destroyed: the process may exit while the loop still runs.
  static ProcessBus& instance();

  ProcessBus(const ProcessBus&) = delete;
  ProcessBus& operator=(const ProcessBus&) = delete;

  // Serves the connection on this thread until stop(). Returns a negative errno when the loop
  // could not run or failed, 0 after stop(). When it returns, every pending call has completed
  // with kResultConnectionLost, the connection is closed, and the bus is back where it was
  // before run(): a later run() may claim it again. claimed, when given, runs once the loop has
  // claimed the bus (work posted from then on runs on this thread), before it serves anything.
  int run(const std::function<void()>& claimed = {});

  // Any thread: makes run() return. A no-op when no loop runs.
  void stop();

  // Any thread but the loop's: runs task in the I/O context, at once while no loop runs, else on
  // the loop's thread in the order posted.
  void post(Task task);

  // Any thread but the loop's: runs task in the I/O context, on this thread when the loop sleeps
  // and the connection is open (the task may then only send calls on it), else as post() does.
  // For the hot path of sending a request: no hand-off when the loop has nothing else to do.
  void send(Task task);

  // Any thread but the loop's: sends the call and blocks until it completes. decode runs on the
  // method return in the I/O context; its Result is returned. Failures come back as Results.
  Result call(const CallPlan& plan, const MessageBuilder& build, const Decoder& decode);

  // --- I/O context only ---

  // The open connection, opening a new one when there is none or the old one broke (listeners
  // hear of both). Null when no bus can be reached; lastOpenFailure() says why.
  sd_bus* connection();
  const Result& lastOpenFailure() const { return lastOpenFailure_; }

  // Counts connections opened, so that a late answer can tell whether it belongs to the current.
  std::uint64_t epoch() const { return epoch_; }

  // Sends a call with auto-start off. done runs exactly once in the I/O context, possibly before
  // callAsync returns. owner tags the call for cancel(); it may be null.
  void callAsync(const CallPlan& plan, const MessageBuilder& build, ReplyHandler done,
                 const void* owner = nullptr);

  // Completes owner's pending calls now with why.
  void cancel(const void* owner, const Result& why);

  void addListener(const std::shared_ptr<ConnectionListener>& listener);
  void removeListener(const ConnectionListener* listener);

  // Runs task once after delay (in the loop; a timer waits while no loop runs). Dropping the
  // returned source, in the I/O context, cancels it.
  struct SourceReleaser {
    void operator()(sd_event_source* source) const { sd_event_source_disable_unref(source); }
  };
  using Timer = std::unique_ptr<sd_event_source, SourceReleaser>;
  Timer runAfter(std::chrono::microseconds delay, Task task);

 private:
  struct Pending;

  ProcessBus();

  void setUpEvent();
  void tearDownEvent();
  // Queues task for the loop; false, leaving task alone, when no loop takes work.
  bool enqueue(Task& task);
  // Runs send on this thread as the I/O context while the loop sleeps; false when it cannot.
  bool borrow(const Task& send);
  void wake();
  void drainInbox();
  // Direct use: serves the connection on this thread until done is set.
  void pumpUntil(const std::atomic<bool>& done);
  void dropConnection(const char* why);
  void complete(std::unique_ptr<Pending> pending, const Result& failure, sd_bus_message* reply);
  std::uint64_t earliestDeadline() const;
  void expireDue(std::uint64_t now);
  void armExpiry(std::uint64_t deadline);
  std::vector<std::shared_ptr<ConnectionListener>> liveListeners();

  static int onWake(sd_event_source* source, int fd, std::uint32_t revents, void* userdata);
  static int onReply(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  static int onExpiry(sd_event_source* source, std::uint64_t usec, void* userdata);
  static int onFilter(sd_bus_message* message, void* userdata, sd_bus_error* error);
  static int onDeferredDrop(sd_event_source* source, void* userdata);
  static int onTimer(sd_event_source* source, std::uint64_t usec, void* userdata);

  const std::shared_ptr<LogServer> log_;

  // Held by whoever is the I/O context: the loop for all but its wait in epoll, a caller that
  // borrows the connection meanwhile, or the direct user while no loop runs.
  std::mutex ioMutex_;
  bool claimed_ = false;  // a loop serves the bus (ioMutex_)

  std::mutex inboxMutex_;
  std::deque<Task> inbox_;
  bool inboxOpen_ = false;  // a loop takes queued work (inboxMutex_)

  // I/O context only, apart from the wake descriptor.
  int wakeFd_ = -1;
  sd_event* event_ = nullptr;
  sd_event_source* wakeSource_ = nullptr;
  sd_event_source* dropSource_ = nullptr;
  sd_event_source* expirySource_ = nullptr;
  sd_bus* bus_ = nullptr;
  bool closing_ = false;  // run() is ending: nothing opens a connection
  std::uint64_t epoch_ = 0;
  std::uint64_t nextCallId_ = 0;
  std::uint64_t armedDeadline_ = 0;  // 0: the expiry timer is off
  bool rearmWanted_ = false;         // a borrower set an earlier deadline than the timer's
  std::map<std::uint64_t, std::unique_ptr<Pending>> pending_;
  std::vector<std::weak_ptr<ConnectionListener>> listeners_;
  Result lastOpenFailure_;
};

}  // namespace halvex::bus
