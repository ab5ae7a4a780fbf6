// SPDX-License-Identifier: MIT
// The portable primitives: message dictionaries, task groups and work queues.
#include <gtest/gtest.h>

#include <atomic>
#include <numeric>
#include <optional>
#include <vector>

#include "platform/MessageDict.h"
#include "platform/TaskGroup.h"
#include "platform/WorkQueue.h"

namespace halvex {
namespace {

using namespace std::chrono_literals;

// Every kind renders as itself (a value that reported a wrong kind would not), and only a string
// reads as one.
TEST(MessageDictTest, KeysKeepInsertionOrderAndReplacingKeepsPosition) {
  const std::string binary("a\0\xff", 3);  // keys and strings are byte strings
  MessageDict dict;
  dict.set("s", MessageValue::string(R"(q"\)"));
  dict.set("n", MessageValue::int64(-7));
  dict.set("b", MessageValue::boolean(true));
  dict.set("z", MessageValue());
  dict.set("d", MessageValue::dict(MessageDict()));
  dict.set("n", MessageValue::boolean(false));
  EXPECT_EQ(describe(MessageValue::dict(dict)),
            R"({"s": "q\"\\", "n": false, "b": true, "z": null, "d": {}})");
  for (const char* key : {"absent", "n", "z", "d"}) {
    EXPECT_EQ(dict.getString(key, "default"), "default") << key;
  }
  dict.set(binary, MessageValue::string(binary));
  dict.set("a", MessageValue::string(""));
  EXPECT_EQ(dict.getString(binary, "default"), binary);
  EXPECT_EQ(dict.getString("a", "default"), "");

  // Equal only with the same keys in the same order.
  MessageDict same, reversed;
  for (const auto& [key, value] : dict.entries()) {
    same.set(key, value);
  }
  for (auto entry = dict.entries().rbegin(); entry != dict.entries().rend(); ++entry) {
    reversed.set(entry->first, entry->second);
  }
  EXPECT_EQ(same, dict);
  EXPECT_NE(reversed, dict);
}

// Waits across threads are the work queue tests' business.
TEST(TaskGroupTest, CopiesAndHoldsShareOneCountThatWaitsFollow) {
  TaskGroup group;
  group.wait();  // an empty group does not block
  TaskGroup copy = group;
  EXPECT_EQ(copy, group);
  EXPECT_FALSE(TaskGroup() == group);
  copy.enter();
  EXPECT_FALSE(group.waitFor(20ms));
  group.leave();
  EXPECT_TRUE(copy.waitFor(0ms));

  // Holds enter while they live.
  TaskGroup other;
  {
    TaskGroupHold hold(group);
    EXPECT_FALSE(group.waitFor(0ms));
    {
      TaskGroupHold copied = hold;
      TaskGroupHold moved = std::move(copied);
      EXPECT_TRUE(moved.holds());
      EXPECT_FALSE(copied.holds());  // NOLINT(bugprone-use-after-move): moved-from is empty
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

TEST(WorkQueueTest, RunsClosuresOneAtATimeInPostingOrderOnItsOwnThread) {
  WorkQueue queue = WorkQueue::create("test.order");
  EXPECT_EQ(queue.label(), "test.order");
  EXPECT_FALSE(queue.isCurrent());
  constexpr int kCount = 2000;
  std::vector<int> seen;  // touched only on the queue
  std::atomic<int> running{0};
  std::atomic<bool> misplaced{false};  // overlapping another closure, or off the queue
  TaskGroup done;
  done.enter();
  for (int i = 0; i < kCount; ++i) {
    queue.post([&, i] {
      misplaced = misplaced || running.fetch_add(1) != 0 || !queue.isCurrent();
      if (i == kCount - 1) {  // a closure may post to its own queue, to run after itself
        queue.post([&] {
          seen.push_back(kCount);
          done.leave();
        });
      }
      seen.push_back(i);
      running.fetch_sub(1);
    });
  }
  ASSERT_TRUE(done.waitFor(10s));
  EXPECT_FALSE(misplaced.load());
  std::vector<int> expected(kCount + 1);
  std::iota(expected.begin(), expected.end(), 0);
  EXPECT_EQ(seen, expected);
}

TEST(WorkQueueTest, DroppingTheLastHandleStillRunsQueuedWork) {
  std::atomic<int> ran{0};
  {
    WorkQueue queue = WorkQueue::create("test.drain");
    TaskGroup gate;
    gate.enter();
    // The first closure blocks until the handle is about to go, so the rest is still queued.
    queue.post([gate] { gate.wait(); });
    for (int i = 0; i < 100; ++i) {
      queue.post([&] { ran.fetch_add(1); });
    }
    gate.leave();
  }
  // Dropping the last handle on another thread waited for the queue to drain.
  EXPECT_EQ(ran.load(), 100);

  TaskGroup done;
  done.enter();
  {
    auto holder = std::make_shared<std::optional<WorkQueue>>(WorkQueue::create("test.self"));
    WorkQueue queue = **holder;
    queue.post([holder] { holder->reset(); });  // drops the last handle on the queue itself
    for (int i = 0; i < 10; ++i) {
      queue.post([&] { ran.fetch_add(1); });
    }
    queue.post([done] { done.leave(); });
  }
  ASSERT_TRUE(done.waitFor(10s));
  EXPECT_EQ(ran.load(), 110);
}

}  // namespace
}  // namespace halvex
