// SPDX-License-Identifier: MIT
// One object of the simulator on the system bus: a connection of its own, attached to the
// daemon's sd_event loop, that serves the object's interface and owns its well-known name. Names
// are requested and released asynchronously, so nothing here blocks the loop. Everything runs on
// the loop's thread.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/SystemLog.h"
#include "sim/BusHandles.h"

namespace halvex::sim {

class Replier;
class RequestLog;
class Scheduler;

// What the objects on the bus share. The daemon owns all of it and outlives every object.
struct Services {
  sd_event* event;
  std::shared_ptr<LogServer> journal;
  Scheduler& scheduler;
  Replier& replies;
  RequestLog& log;
  // Called each time an endpoint comes to own its name, after the object's own reaction.
  std::function<void()> nameOwned;
};

// An object's well-known name, path and interface, and its category in the journal.
struct ObjectNames {
  const char* name;
  const char* path;
  const char* interface;
  const char* category;
};

class Endpoint {
 public:
  // Serves vtable with object as its userdata once connected. Its handlers may answer later:
  // they return 1 once a call is theirs, answered or not. owned runs each time the name becomes
  // ours, before services.nameOwned.
  Endpoint(const ObjectNames& names, const sd_bus_vtable* vtable, void* object,
           const Services& services, std::function<void()> owned = nullptr);
  Endpoint(const Endpoint&) = delete;
  Endpoint& operator=(const Endpoint&) = delete;

  // Connects, serves the object and asks for the name. Throws std::runtime_error. A name that
  // cannot be owned ends the loop (fatal).
  void connect();
  // Gives the name back; released runs once the bus has (or has failed to, which closing the
  // connection makes up for). released may run before this returns.
  void release(std::function<void()> released);
  // Closes the connection: the object and its name leave the bus.
  void close();

  // Answers a call with an error, saying so in the journal.
  int refuse(sd_bus_error* error, const std::string& asked, const char* name,
             const char* text) const;
  // Logs and prints message, then ends the loop with status 1.
  void fatal(const std::string& message) const;

  const char* name() const { return names_.name; }
  const Logger& journal() const { return journal_; }
  sd_bus* bus() const { return bus_.get(); }
  bool owned() const { return owned_; }

 private:
  static int onNameAcquired(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  static int onNameReleased(sd_bus_message* reply, void* userdata, sd_bus_error* error);

  ObjectNames names_;
  const sd_bus_vtable* vtable_;
  void* object_;
  sd_event* event_;
  Logger journal_;
  std::function<void()> whenOwned_;
  std::function<void()> released_;
  BusPtr bus_;
  SlotPtr vtableSlot_;
  SlotPtr nameSlot_;
  bool owned_ = false;
};

}  // namespace halvex::sim
