// SPDX-License-Identifier: MIT
// Shared by the tool's unit tests: the fixture that starts each from a new process's state,
// captured console streams, a fake server script and a "logdump" command wired to the fake
// platform.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include "Tools/HalvexTool/LogdumpCommand.h"
#include "Tools/HalvexTool/ServerState.h"
#include "platform/MessageDict.h"
#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "platform/TaskGroup.h"
#include "platform/WorkQueue.h"
#include "platform/fake/FakePlatform.h"
#include "shell/Console.h"

namespace halvex::tooltest {

// Every event overwrites the server-started flag: one without a state clears it, as at start.
inline void resetServerStateForTesting() {
  onServerStateChange(MessageValue::null(), TaskGroup());
}

// For tests that use the fake platform or the server-started flag: both start as in a new
// process, whatever ran before in this one.
class FreshTool : public ::testing::Test {
 protected:
  void SetUp() override {
    fake::FakePlatform::get().reset();
    resetServerStateForTesting();
  }
};

struct CapturedConsole {
  std::istringstream in;
  std::ostringstream out;
  std::ostringstream err;
  ScopedConsoleForTesting scope{in, out, err};
};

inline MessageValue dictOf(const std::vector<std::pair<std::string, MessageValue>>& entries) {
  MessageDict dict;
  for (const auto& [key, value] : entries) {
    dict.set(key, value);
  }
  return MessageValue::dict(std::move(dict));
}

inline fake::Answer ok(MessageValue reply) {
  return {Result{0, ""}, std::move(reply)};
}

inline fake::Answer failed(std::int32_t code) {
  return {Result{code, "failed"}, {}};
}

inline fake::Answer valued(const char* key, const std::string& text) {
  return ok(dictOf({{key, MessageValue::string(text)}}));
}

// How the fake server answers each of the three requests the collections make.
struct ServerScript {
  fake::Answer enabled = valued(kKeyTracePropertyValue, "1");
  fake::Answer mode = valued(kKeyTracePropertyValue, "0");
  fake::Answer dump = valued(kKeyTimestampString, "T1");

  void install() const {
    fake::FakePlatform::get().setServerResponder(
        [script = *this](const std::string& command, const MessageDict& request) {
          if (command != kCommandGetTraceProperty) {
            return script.dump;
          }
          return request.getString(kKeyTraceName) == kTraceBaseband ? script.enabled : script.mode;
        });
  }
};

inline std::shared_ptr<LogdumpCommand> makeLogdump() {
  WorkQueue queue = WorkQueue::create("test.queue");
  return LogdumpCommand::create("logdump", {}, client::CreateManager("halvextool", queue), queue);
}

inline const std::string kPath = "Path = /var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-";
inline const std::string kRefusal = "Server is not running. Please try after server starts.\n";

}  // namespace halvex::tooltest
