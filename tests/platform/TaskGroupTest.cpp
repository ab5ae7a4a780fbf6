// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "platform/TaskGroup.h"

namespace halvex {
namespace {

using namespace std::chrono_literals;

TEST(TaskGroupTest, EmptyGroupDoesNotBlock) {
  TaskGroup group;
  group.wait();
  EXPECT_TRUE(group.waitFor(0ms));
}

TEST(TaskGroupTest, WaitForTimesOutWhileEnteredAndSucceedsAfterLeave) {
  TaskGroup group;
  group.enter();
  EXPECT_FALSE(group.waitFor(20ms));
  group.leave();
  EXPECT_TRUE(group.waitFor(0ms));
}

TEST(TaskGroupTest, CopiesShareOneCount) {
  TaskGroup group;
  TaskGroup copy = group;
  EXPECT_EQ(copy, group);
  EXPECT_FALSE(TaskGroup() == group);
  copy.enter();
  EXPECT_FALSE(group.waitFor(0ms));
  group.leave();
  EXPECT_TRUE(copy.waitFor(0ms));
}

TEST(TaskGroupTest, WaitReturnsOnlyAfterEveryLeaveFromOtherThreads) {
  constexpr int kWorkers = 8;
  TaskGroup group;
  std::atomic<int> finished{0};
  std::vector<std::thread> workers;
  for (int i = 0; i < kWorkers; ++i) {
    group.enter();
  }
  for (int i = 0; i < kWorkers; ++i) {
    workers.emplace_back([group, &finished] {
      finished.fetch_add(1);
      group.leave();
    });
  }
  group.wait();
  EXPECT_EQ(finished.load(), kWorkers);
  for (auto& worker : workers) {
    worker.join();
  }
}

TEST(TaskGroupTest, HoldsEnterOnCopyAndLeaveOnDestruction) {
  TaskGroup group;
  {
    TaskGroupHold hold(group);
    EXPECT_FALSE(group.waitFor(0ms));
    {
      TaskGroupHold copy = hold;
      TaskGroupHold moved = std::move(copy);
      EXPECT_TRUE(moved.holds());
      EXPECT_FALSE(copy.holds());  // NOLINT(bugprone-use-after-move): moved-from is empty
    }
    // The moved-to hold left once; the original still holds.
    EXPECT_FALSE(group.waitFor(0ms));
  }
  EXPECT_TRUE(group.waitFor(0ms));
}

TEST(TaskGroupTest, HoldAssignmentLeavesTheOldGroup) {
  TaskGroup first;
  TaskGroup second;
  TaskGroupHold hold(first);
  hold = TaskGroupHold(second);
  EXPECT_TRUE(first.waitFor(0ms));
  EXPECT_FALSE(second.waitFor(0ms));
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
