// SPDX-License-Identifier: MIT
// The simulator's scenario: what the device, the server and the helper say, read from JSON and
// checked up front so that the daemon never meets a value it cannot use. See docs/simulator.md
// for the format. No bus here; tests feed JSON text directly.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/MessageDict.h"
#include "sim/ScenarioError.h"

namespace halvex::sim {

// The shape of a reply's payload variant.
enum class ReplyKind { kDict, kNull, kString, kInt64, kBool };

enum class Fault {
  kNone,
  kNeverAnswer,  // the request is kept and never answered
  kExit,         // the simulator exits as the request arrives
};

// Where the TimestampString of a reply comes from.
enum class Stamp {
  kDefault,  // not given: the time of the request for a dump and the helper, none otherwise
  kNone,     // given as null: the reply has no TimestampString
  kText,     // Answer::timestamp
};

// How one request is answered.
struct Answer {
  std::int32_t result = 0;  // the reply's code; 0 is success
  ReplyKind reply = ReplyKind::kDict;
  Stamp stamp = Stamp::kDefault;
  std::string timestamp;  // with Stamp::kText
  std::uint32_t delayMs = 0;
  Fault fault = Fault::kNone;
};

// The answer of GetTraceProperty for one trace and property name.
struct PropertyAnswer {
  Answer answer;
  std::optional<std::string> value;  // TracePropertyValue; unset: the reply lacks it
};

struct Device {
  bool present = true;
  std::int64_t radioType = 1;
  std::int64_t radioVendor = 2;
  std::int64_t productType = 0;
  bool internalBuild = true;
  bool carrierBuild = false;
  bool vendorBuild = false;
  bool traceAllowed = true;
};

enum class StateWhen {
  kSubscribe,  // in the Subscribe reply
  kAfter,      // as an Event signal afterMs after each Subscribe
  kDemand,     // only through the control interface
};

struct StateEvent {
  MessageValue payload;
  StateWhen when = StateWhen::kSubscribe;
  std::uint32_t afterMs = 0;
};

struct Server {
  bool present = true;
  std::uint32_t appearAfterMs = 0;
  std::optional<StateEvent> state;  // unset: the scenario said null, no state event at all
  std::map<std::string, Answer, std::less<>> commands;
  // Keyed by trace name, then property name.
  std::map<std::string, std::map<std::string, PropertyAnswer, std::less<>>, std::less<>> properties;

  // The answer for command, or the default one (result 0, empty dictionary).
  Answer commandAnswer(std::string_view command) const;
  // The answer for a property, or a dictionary without a value for a pair not configured.
  PropertyAnswer propertyAnswer(std::string_view trace, std::string_view property) const;
};

struct Helper {
  bool present = true;
  Answer status;  // the VarniskStatus answer
};

struct Scenario {
  Device device;
  std::vector<std::string> processes;
  Server server;
  Helper helper;
};

// Every default: a working device whose server has started and whose baseband logs are enabled.
Scenario defaultScenario();

// Parses and checks scenario JSON. Throws ScenarioError.
Scenario parseScenario(std::string_view text);

// Reads and parses a scenario file. Throws std::runtime_error with one line naming the file and
// the place: "FILE: POINTER: PROBLEM".
Scenario loadScenario(const std::string& path);

// "dict", "null", ... as written in scenarios.
std::string_view replyKindName(ReplyKind kind);

}  // namespace halvex::sim
