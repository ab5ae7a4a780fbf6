// SPDX-License-Identifier: MIT
// Shared pieces of the tool's unit tests: captured console streams, a fake server script and a
// "logdump" command wired to the fake platform.
#pragma once

#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "Tools/HalvexTool/LogdumpCommand.h"
#include "platform/MessageDict.h"
#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "platform/WorkQueue.h"
#include "platform/fake/FakePlatform.h"
#include "shell/Console.h"

namespace halvex::tooltest {

// Redirects the console for the object's lifetime.
struct CapturedConsole {
  explicit CapturedConsole(const std::string& input = {}) : in(input) {}
  std::istringstream in;
  std::ostringstream out;
  std::ostringstream err;
  ScopedConsoleForTesting scope{in, out, err};
};

inline MessageValue dictOf(std::vector<std::pair<std::string, MessageValue>> entries) {
  MessageDict dict;
  for (auto& [key, value] : entries) {
    dict.set(key, std::move(value));
  }
  return MessageValue::dict(std::move(dict));
}

inline fake::Answer ok(MessageValue reply) {
  return {Result{0, ""}, std::move(reply)};
}

inline fake::Answer failed(std::int32_t code) {
  return {Result{code, "failed"}, {}};
}

inline fake::Answer propertyValue(const std::string& text) {
  return ok(dictOf({{kKeyTracePropertyValue, MessageValue::string(text)}}));
}

inline fake::Answer dumped(const std::string& timestamp) {
  return ok(dictOf({{kKeyTimestampString, MessageValue::string(timestamp)}}));
}

// How the fake server answers each of the three requests the collections make.
struct ServerScript {
  fake::Answer enabled = propertyValue("1");
  fake::Answer mode = propertyValue("0");
  fake::Answer dump = dumped("T1");

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
  auto manager = client::CreateManager("halvextool", queue);
  return LogdumpCommand::create("logdump", {}, manager, queue);
}

// The server requests made since `from` requests had been recorded.
inline std::vector<fake::ServerRequest> requestsSince(std::size_t from) {
  auto all = fake::FakePlatform::get().serverRequests();
  return {all.begin() + static_cast<std::ptrdiff_t>(from), all.end()};
}

inline const char* const kSnapshot = "/var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-";

}  // namespace halvex::tooltest
