// SPDX-License-Identifier: MIT
// Shared by the trace tests: each test starts from a device of its choosing and then reads the
// platform calls that the code under test made.
#pragma once

#include <string>
#include <vector>

#include "platform/fake/FakePlatform.h"

namespace halvex::trace::tests {

using Calls = std::vector<std::string>;

// Answers as device from now on and forgets every call made so far.
inline void useDevice(const fake::Device& device) {
  fake::FakePlatform::get().setDevice(device);
  fake::FakePlatform::get().clearCalls();
}

// The platform calls made since the last useDevice() or takeCalls(), in order.
inline Calls takeCalls() {
  Calls calls = fake::FakePlatform::get().calls();
  fake::FakePlatform::get().clearCalls();
  return calls;
}

}  // namespace halvex::trace::tests
