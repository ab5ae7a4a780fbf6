// SPDX-License-Identifier: MIT
// The simulator's parts without a bus. Scenario parsing names a precise place for every kind of
// mistake (SimCommandLine shows how a place is printed; the scenario fuzzer, that whatever is
// accepted can go on the bus), and log sets take the form the tool prints. What the simulator does
// with them shows on the bus (SimBusTest).
#include <gtest/gtest.h>

#include <filesystem>

#include "platform/ServerProtocol.h"
#include "sim/LogSetWriter.h"
#include "sim/Scenario.h"
#include "tests/support/TestBus.h"

namespace halvex::sim {
namespace {

namespace fs = std::filesystem;

std::string repeat(const std::string& text, int times) {
  std::string out;
  while (times-- > 0) {
    out += text;
  }
  return out;
}

const std::string kDeepArray = repeat("[", 100) + repeat("]", 100);
const std::string kDeepArrayPointer = repeat("/0", 64);
const std::string kDeepPayload =
    R"({"server": {"state": {"payload": )" + repeat(R"({"a": )", 17) + "1" + repeat("}", 20);
const std::string kDeepPointer = "/server/state/payload" + repeat("/a", 16);

TEST(Scenario, ErrorsNameThePlaceAndTheProblem) {
  const struct {
    std::string text;
    std::string pointer;
    std::string problem;  // a part of the message
  } cases[] = {
      {"{", "", "not valid JSON at line 1, column 2 (syntax error"},
      {"{\"a\": \"\n\"}", "", "U+000A (LF) must be escaped to \\u000A or \\n)"},
      {kDeepArray, "", "nested deeper than 64 levels at " + kDeepArrayPointer},
      {R"({"device": {"radio_type": 1e400}})", "",
       "1e400 at /device/radio_type is out of range (line 1, column 31)"},
      {R"({"device": {"radio_type": 18446744073709551616}})", "/device/radio_type",
       "beyond 64 bits"},
      {R"({"server": {"state": {"payload": {"a\u0000\n": 1}}}})",
       "/server/state/payload/a" + std::string(1, '\0') + "\n",
       "payload/a\\u0000\\u000a: this key holds NUL"},
      {R"({"helper": {"timestamp": "\uFDD0"}})", "/helper/timestamp", "noncharacter"},
      {R"({"processes": ["ok", "a/b"]})", "/processes/1", "not a process name"},
      {R"({"processes": ["x", "x"]})", "/processes/1", "listed twice"},
      {R"({"server": {"commands": {"TraceDumpState": {"result": 4294967296}}}})",
       "/server/commands/TraceDumpState/result", "out of range"},
      {R"({"server": {"commands": {"X": {"reply": "text"}}}})", "/server/commands/X/reply",
       R"("text" is not one of "dict")"},
      {R"({"server": {"commands": {"a/b~c": {"bogus": 1}}}})", "/server/commands/a~1b~0c/bogus",
       "unknown key"},
      {R"({"server": {"commands": {"GetTraceProperty": {}}}})", "/server/commands/GetTraceProperty",
       "/server/properties"},
      {R"({"server": {"state": {"payload": {"list": [1]}}}})", "/server/state/payload/list",
       "an array has no form on the bus"},
      {kDeepPayload, kDeepPointer, "nested deeper than 16"},
      {R"({"helper": {"present": null}})", "/helper/present", "got null"},
  };
  for (const auto& c : cases) {
    try {
      parseScenario(c.text);
      ADD_FAILURE() << "accepted: " << c.text;
    } catch (const ScenarioError& error) {
      EXPECT_EQ(error.pointer(), c.pointer) << error.what();
      EXPECT_NE(std::string(error.what()).find(c.problem), std::string::npos) << error.what();
    }
  }
}

TEST(Scenario, EveryExampleScenarioIsValid) {
  int count = 0;
  for (const auto& entry : std::filesystem::directory_iterator(HALVEX_SCENARIO_DIR)) {
    if (entry.path().extension() != ".json") {
      continue;
    }
    ++count;
    EXPECT_NO_THROW(loadScenario(entry.path().string())) << entry.path();
  }
  EXPECT_GE(count, 5);
}

TEST(LogSetWriter, RefusesATimestampThatLeavesTheSnapshotFolder) {
  halvex::test::TempDir root;
  const LogSetWriter writer((root.path() / "device").string());
  const LogSet escape = logSetForHelper("x/../../../../../../../escaped", 1);
  EXPECT_FALSE(writer.write(escape, ""));
  EXPECT_FALSE(fs::exists(root.path() / "escaped-bb-trace"));
  EXPECT_FALSE(fs::exists(root.path() / "device/var/wireless/Library/Logs/escaped-bb-trace"));
}

}  // namespace
}  // namespace halvex::sim
