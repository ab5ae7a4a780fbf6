// SPDX-License-Identifier: MIT
// Runs of the real halvextool against halvex-sim on a private bus, each compared whole: exit
// status, both output streams and the requests the simulated device received.
#pragma once

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tests/support/TestBus.h"

namespace halvex::e2e {

inline const std::string kPrompt = "(/halvextool)>> ";
inline const std::string kPath = "Path = /var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-";
inline const std::string kTel = "Telephony log collection: ";
inline const std::string kModeQuery =
    "halvextool GetTraceProperty TraceName='SystemLogs' TracePropertyName='Mode'";
inline const std::string kTelDump =
    "halvextool TraceDumpState TraceAction='CollectTelephonyLogs' "
    "TraceDumpStateReason='[halvextool] User triggered' TraceDumpStatePerformCompression=true";

inline std::vector<std::string> commandRequests(const test::SimProcess& sim) {
  std::vector<std::string> lines;
  for (const nlohmann::json& entry : sim.requestLog()) {
    if (!entry.contains("command")) {
      continue;  // subscriptions and device identity queries
    }
    std::string line = entry.value("client", "") + " " + entry.value("command", "");
    line += entry.contains("task") ? " task=" + entry["task"].dump() : "";
    for (const nlohmann::json& key : entry["keys"]) {
      const nlohmann::json& value = key["value"];
      line += " " + key.value("key", "") + "=" +
              (value.is_string() ? "'" + value.get<std::string>() + "'" : value.dump());
    }
    lines.push_back(line);
  }
  return lines;
}

// Runs the tool with words, or interactively (no words) reading input to its end, on a device
// that plays scenario, and compares everything. Requests read "client command key=value ...",
// strings in single quotes.
inline void runSession(const char* what, const std::string& scenario,
                       std::vector<std::string> words, const std::string& input,
                       const std::string& status, const std::string& out, const std::string& err,
                       const std::vector<std::string>& requests) {
  SCOPED_TRACE(what);
  test::PrivateBus bus;
  test::SimProcess sim(bus, scenario);
  words.insert(words.begin(), HALVEXTOOL_BINARY);
  const test::RunResult run = test::runProcess({.args = words, .env = {}, .input = input});
  EXPECT_EQ(run.status.describe(), status);
  EXPECT_EQ(run.out, out);
  EXPECT_EQ(run.err, err);
  EXPECT_EQ(commandRequests(sim), requests);
}

}  // namespace halvex::e2e
