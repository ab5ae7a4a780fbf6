// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include "platform/TaskGroup.h"

namespace halvex {
namespace {

using namespace std::chrono_literals;

// Waits across threads are the work queue tests' business.
TEST(TaskGroupTest, CopiesShareOneCountThatWaitsFollow) {
  TaskGroup group;
  group.wait();  // an empty group does not block
  TaskGroup copy = group;
  EXPECT_EQ(copy, group);
  EXPECT_FALSE(TaskGroup() == group);
  copy.enter();
  EXPECT_FALSE(group.waitFor(20ms));
  group.leave();
  EXPECT_TRUE(copy.waitFor(0ms));
}

TEST(TaskGroupTest, HoldsEnterWhileTheyLive) {
  TaskGroup group, other;
  {
    TaskGroupHold hold(group);
    EXPECT_FALSE(group.waitFor(0ms));
    {
      TaskGroupHold copy = hold;
      TaskGroupHold moved = std::move(copy);
      EXPECT_TRUE(moved.holds());
      EXPECT_FALSE(copy.holds());  // NOLINT(bugprone-use-after-move): moved-from is empty
    }
    EXPECT_FALSE(group.waitFor(0ms));  // the original still holds
    hold = TaskGroupHold(other);       // and assigning leaves its old group
    EXPECT_TRUE(group.waitFor(0ms));
    EXPECT_FALSE(other.waitFor(0ms));
  }
  EXPECT_TRUE(other.waitFor(0ms));
}

TEST(TaskGroupDeathTest, LeaveWithoutEnterAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  TaskGroup group;
  EXPECT_DEATH(group.leave(), "leave\\(\\) without a matching enter\\(\\)");
  group.enter();
  group.leave();
  EXPECT_DEATH(group.leave(), "without a matching enter");
}

}  // namespace
}  // namespace halvex
