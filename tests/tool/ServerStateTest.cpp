// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <string>

#include "Tools/HalvexTool/ServerState.h"
#include "platform/MessageDict.h"
#include "platform/ServerProtocol.h"

namespace halvex {
namespace {

MessageValue stateEvent(MessageValue state) {
  MessageDict payload;
  payload.set(kKeyServerState, std::move(state));
  return MessageValue::dict(std::move(payload));
}

// Each event overwrites the flag, so the rows run in order and every "not started" row follows a
// "started" one.
TEST(ServerStateFlag, EveryEventOverwritesTheFlag) {
  EXPECT_FALSE(isServerStarted());

  const MessageValue started = stateEvent(MessageValue::string(kServerStateStarted));
  struct Row {
    const char* what;
    MessageValue payload;
  };
  const Row notStarted[] = {
      {"another state", stateEvent(MessageValue::string("Stopped"))},
      {"non-string state", stateEvent(MessageValue::boolean(true))},
      {"dictionary without the key", MessageValue::dict(MessageDict())},
      {"no payload", MessageValue::null()},
      {"payload not a dictionary", MessageValue::string(kServerStateStarted)},
      {"other case", stateEvent(MessageValue::string("started"))},
      {"extra character", stateEvent(MessageValue::string(std::string(kServerStateStarted) + " "))},
      {"prefix only", stateEvent(MessageValue::string(std::string(kServerStateStarted, 3)))},
  };
  for (const Row& row : notStarted) {
    SCOPED_TRACE(row.what);
    onServerStateChange(started, TaskGroup());
    EXPECT_TRUE(isServerStarted());
    onServerStateChange(row.payload, TaskGroup());
    EXPECT_FALSE(isServerStarted());
  }
}

}  // namespace
}  // namespace halvex
