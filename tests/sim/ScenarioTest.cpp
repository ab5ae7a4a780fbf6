// SPDX-License-Identifier: MIT
// Scenario parsing without a bus: defaults, overrides, and a precise place for every mistake.
#include <gtest/gtest.h>

#include <cctype>
#include <filesystem>
#include <fstream>

#include "platform/ServerProtocol.h"
#include "sim/Scenario.h"
#include "tests/support/TestBus.h"

namespace halvex::sim {
namespace {

MessageValue started() {
  MessageDict dict;
  dict.set(kKeyServerState, MessageValue::string(kServerStateStarted));
  return MessageValue::dict(dict);
}

TEST(Scenario, EmptyDocumentIsAWorkingDevice) {
  const Scenario scenario = parseScenario("{}");
  EXPECT_TRUE(scenario.device.present);
  EXPECT_EQ(scenario.device.radioType, 1);
  EXPECT_EQ(scenario.device.radioVendor, 2);
  EXPECT_TRUE(scenario.device.internalBuild);
  EXPECT_FALSE(scenario.device.carrierBuild);
  EXPECT_TRUE(scenario.device.traceAllowed);
  EXPECT_TRUE(scenario.processes.empty());
  EXPECT_TRUE(scenario.server.present);
  ASSERT_TRUE(scenario.server.state.has_value());
  EXPECT_EQ(scenario.server.state->payload, started());
  EXPECT_EQ(scenario.server.state->when, StateWhen::kSubscribe);
  EXPECT_EQ(scenario.server.propertyAnswer(kTraceBaseband, kKeyTraceEnabled).value, "1");
  EXPECT_EQ(scenario.server.propertyAnswer(kTraceSystemLogs, kKeyTraceMode).value, "0");
  EXPECT_FALSE(scenario.server.propertyAnswer(kTraceBaseband, "Other").value.has_value());
  const Answer dump = scenario.server.commandAnswer(kCommandTraceDumpState);
  EXPECT_EQ(dump.result, 0);
  EXPECT_EQ(dump.reply, ReplyKind::kDict);
  EXPECT_EQ(dump.fault, Fault::kNone);
  EXPECT_EQ(dump.stamp, Stamp::kDefault);
  EXPECT_TRUE(scenario.helper.present);
}

TEST(Scenario, OverridesLandWhereWritten) {
  const Scenario scenario = parseScenario(R"({
    "device": {"present": false, "radio_vendor": 1, "carrier_build": true},
    "processes": ["Telvane", "A process name longer than fifteen"],
    "server": {
      "appear_after_ms": 250,
      "state": {"payload": {"Z": 1, "A": {"nested": true}, "M": null}, "when": "after", "after_ms": 40},
      "commands": {"TraceDumpState": {"result": 3760250881, "reply": "string", "timestamp": "T1",
                                      "delay_ms": 100, "fault": "never_answer"},
                   "Other": {"result": -5, "fault": "exit", "timestamp": null}},
      "properties": {"BasebandTrace": {"Enabled": {"result": 7, "reply": "null"}}}
    },
    "helper": {"present": false, "reply": "bool", "timestamp": "H1"}
  })");
  EXPECT_FALSE(scenario.device.present);
  EXPECT_EQ(scenario.device.radioVendor, 1);
  EXPECT_TRUE(scenario.device.carrierBuild);
  EXPECT_TRUE(scenario.device.internalBuild);
  EXPECT_EQ(scenario.processes,
            (std::vector<std::string>{"Telvane", "A process name longer than fifteen"}));
  EXPECT_EQ(scenario.server.appearAfterMs, 250U);
  ASSERT_TRUE(scenario.server.state.has_value());
  EXPECT_EQ(scenario.server.state->when, StateWhen::kAfter);
  EXPECT_EQ(scenario.server.state->afterMs, 40U);
  // Payload keys keep the order written: that is the order they travel in.
  EXPECT_EQ(describe(scenario.server.state->payload), describe([] {
              MessageDict nested, dict;
              nested.set("nested", MessageValue::boolean(true));
              dict.set("Z", MessageValue::int64(1));
              dict.set("A", MessageValue::dict(nested));
              dict.set("M", MessageValue::null());
              return MessageValue::dict(dict);
            }()));

  const Answer dump = scenario.server.commandAnswer(kCommandTraceDumpState);
  EXPECT_EQ(static_cast<std::uint32_t>(dump.result), 0xE020E001U);
  EXPECT_EQ(dump.reply, ReplyKind::kString);
  EXPECT_EQ(dump.stamp, Stamp::kText);
  EXPECT_EQ(dump.timestamp, "T1");
  EXPECT_EQ(dump.delayMs, 100U);
  EXPECT_EQ(dump.fault, Fault::kNeverAnswer);
  EXPECT_EQ(scenario.server.commandAnswer("Other").result, -5);
  EXPECT_EQ(scenario.server.commandAnswer("Other").fault, Fault::kExit);
  EXPECT_EQ(scenario.server.commandAnswer("Other").stamp, Stamp::kNone);

  // A listed pair replaces its default entirely; the other default stays.
  const PropertyAnswer enabled = scenario.server.propertyAnswer(kTraceBaseband, kKeyTraceEnabled);
  EXPECT_FALSE(enabled.value.has_value());
  EXPECT_EQ(enabled.answer.result, 7);
  EXPECT_EQ(enabled.answer.reply, ReplyKind::kNull);
  EXPECT_EQ(scenario.server.propertyAnswer(kTraceSystemLogs, kKeyTraceMode).value, "0");

  EXPECT_FALSE(scenario.helper.present);
  EXPECT_EQ(scenario.helper.status.reply, ReplyKind::kBool);
  EXPECT_EQ(scenario.helper.status.timestamp, "H1");
}

TEST(Scenario, NullStateMeansNoStateEvent) {
  EXPECT_FALSE(parseScenario(R"({"server": {"state": null}})").server.state.has_value());
  const Scenario noPayload = parseScenario(R"({"server": {"state": {"when": "demand"}}})");
  ASSERT_TRUE(noPayload.server.state.has_value());
  EXPECT_TRUE(noPayload.server.state->payload.isNull());
  EXPECT_EQ(noPayload.server.state->when, StateWhen::kDemand);
}

struct BadCase {
  const char* text;
  const char* pointer;
  const char* problem;  // a part of the message
};

class ScenarioErrors : public testing::TestWithParam<BadCase> {};

TEST_P(ScenarioErrors, NameThePlaceAndTheProblem) {
  const BadCase& c = GetParam();
  try {
    parseScenario(c.text);
    FAIL() << "accepted: " << c.text;
  } catch (const ScenarioError& error) {
    EXPECT_EQ(error.pointer(), c.pointer) << error.what();
    EXPECT_NE(error.problem().find(c.problem), std::string::npos) << error.what();
  }
}

std::string deepArray() {
  return std::string(100, '[') + std::string(100, ']');
}

std::string deepPayload() {
  std::string text = R"({"server": {"state": {"payload": )";
  for (int i = 0; i < 17; ++i)
    text += R"({"a": )";
  text += "1";
  for (int i = 0; i < 17; ++i)
    text += "}";
  return text + "}}}";
}

const std::string kDeepArray = deepArray();
std::string deepArrayPointer() {
  std::string p;
  for (int i = 0; i < 64; ++i)
    p += "/0";
  return p;
}
const std::string kDeepArrayPointer = deepArrayPointer();
const std::string kDeepPayload = deepPayload();
const std::string kDeepPointer = "/server/state/payload" + [] {
  std::string p;
  for (int i = 0; i < 16; ++i)
    p += "/a";
  return p;
}();

INSTANTIATE_TEST_SUITE_P(
    Table, ScenarioErrors,
    testing::Values(
        BadCase{"{", "", "not valid JSON at line 1, column 2 (syntax error"},
        BadCase{"{\"a\": \"\n\"}", "", "U+000A (LF) must be escaped to \\u000A or \\n)"},
        BadCase{"{}\n{}", "", "not valid JSON at line 2"},
        BadCase{"[]", "", "expected an object, got an array"},
        BadCase{kDeepArray.c_str(), kDeepArrayPointer.c_str(), "nested deeper than 64"},
        BadCase{R"({"device": {"radio_type": 1e400}})", "/device/radio_type",
                "1e400 is out of range"},
        BadCase{R"({"device": {"radio_type": 18446744073709551616}})", "/device/radio_type",
                "beyond 64 bits"},
        BadCase{R"({"processes": ["a", -99999999999999999999]})", "/processes/1", "beyond 64 bits"},
        BadCase{R"({"server": {"state": {"payload": {"k": "a\u0000"}}}})",
                "/server/state/payload/k", "holds NUL"},
        BadCase{R"({"server": {"state": {"payload": {"a\u0000\n": 1}}}})",
                "/server/state/payload/a\\u0000\\u000a", "this key holds NUL"},
        BadCase{R"({"helper": {"timestamp": "\uFDD0"}})", "/helper/timestamp", "noncharacter"},
        BadCase{R"({"server": {"properties": {"T": {"P": {"value": "\uFFFF"}}}}})",
                "/server/properties/T/P/value", "noncharacter"},
        BadCase{R"({"bogus": 1})", "/bogus", "unknown key"},
        BadCase{R"({"device": {"radio_type": "1"}})", "/device/radio_type",
                "expected an integer, got a string"},
        BadCase{R"({"device": {"present": 1}})", "/device/present", "expected a boolean"},
        BadCase{R"({"device": {"colour": 1}})", "/device/colour", "unknown key"},
        BadCase{R"({"processes": "Telvane"})", "/processes", "expected an array"},
        BadCase{R"({"processes": ["ok", "a/b"]})", "/processes/1", "not a process name"},
        BadCase{R"({"processes": ["x", "x"]})", "/processes/1", "listed twice"},
        BadCase{R"({"processes": [7]})", "/processes/0", "expected a string"},
        BadCase{R"({"server": []})", "/server", "expected an object"},
        BadCase{R"({"server": {"present": "yes"}})", "/server/present", "expected a boolean"},
        BadCase{R"({"server": {"appear_after_ms": -1}})", "/server/appear_after_ms",
                "out of range"},
        BadCase{R"({"server": {"commands": {"TraceDumpState": {"result": "0"}}}})",
                "/server/commands/TraceDumpState/result", "expected an integer, got a string"},
        BadCase{R"({"server": {"commands": {"TraceDumpState": {"result": 1.5}}}})",
                "/server/commands/TraceDumpState/result", "got a fractional number"},
        BadCase{R"({"server": {"commands": {"TraceDumpState": {"result": 4294967296}}}})",
                "/server/commands/TraceDumpState/result", "out of range"},
        BadCase{R"({"server": {"commands": {"X": {"reply": "text"}}}})", "/server/commands/X/reply",
                "\"text\" is not one of \"dict\""},
        BadCase{R"({"server": {"commands": {"X": {"fault": true}}}})", "/server/commands/X/fault",
                "expected one of \"none\""},
        BadCase{R"({"server": {"commands": {"X": {"delay_ms": 999999999}}}})",
                "/server/commands/X/delay_ms", "out of range"},
        BadCase{R"({"server": {"commands": {"X": {"value": "1"}}}})", "/server/commands/X/value",
                "unknown key"},
        BadCase{R"({"server": {"commands": {"a/b~c": {"bogus": 1}}}})",
                "/server/commands/a~1b~0c/bogus", "unknown key"},
        BadCase{R"({"server": {"commands": {"X": 0}}})", "/server/commands/X",
                "expected an object"},
        BadCase{R"({"server": {"commands": {"GetTraceProperty": {}}}})",
                "/server/commands/GetTraceProperty", "/server/properties"},
        BadCase{R"({"server": {"state": "Started"}})", "/server/state", "expected an object"},
        BadCase{R"({"server": {"state": {"when": "later"}}})", "/server/state/when",
                "\"later\" is not one of"},
        BadCase{R"({"server": {"state": {"payload": {"list": [1]}}}})",
                "/server/state/payload/list", "an array has no form on the bus"},
        BadCase{R"({"server": {"state": {"payload": 0.5}}})", "/server/state/payload",
                "a fractional number has no form on the bus"},
        BadCase{kDeepPayload.c_str(), kDeepPointer.c_str(), "nested deeper than 16"},
        BadCase{R"({"server": {"properties": {"BasebandTrace": 1}}})",
                "/server/properties/BasebandTrace", "expected an object"},
        BadCase{R"({"server": {"properties": {"BasebandTrace": {"Enabled": {"value": 1}}}}})",
                "/server/properties/BasebandTrace/Enabled/value", "expected a string"},
        BadCase{R"({"server": {"properties": {"T": {"P": {"timestamp": "x"}}}}})",
                "/server/properties/T/P/timestamp", "unknown key"},
        BadCase{R"({"helper": {"timestamp": 5}})", "/helper/timestamp", "expected a string"},
        BadCase{R"({"helper": {"present": null}})", "/helper/present", "got null"}),
    [](const testing::TestParamInfo<BadCase>& param) {
      std::string name = "At";
      for (const char c : std::string(param.param.pointer)) {
        if (std::isalnum(static_cast<unsigned char>(c)))
          name += c;
      }
      return name + "_" + std::to_string(param.index);
    });

TEST(Scenario, LoadNamesTheFileBeforeThePlace) {
  halvex::test::TempDir dir;
  const auto file = dir.path() / "bad.json";
  std::ofstream(file) << R"({"server": {"commands": {"TraceDumpState": {"result": "0"}}}})";
  try {
    loadScenario(file.string());
    FAIL() << "accepted";
  } catch (const std::runtime_error& error) {
    EXPECT_EQ(std::string(error.what()),
              file.string() +
                  ": /server/commands/TraceDumpState/result: expected an integer, got a string");
  }
}

TEST(Scenario, EveryExampleScenarioIsValid) {
  int count = 0;
  for (const auto& entry : std::filesystem::directory_iterator(HALVEX_SCENARIO_DIR)) {
    if (entry.path().extension() != ".json")
      continue;
    ++count;
    EXPECT_NO_THROW(loadScenario(entry.path().string())) << entry.path();
  }
  EXPECT_GE(count, 5);
}

}  // namespace
}  // namespace halvex::sim
