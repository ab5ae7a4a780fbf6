// SPDX-License-Identifier: MIT
// The table of calls out, on a clock the test turns: deadlines, the outcome each call ends with,
// and what the system log gets. No bus.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "detail/PendingCalls.h"

namespace halvex::bus {
namespace {

std::uint64_t gNow = 0;

class RecordingLog : public LogServer {
 public:
  void write(const LogContext& context, LogLevel level, std::string_view message) override {
    entries.push_back(context.category() + (level == LogLevel::kDebug ? " debug " : " warning ") +
                      std::string(message));
  }
  std::vector<std::string> entries;
};

class PendingCallsTest : public ::testing::Test {
 protected:
  // Adds a call named label that records its outcome as "label:code" (or "label:reply").
  void add(const std::string& label, std::chrono::microseconds bound, const void* owner = nullptr,
           const char* category = "server") {
    calls_.insert(calls_.start(
        bound, category, label,
        [this, label](const Result& failure, sd_bus_message* reply) {
          outcomes_.push_back(label + ":" + (reply ? "reply" : std::to_string(failure.code)));
          return failure;
        },
        owner));
  }

  std::shared_ptr<RecordingLog> log_ = std::make_shared<RecordingLog>();
  LogOutbox outbox_{log_};
  PendingCalls calls_{[] { return gNow; }, outbox_};
  std::vector<std::string> outcomes_;
};

using std::chrono::milliseconds;

// Each call ends once, at its deadline at the latest, with the outcome that ended it; the log
// gets each entry once it is flushed, naming the call, its code and how long it took.
TEST_F(PendingCallsTest, EveryCallEndsOnceByItsDeadline) {
  const int owner = 0;
  gNow = 1'000'000;
  add("late", milliseconds(300));
  add("early", milliseconds(100));
  add("owned", milliseconds(500), &owner);
  add("unlogged", milliseconds(200), nullptr, nullptr);
  EXPECT_EQ(calls_.earliestDeadline(), 1'100'000u);
  gNow += 99'999;
  calls_.expire();
  EXPECT_TRUE(outcomes_.empty());
  gNow += 1;
  calls_.expire();
  EXPECT_EQ(calls_.earliestDeadline(), 1'200'000u);
  calls_.finishOwned(&owner, {kResultConnectionLost, "client closed"});
  calls_.finishOwned(&owner, {kResultConnectionLost, "again"});
  gNow += 150'000;
  calls_.expire();
  EXPECT_FALSE(calls_.empty());
  calls_.finishAll({kResultConnectionLost, ""});
  calls_.finishAll({kResultConnectionLost, "again"});
  EXPECT_TRUE(calls_.empty());
  EXPECT_EQ(calls_.earliestDeadline(), UINT64_MAX);
  const std::string timeout = std::to_string(kResultTimeout);
  const std::string lost = std::to_string(kResultConnectionLost);
  EXPECT_EQ(outcomes_, (std::vector<std::string>{"early:" + timeout, "owned:" + lost,
                                                 "unlogged:" + timeout, "late:" + lost}));
  EXPECT_TRUE(log_->entries.empty());
  outbox_.flush();
  EXPECT_EQ(log_->entries,
            (std::vector<std::string>{
                "server warning early: code 0xE020E003 in 100.000 ms: no answer within 100 ms",
                "server warning owned: code 0xE020E004 in 100.000 ms: client closed",
                "server warning late: code 0xE020E004 in 250.000 ms"}));
}

// A call answered in time leaves the table for good: its deadline passes unnoticed. A handler may
// send anew while the table ends calls; the new call is not ended with them.
TEST_F(PendingCallsTest, AnsweredCallsLeaveAndHandlersMaySendAnew) {
  gNow = 0;
  add("answered", milliseconds(10));
  add("first", milliseconds(10));
  calls_.insert(calls_.start(
      milliseconds(10), "helper", "resending",
      [this](const Result& failure, sd_bus_message*) {
        add("sent anew", milliseconds(10));
        return failure;
      },
      nullptr));
  auto answered = calls_.take(1);
  ASSERT_NE(answered, nullptr);
  EXPECT_EQ(calls_.take(1), nullptr);
  gNow = 2'500;
  calls_.finish(std::move(answered), Result{}, nullptr);
  gNow = 20'000;
  calls_.expire();
  EXPECT_EQ(outcomes_,
            (std::vector<std::string>{"answered:0", "first:" + std::to_string(kResultTimeout)}));
  EXPECT_EQ(calls_.earliestDeadline(), 30'000u);
  outbox_.flush();
  EXPECT_EQ(log_->entries.at(0), "server debug answered: code 0x00000000 in 2.500 ms");
  EXPECT_EQ(log_->entries.at(2).substr(0, 36), "helper warning resending: code 0xE02");
}

}  // namespace
}  // namespace halvex::bus
