// SPDX-License-Identifier: MIT
// The answers of the server's and the helper's Perform methods: reading the request dictionary
// they end with, building the reply an Answer of the scenario describes, and sending it now,
// later or never, writing its log set just before it goes out.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/MessageDict.h"
#include "sim/BusHandles.h"
#include "sim/LogSetWriter.h"
#include "sim/Scenario.h"

namespace halvex::sim {

class Endpoint;
class Scheduler;

// What a request is answered with once its time comes.
struct Reply {
  std::string asked;  // the method and command, for the journal
  std::int32_t code = 0;
  MessageValue value;
  std::string timestamp;         // the TimestampString sent, "" without one
  std::optional<LogSet> logSet;  // written just before the reply goes out
  std::string description;
};

// The reply answer describes: dict when it asks for a dictionary, text for a string.
Reply makeReply(std::string asked, const Answer& answer, MessageDict dict, const std::string& text);

// The reply to a request answered with a time stamp under key: the answer's own, none, or, when
// it says nothing and stampedByDefault (a dump, the helper), the time of the request.
Reply stampedReply(std::string asked, const Answer& answer, const char* key, bool stampedByDefault);

// Reads the request dictionary that ends every Perform method into request. A value outside the
// message types is the caller's mistake: the call is refused and the result is negative.
int readRequest(sd_bus_message* call, sd_bus_error* error, MessageDict& request,
                const Endpoint& endpoint, const std::string& asked);

class Replier {
 public:
  // logsAreWritten: the writer has a root, so the journal names where each log set went.
  Replier(Scheduler& scheduler, const LogSetWriter& writer, bool logsAreWritten);

  // Answers call as answer says: at once, after its delay, never, or by exiting the process.
  // Throws std::runtime_error when a delay cannot be scheduled.
  void respond(const Endpoint& endpoint, sd_bus_message* call, const Answer& answer, Reply reply);

 private:
  void send(const Endpoint& endpoint, sd_bus_message* call, const Reply& reply) const;

  Scheduler& scheduler_;
  const LogSetWriter& writer_;
  bool logsAreWritten_;
};

}  // namespace halvex::sim
