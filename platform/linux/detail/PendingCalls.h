// SPDX-License-Identifier: MIT
// The calls out on the connection and not yet answered, each with its deadline, and the outcome
// each ends with. A call leaves the table exactly once (answered, expired, cancelled or failed
// with the connection) and is then finished exactly once: its handler runs with the outcome and
// an entry for the system log waits in the outbox.
//
// Nothing here touches a connection: the clock is given, replies are whatever the caller hands
// in, and slots are only released. Not thread-safe: the I/O context alone uses a table; the
// outbox may be flushed from any thread.
#pragma once

#include <systemd/sd-bus.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "detail/Private.h"
#include "platform/Mutex.h"
#include "platform/Result.h"
#include "platform/SystemLog.h"

namespace halvex::bus {

// The outcome of one request, waiting to be written to the system log.
struct LoggedOutcome {
  const char* category = nullptr;
  std::string label;
  Result result;
  std::uint64_t tookUsec = 0;

  // "PerformCommand TraceDumpState: code 0x00000000 in 0.412 ms[: message]"
  std::string describe() const;
};

// Log entries wait here until whoever writes them holds no lock of the connection, so that the
// request path never waits on the journal. Any thread; entries are written in the order added.
class LogOutbox {
 public:
  explicit LogOutbox(std::shared_ptr<LogServer> server);

  void add(LoggedOutcome entry) EXCLUDES(mutex_);
  // Writes whatever waits: failures at warning priority, successes at debug.
  void flush() EXCLUDES(writing_, mutex_);

 private:
  const std::shared_ptr<LogServer> server_;
  std::atomic<bool> waiting_{false};  // a cheap look before the locks
  Mutex writing_;                     // one writer at a time, so entries never pass each other
  std::vector<LoggedOutcome> batch_ GUARDED_BY(writing_);
  Mutex mutex_;
  std::vector<LoggedOutcome> entries_ GUARDED_BY(mutex_);
};

class PendingCalls {
 public:
  using Clock = std::uint64_t (*)();  // microseconds, monotonic
  // Gets the outcome: a failure with a null reply, or success with a method return (valid only
  // during the call). Returns the outcome the caller made of it, which is what the log records.
  using ReplyHandler = std::function<Result(const Result& failure, sd_bus_message* reply)>;

  struct Call {
    std::uint64_t id = 0;
    std::uint64_t started = 0;
    std::uint64_t deadline = 0;
    const void* owner = nullptr;
    const char* category = nullptr;  // null: not logged
    std::string label;
    ReplyHandler done;
    sd_bus_slot* slot = nullptr;  // released when the call leaves the table
  };

  PendingCalls(Clock clock, LogOutbox& log) : clock_(clock), log_(log) {}
  ~PendingCalls();
  PendingCalls(const PendingCalls&) = delete;
  PendingCalls& operator=(const PendingCalls&) = delete;

  // A call starting now with the given bound, not yet in the table. owner tags it for
  // finishOwned(); category and label name it in the log.
  std::unique_ptr<Call> start(std::chrono::microseconds bound, const char* category,
                              std::string label, ReplyHandler done, const void* owner);
  // Puts a call that went out into the table and numbers it.
  void insert(std::unique_ptr<Call> call);
  // The call numbered id, out of the table; null when it has left already.
  std::unique_ptr<Call> take(std::uint64_t id);

  // Runs the handler of a call that left the table (or never entered it) and logs the outcome.
  void finish(std::unique_ptr<Call> call, const Result& failure, sd_bus_message* reply);
  // Finishes every call whose deadline has come with kResultTimeout.
  void expire();
  // Finishes owner's calls, or all of them, with why, in the order they were sent.
  void finishOwned(const void* owner, const Result& why);
  void finishAll(const Result& why);

  // The earliest deadline in the table, UINT64_MAX when it is empty.
  std::uint64_t earliestDeadline() const;
  bool empty() const { return calls_.empty(); }
  std::uint64_t now() const { return clock_(); }

 private:
  // Takes the calls pred picks out of the table, in the order sent, and finishes them.
  template <typename Pred, typename Why>
  void finishIf(Pred pred, Why why);

  const Clock clock_;
  LogOutbox& log_;
  std::uint64_t nextId_ = 0;
  std::map<std::uint64_t, std::unique_ptr<Call>> calls_;
};

}  // namespace halvex::bus
