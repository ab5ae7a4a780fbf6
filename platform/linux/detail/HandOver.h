// SPDX-License-Identifier: MIT
// Who may touch the process's connection, and how work from other threads gets there.
//
// sd-bus objects are not thread-safe, so exactly one thread at a time is the I/O context, and
// it holds the hand-over's lock:
//   - While a run loop has claimed the connection, the loop's thread, for everything but its
//     sleep in epoll. Other threads queue closures for it and wake it; a caller may instead
//     borrow the connection while the loop sleeps and send on it itself (send()), which spares
//     two thread hand-offs. The answer still comes through the loop.
//   - While no loop has (none started, it failed to start, or it stopped), whichever caller
//     takes the lock. That caller serves what it started to the end before it lets go
//     (Keeper::serveDirectly), so that nothing it sent waits for a loop that is not there.
// Log entries are written by whoever just let go of the lock, never under it.
#pragma once

#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>

#include "detail/Private.h"
#include "platform/Mutex.h"

namespace halvex::bus {

class HandOver {
 public:
  using Task = std::function<void()>;
  using Deadline = std::chrono::steady_clock::time_point;

  // What the hand-over asks of the connection's keeper, in the I/O context unless said otherwise.
  class Keeper {
   public:
    virtual ~Keeper() = default;
    // A borrower may send on the connection now: it is open and needs nothing of the loop's.
    virtual bool lendable() = 0;
    // After a borrower's work: true when the sleeping loop must wake to take up what it left.
    virtual bool wakeAfterLending() = 0;
    // With no loop: serves everything the work just done has sent, until each has completed.
    virtual void serveDirectly() = 0;
    // Writes what waits for the system log. Called holding nothing, on any thread.
    virtual void flushLog() = 0;
  };

  explicit HandOver(Keeper& keeper);
  ~HandOver();
  HandOver(const HandOver&) = delete;
  HandOver& operator=(const HandOver&) = delete;

  // True on the thread that is the I/O context now.
  static bool inIoContext();
  // True while this thread borrows the connection from the sleeping loop.
  static bool borrowing();
  // Called by a borrower's work that cannot finish on the borrowed connection (it would have to
  // open a new one, which is the loop's business): the work goes to the loop instead, whole.
  static void abandonBorrow();

  // --- any thread but the loop's ---

  // Runs task in the I/O context: on the loop's thread in the order posted, or, with no loop, at
  // once on this thread, which then serves what the task sent. False, with task not run, when
  // there is no loop and another caller keeps the connection past by.
  bool post(Task task, Deadline by = Deadline::max()) EXCLUDES(ioTurn_);
  // With no loop, runs task as post() does and is true; with a loop, false and nothing runs.
  bool runDirectly(const Task& task) EXCLUDES(ioTurn_);
  // As post(), but runs task on this thread when the loop sleeps and the keeper can lend the
  // connection: for sending a request without handing it to another thread.
  bool send(Task task, Deadline by) EXCLUDES(ioTurn_);

  // --- the loop's thread ---

  // The descriptor that becomes readable when work is queued for the loop.
  int wakeFd() const { return wakeFd_; }
  // The errno of the wake descriptor that could not be made, or 0. Without it no loop can claim
  // the connection.
  int wakeFdError() const { return wakeFdError_; }
  // Makes this thread the I/O context until release(); false when a loop has claimed it
  // already. Queued work waits until open().
  bool claim() TRY_ACQUIRE(true, ioTurn_);
  void open() EXCLUDES(inboxMutex_);
  // Lets go of the I/O context while wait runs (the loop's sleep), then takes it back.
  int sleep(const std::function<int()>& wait) REQUIRES(ioTurn_);
  // Runs what was queued, in order.
  void drain();
  // Takes no more work; what was queued still runs with drain().
  void close() EXCLUDES(inboxMutex_);
  // Hands the connection back to direct use.
  void release() RELEASE(ioTurn_);
  // Queues task for the loop and wakes it; false, leaving task alone, when no loop takes work.
  bool enqueue(Task& task) EXCLUDES(inboxMutex_);

 private:
  // The I/O context as a lock whose waiters can give up at a deadline. (A timed mutex would do,
  // but ThreadSanitizer cannot follow pthread_mutex_clocklock.)
  class CAPABILITY("I/O context") Turn {
   public:
    void lock() ACQUIRE();
    bool tryLock() TRY_ACQUIRE(true);
    bool tryLockUntil(Deadline by) TRY_ACQUIRE(true);
    void unlock() RELEASE();

   private:
    Mutex mutex_;
    std::condition_variable free_;
    bool held_ GUARDED_BY(mutex_) = false;
  };

  // A caller's turn, let go of at the end of its scope at the latest: taken at once, or tried.
  class SCOPED_CAPABILITY Hold {
   public:
    explicit Hold(Turn& turn) ACQUIRE(turn) : turn_(turn) { turn.lock(); }
    Hold(Turn& turn, std::defer_lock_t) EXCLUDES(turn) : turn_(turn), held_(false) {}
    ~Hold() RELEASE() {
      if (held_) {
        turn_.unlock();
      }
    }
    Hold(const Hold&) = delete;
    Hold& operator=(const Hold&) = delete;

    bool tryLock() TRY_ACQUIRE(true) { return held_ = turn_.tryLock(); }
    bool tryLockUntil(Deadline by) TRY_ACQUIRE(true) { return held_ = turn_.tryLockUntil(by); }
    void unlock() RELEASE() {
      held_ = false;
      turn_.unlock();
    }

   private:
    Turn& turn_;
    bool held_ = true;
  };

  bool borrow(const Task& task) EXCLUDES(ioTurn_);
  void wake();

  // Runs task in the I/O context with no loop, then serves what it sent.
  void runHere(const Task& task) REQUIRES(ioTurn_);

  Keeper& keeper_;
  const int wakeFd_;
  const int wakeFdError_;

  // Held by the thread that is the I/O context: the loop's, from claim() to release() but for
  // its sleeps, or a caller's, with no loop or borrowing the sleeping loop's connection.
  Turn ioTurn_;
  bool claimed_ GUARDED_BY(ioTurn_) = false;

  Mutex inboxMutex_;
  std::deque<Task> inbox_ GUARDED_BY(inboxMutex_);
  bool inboxOpen_ GUARDED_BY(inboxMutex_) = false;
};

}  // namespace halvex::bus
