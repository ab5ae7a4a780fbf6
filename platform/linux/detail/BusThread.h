// SPDX-License-Identifier: MIT
// One I/O thread that owns an sd_event loop and one private connection to the system bus.
//
// sd-bus objects are not thread-safe and messages pin their connection with a plain reference
// count, so everything that touches the connection (building, sending and decoding messages,
// matches, the loop) happens on this thread. Other threads hand it closures with post().
//
// Lifetime: start() hands the thread a reference to its owner, which the thread drops when it
// ends, so the owner outlives every closure the thread runs. stop() runs every closure posted
// before it, completes every call still pending with kResultConnectionLost, closes the connection
// and ends the thread. Called on any other thread it waits for the end; called on the I/O thread
// itself (the owner's last reference dropped there) it returns at once and the thread ends on its
// own after the current closure.
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
#include <thread>

#include "platform/Result.h"
#include "platform/linux/detail/BusSupport.h"

namespace halvex::bus {

class BusThread {
 public:
  using Task = std::function<void()>;
  // Exactly one of the two carries the outcome: reply is a method return (owned by sd-bus, valid
  // for the duration of the call) and then failure is success; or reply is null and failure says
  // what went wrong.
  using ReplyHandler = std::function<void(const Result& failure, sd_bus_message* reply)>;

  struct Hooks {
    // A new connection was opened; install matches here. Runs on the I/O thread.
    std::function<void(sd_bus*)> connected;
    // The connection broke (its pending calls have already completed). Runs on the I/O thread.
    std::function<void()> disconnected;
  };

  BusThread(std::string name, Hooks hooks);
  ~BusThread();  // stop() must have been called when the thread was started
  BusThread(const BusThread&) = delete;
  BusThread& operator=(const BusThread&) = delete;

  // Starts the thread; false when the loop could not be set up (then nothing runs, post() fails).
  bool start(std::shared_ptr<void> owner);

  // Queues task for the I/O thread. False, with task dropped, once stop() has begun or when the
  // thread never started; the caller then reports the failure itself.
  bool post(Task task);

  void stop();

  bool isCurrent() const;

  // --- I/O thread only ---

  // The open connection, opening a new one when there is none or the old one broke (whose pending
  // calls then complete with kResultConnectionLost). Null when no bus can be reached or during
  // stop; lastOpenFailure() then says why. opened, when given, tells whether this call opened it.
  sd_bus* connection(bool* opened = nullptr);
  Result lastOpenFailure() const { return lastOpenFailure_; }

  // Counts connections opened, so that a late answer can tell whether it belongs to the current.
  std::uint64_t epoch() const { return epoch_; }

  // Sends a method call with auto-start off and the bus's default time-out. done runs exactly once
  // on the I/O thread, possibly before callAsync returns. A negative return of build gives
  // kResultInvalidRequest.
  void callAsync(const char* destination, const char* path, const char* interface,
                 const char* member, const MessageBuilder& build, ReplyHandler done);

  // Runs task once after delay. There is one timer: a later call replaces a task not yet run.
  void runAfter(std::chrono::microseconds delay, Task task);

 private:
  struct Pending {
    BusThread* owner = nullptr;
    std::uint64_t id = 0;
    std::uint64_t deadline = 0;
    sd_bus_slot* slot = nullptr;
    ReplyHandler done;
  };

  static int onWake(sd_event_source* source, int fd, std::uint32_t revents, void* userdata);
  static int onReply(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  static int onTimer(sd_event_source* source, std::uint64_t usec, void* userdata);
  static int onFilter(sd_bus_message* message, void* userdata, sd_bus_error* error);

  void run(std::shared_ptr<void> owner);
  void drainInbox();
  void dropConnection(const char* why);

  const std::string name_;
  const Hooks hooks_;

  std::mutex mutex_;
  std::deque<Task> inbox_;
  bool accepting_ = false;

  int wakeFd_ = -1;
  sd_event* event_ = nullptr;
  sd_event_source* wakeSource_ = nullptr;
  sd_event_source* timer_ = nullptr;
  std::thread thread_;
  std::atomic<std::thread::id> threadId_{};

  // I/O thread only.
  sd_bus* bus_ = nullptr;
  bool stopping_ = false;
  std::uint64_t epoch_ = 0;
  std::uint64_t nextCallId_ = 0;
  std::map<std::uint64_t, std::unique_ptr<Pending>> pending_;
  Task timerTask_;
  Result lastOpenFailure_;
};

}  // namespace halvex::bus
