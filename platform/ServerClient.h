// SPDX-License-Identifier: MIT
// The baseband-manager server's client framework.
//
// A Manager is one client's connection to the server. Every callback of a manager (event
// handlers and the completions of asynchronous commands) runs on the WorkQueue given to
// CreateManager, one at a time. The functions themselves may be called from any thread other
// than that queue's, unless said otherwise; the synchronous PerformCommand may also be called
// from the queue, where it blocks the queue for the call's duration.
//
// One source file per backend defines Manager and these functions; CMake picks the backend.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/MessageDict.h"
#include "platform/Result.h"
#include "platform/TaskGroup.h"
#include "platform/WorkQueue.h"

namespace halvex::client {

class Manager;

// An event handler receives the event's payload (normally a dictionary, but any value, null
// included) and a group the handler may use to mark work of its own.
using EventHandler = std::function<void(MessageValue payload, TaskGroup group)>;

// The completion of an asynchronous command: the outcome and the reply (any value, null when
// the request failed).
using Completion = std::function<void(Result result, MessageValue reply)>;

// Connects to the server as clientName. Never returns null: a server that is absent is reported
// by the outcome of each command and by a state event.
std::shared_ptr<Manager> CreateManager(const std::string& clientName, WorkQueue queue);

// Registers handler for events named event; a later registration for the same name replaces the
// earlier one. The manager keeps a copy of the handler for its own lifetime.
void RegisterEventHandler(const std::shared_ptr<Manager>& manager, const std::string& event,
                          EventHandler handler);

// Stops delivery of events; events received but not yet delivered are dropped.
void EventsOff(const std::shared_ptr<Manager>& manager);

// Starts delivery of events. The server's current state is delivered as its state-change event
// when the server is present.
void EventsOn(const std::shared_ptr<Manager>& manager);

// Sends command with request and blocks until the outcome is known. reply receives the server's
// answer (any value) on success and null otherwise.
Result PerformCommand(const std::shared_ptr<Manager>& manager, const std::string& command,
                      const MessageDict& request, MessageValue& reply);

// Sends command with request and returns at once. completion runs exactly once, on the manager's
// queue, whatever happens to the request, and its copy is released right after it has run.
void PerformCommand(const std::shared_ptr<Manager>& manager, const std::string& command,
                    Completion completion, const MessageDict& request);

}  // namespace halvex::client
