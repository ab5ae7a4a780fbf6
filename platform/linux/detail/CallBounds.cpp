// SPDX-License-Identifier: MIT
#include "detail/CallBounds.h"

#include "platform/ServerProtocol.h"

namespace halvex::bus {

namespace {

using std::chrono::minutes;
using std::chrono::seconds;

// Changed only by tests, before any bus thread runs (see platform/linux/testing/BusTesting.h).
CallBounds gBounds{
    .identity = seconds(5),
    .property = seconds(10),
    .dump = minutes(10),
    .otherCommand = seconds(60),
    .subscribe = seconds(10),
    .helper = seconds(30),
};

}  // namespace

const CallBounds& callBounds() {
  return gBounds;
}

CallBounds& callBoundsForTesting() {
  return gBounds;
}

std::chrono::microseconds serverCommandBound(std::string_view command) {
  if (command == kCommandTraceDumpState) {
    return gBounds.dump;
  }
  if (command == kCommandGetTraceProperty) {
    return gBounds.property;
  }
  return gBounds.otherCommand;
}

}  // namespace halvex::bus
