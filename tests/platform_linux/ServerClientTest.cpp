// SPDX-License-Identifier: MIT
// The server's client framework against halvex-sim on a private bus.
#include <gtest/gtest.h>
#include <systemd/sd-bus.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <future>
#include <map>
#include <optional>
#include <thread>

#include "detail/BusSupport.h"
#include "detail/ProcessBus.h"
#include "platform/Mutex.h"
#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "platform/linux/testing/BusTesting.h"
#include "tests/platform_linux/Descriptors.h"
#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

using client::Manager;
using namespace std::literals;
constexpr std::chrono::seconds kFailsafe{15};

// One delivery: a completion (name is the tag the test gave it) or an event (name is the event).
struct Delivery {
  std::string name;
  Result result;
  MessageValue value;
  bool onQueue = false;
};

class ManagerTest : public ::testing::Test {
 protected:
  // Starts the simulator, the run loop, the queue and the manager.
  // Anything that changes the environment must come before: this is where threads start.
  void start(const std::string& scenario, bool withLoop = true) {
    sim_.emplace(bus_, scenario);
    if (withLoop) {
      loop_.emplace();
    }
    queue_.emplace(WorkQueue::create("test.queue"));
    manager_ = client::CreateManager("halvextool", *queue_);
  }

  void add(Delivery delivery) EXCLUDES(mutex_) {
    delivery.onQueue = queue_->isCurrent();
    MutexLock lock(mutex_);
    mail_.push_back(std::move(delivery));
    changed_.notify_all();
  }
  client::Completion record(const std::string& tag) {
    return [this, tag](Result result, MessageValue reply) {
      add({tag, std::move(result), std::move(reply)});
    };
  }
  void listen(const std::string& event) {
    client::RegisterEventHandler(manager_, event, [this, event](MessageValue payload, TaskGroup) {
      add({event, {}, std::move(payload)});
    });
  }

  // The deliveries named name (any, when empty) so far.
  std::vector<Delivery> mail(const std::string& name = {}) {
    MutexLock lock(mutex_);
    return mailLocked(name);
  }
  // True once at least count deliveries named name have arrived.
  bool waitFor(std::size_t count, const std::string& name = {}) {
    const auto deadline = std::chrono::steady_clock::now() + kFailsafe;
    MutexLock lock(mutex_);
    while (mailLocked(name).size() < count) {
      if (!lock.waitUntil(changed_, deadline)) {
        return mailLocked(name).size() >= count;
      }
    }
    return true;
  }
  // True once everything posted to the queue before the call has run.
  bool drain() {
    std::promise<void> done;
    queue_->post([&done] { done.set_value(); });
    return done.get_future().wait_for(kFailsafe) == std::future_status::ready;
  }

  // The server states the state events told, in order.
  std::vector<std::string> states() {
    std::vector<std::string> out;
    for (const Delivery& event : mail(kEventServerStateChange)) {
      out.push_back(event.value.isDict() ? event.value.asDict()->getString(kKeyServerState)
                                         : describe(event.value));
    }
    return out;
  }

  // Returns once the server has received everything sent before: the run loop sends in the
  // order posted, and the server reads in order.
  bool barrier() {
    MessageValue reply;
    return client::PerformCommand(manager_, "Barrier", {}, reply).ok();
  }

  PrivateBus bus_;
  std::optional<bus::RunLoopThreadForTesting> loop_;
  std::optional<SimProcess> sim_;
  std::optional<WorkQueue> queue_;
  std::shared_ptr<Manager> manager_;

 private:
  std::vector<Delivery> mailLocked(const std::string& name) const REQUIRES(mutex_) {
    std::vector<Delivery> out;
    std::copy_if(mail_.begin(), mail_.end(), std::back_inserter(out),
                 [&](const Delivery& d) { return name.empty() || d.name == name; });
    return out;
  }

  Mutex mutex_;
  std::condition_variable changed_;
  std::vector<Delivery> mail_ GUARDED_BY(mutex_);
};

MessageDict sampleRequest() {
  MessageDict nested;
  nested.set("b", MessageValue::null());
  nested.set("a", MessageValue::string("inner"));
  MessageDict request;
  request.set("zulu", MessageValue::string("Grüße"));
  request.set("alpha", MessageValue::boolean(true));
  request.set("mike", MessageValue::int64(-42));
  request.set("nested", MessageValue::dict(nested));
  return request;
}

// Every request completes once, with its outcome: synchronously, or on the queue, even from a
// completion; a reply whatever its code; refused before it is sent when it cannot be; timed out
// by the platform's own bound, which not even sd-bus's "infinity" outlasts.
TEST_F(ManagerTest, RequestsCompleteOnceWithTheirOutcome) {
  ASSERT_EQ(setenv("SYSTEMD_BUS_TIMEOUT", "infinity", 1), 0);  // read once, before any thread
  bus::CallBounds bounds = bus::callBounds();
  bounds.otherCommand = std::chrono::milliseconds(300);
  bus::ScopedCallBoundsForTesting shorter(bounds);
  start(R"({"server": {"commands": {"TraceDumpState": {"timestamp": "20261122-101500"},
      "Refused": {"result": 7, "reply": "string", "timestamp": "kept"},
      "Hang": {"fault": "never_answer"}}}})");
  MessageValue reply = MessageValue::string("stale");
  Result result = client::PerformCommand(manager_, kCommandTraceDumpState, sampleRequest(), reply);
  ASSERT_TRUE(result.ok()) << result.message;
  EXPECT_EQ(describe(reply), R"({"TimestampString": "20261122-101500"})");
  EXPECT_EQ(sim_->requestLog().at(0)["keys"].dump(),
            R"([{"key":"zulu","type":"string","value":"Grüße"},)"
            R"({"key":"alpha","type":"bool","value":true},)"
            R"({"key":"mike","type":"int64","value":-42},)"
            R"({"key":"nested","type":"dict","value":[{"key":"b","type":"null","value":null},)"
            R"({"key":"a","type":"string","value":"inner"}]}])");
  const Result refused = client::PerformCommand(manager_, "Refused", {}, reply);
  EXPECT_EQ(refused.code, 7);
  EXPECT_EQ(refused.message, "simulated failure");
  EXPECT_EQ(reply, MessageValue::string("kept"));
  for (const std::string& command :
       {"Bad\xff"s, "Nul\0"s, ""s, std::string(bus::kMaxNameLength + 1, 'c')}) {
    EXPECT_EQ(client::PerformCommand(manager_, command, {}, reply).code, kResultInvalidRequest);
  }
  MessageDict badKey;
  badKey.set("\xff", MessageValue::null());
  EXPECT_EQ(client::PerformCommand(manager_, "Fine", badKey, reply).code, kResultInvalidRequest);
  EXPECT_EQ(sim_->requestLog().size(), 2u);
  const std::string longest(bus::kMaxNameLength, 'c');
  EXPECT_NE(client::PerformCommand(manager_, longest, {}, reply).code, kResultInvalidRequest);
  EXPECT_EQ(client::PerformCommand(manager_, "Hang", {}, reply).code, kResultTimeout);

  client::PerformCommand(manager_, kCommandTraceDumpState, record("async"), {});
  client::PerformCommand(manager_, "Hang", record("hang"), {});
  client::PerformCommand(manager_, "Bad\xff", record("unsendable"), {});
  client::PerformCommand(
      manager_, "Unlisted",
      [this](const Result&, const MessageValue&) {  // the queue waits, the run loop does not
        MessageValue inner;
        add({"nested", client::PerformCommand(manager_, kCommandTraceDumpState, {}, inner), inner});
      },
      {});
  ASSERT_TRUE(waitFor(4) && drain());
  EXPECT_EQ(mail().size(), 4u);
  for (const Delivery& done : mail()) {
    EXPECT_TRUE(done.onQueue) << done.name;
    EXPECT_EQ(done.value.isDict(), done.result.ok()) << done.name << ": " << done.result.message;
  }
  EXPECT_EQ(mail("async")[0].result.code, 0);
  EXPECT_EQ(mail("nested")[0].result.code, 0);
  EXPECT_EQ(mail("hang")[0].result.code, kResultTimeout);
  EXPECT_EQ(mail("unsendable")[0].result.code, kResultInvalidRequest);
}

// Whatever becomes of the run loop (never started, could not start, or stopped with requests
// out), every request ends once, on the queue, with its outcome, within its bound: callers then
// serve the connection themselves. A loop started later claims it again.
TEST_F(ManagerTest, EveryRequestEndsWhateverBecomesOfTheLoop) {
  bus::CallBounds bounds = bus::callBounds();
  bounds.otherCommand = std::chrono::milliseconds(300);
  bus::ScopedCallBoundsForTesting shorter(bounds);
  start(R"({"server": {"commands": {"Hang": {"fault": "never_answer"}}}})", false);
  for (const std::string fate : {"never started", "could not start", "stopped"}) {
    SCOPED_TRACE(fate);
    if (fate == "could not start") {
      if (*NoMoreDescriptors::impossible() != '\0') {
        continue;  // the same as "never started" once run() is back
      }
      NoMoreDescriptors exhausted;
      EXPECT_LT(bus::ProcessBus::instance().run(), 0);
    } else if (fate == "stopped") {
      loop_.emplace();
      client::PerformCommand(manager_, "Hang", record(fate), {});
      ASSERT_TRUE(barrier());
      loop_.reset();
      ASSERT_TRUE(waitFor(1, fate));
      EXPECT_EQ(mail(fate)[0].result.code, kResultConnectionLost);
    }
    client::PerformCommand(manager_, kCommandTraceDumpState, record(fate + " dump"), {});
    client::PerformCommand(manager_, "Hang", record(fate + " hang"), {});
    MessageValue reply;
    EXPECT_EQ(client::PerformCommand(manager_, "Hang", {}, reply).code, kResultTimeout);
    ASSERT_TRUE(waitFor(1, fate + " dump") && waitFor(1, fate + " hang") && drain());
    EXPECT_EQ(mail(fate + " dump")[0].result.code, 0);
    EXPECT_EQ(mail(fate + " hang")[0].result.code, kResultTimeout);
  }
  loop_.emplace();
  EXPECT_TRUE(barrier());
  ASSERT_TRUE(drain());
  EXPECT_EQ(mail().size(), *NoMoreDescriptors::impossible() == '\0' ? 7u : 5u);
  for (const Delivery& done : mail()) {
    EXPECT_EQ(done.onQueue, true) << done.name;
  }
}

// A server of our own, on its own thread: commands get the bus driver's error for an absent
// service, and Subscribe more events than a client takes, the state last.
class RogueServer {
 public:
  static constexpr int kListed = 300;
  static constexpr int kFlood = 1100;  // events a "Flood" command sends before its answer

  // True once it owns the name.
  bool ready() { return ready_.get_future().get(); }

 private:
  static int answer(sd_bus_message* call, void*, sd_bus_error*) {
    if (sd_bus_message_is_method_call(call, nullptr, "Subscribe") > 0) {
      sd_bus_message* reply = nullptr;
      sd_bus_message_new_method_return(call, &reply);
      sd_bus_message_open_container(reply, 'a', "(sv)");
      for (int i = 0; i + 1 < kListed; ++i) {
        sd_bus_message_append(reply, "(sv)", "Noise", "x", std::int64_t{i});
      }
      sd_bus_message_append(reply, "(sv)", "ServerStateChange", "a{sv}", 1, "ServerState", "s",
                            "Started");
      sd_bus_message_close_container(reply);
      int r = sd_bus_send(nullptr, reply, nullptr);
      sd_bus_message_unref(reply);
      return r;
    }
    if (sd_bus_message_is_method_call(call, nullptr, "PerformCommand") > 0 &&
        sd_bus_message_skip(call, "s") >= 0) {
      const char* command = nullptr;
      if (sd_bus_message_read(call, "s", &command) > 0 && std::string_view(command) == "Flood") {
        for (int i = 0; i < kFlood; ++i) {
          sd_bus_emit_signal(sd_bus_message_get_bus(call), "/org/halvex/Server",
                             "org.halvex.Server1", "Event", "sv", "Noise", "x", std::int64_t{i});
        }
      }
    }
    return sd_bus_reply_method_errorf(call, SD_BUS_ERROR_SERVICE_UNKNOWN, "not me");
  }
  std::promise<bool> ready_;
  std::jthread thread_{[this](const std::stop_token& stop) {
    sd_bus* bus = nullptr;
    bool ok = sd_bus_open_system(&bus) >= 0 &&
              sd_bus_add_object(bus, nullptr, "/org/halvex/Server", &answer, nullptr) >= 0 &&
              sd_bus_request_name(bus, "org.halvex.Server", 0) >= 0;
    ready_.set_value(ok);
    while (ok && !stop.stop_requested()) {
      if (sd_bus_process(bus, nullptr) == 0) {
        sd_bus_wait(bus, 50000);
      }
    }
    sd_bus_flush_close_unref(bus);
  }};
};

// No server, no bus, or the bus driver's word for it: nothing else means "not running". A rogue
// server can neither pass for an absent one nor drown the state in an overlong Subscribe reply.
TEST_F(ManagerTest, OnlyTheBusDriverSaysTheServerIsNotRunning) {
  start(R"({"server": {"present": false}})");
  MessageValue reply = MessageValue::string("stale");
  EXPECT_EQ(client::PerformCommand(manager_, "Any", {}, reply).code, kResultServerNotRunning);
  EXPECT_TRUE(reply.isNull());
  std::optional<RogueServer> rogue(std::in_place);
  ASSERT_TRUE(rogue->ready());
  reply = MessageValue::string("stale");
  EXPECT_EQ(client::PerformCommand(manager_, "Any", {}, reply).code, kResultBusError);
  EXPECT_TRUE(reply.isNull());
  listen("Noise");
  listen(kEventServerStateChange);
  client::EventsOn(manager_);
  ASSERT_TRUE(waitFor(1, kEventServerStateChange) && drain());
  EXPECT_EQ(states(), std::vector<std::string>{kServerStateStarted});
  EXPECT_EQ(mail("Noise").size(), 256u);
  // Events the queue has not taken yet are capped; the rest are dropped, not held.
  std::promise<void> release;
  queue_->post([gate = release.get_future().share()] { gate.wait(); });
  client::PerformCommand(manager_, "Flood", {}, reply);  // answered after its events
  release.set_value();
  ASSERT_TRUE(drain());
  EXPECT_EQ(mail("Noise").size(), 256u + 1024u);

  rogue.reset();
  bus_.stop();
  EXPECT_EQ(client::PerformCommand(manager_, "Any", {}, reply).code, kResultServerNotRunning);
  client::PerformCommand(manager_, "Any", record("async"), {});
  ASSERT_TRUE(waitFor(1, "async"));
  EXPECT_EQ(mail("async")[0].result.code, kResultServerNotRunning);
}

TEST_F(ManagerTest, PendingCallsAreBoundedAndEachCompletesOnceWhenTheManagerGoes) {
  start(R"({"server": {"commands": {"Hang": {"fault": "never_answer"}}}})");
  constexpr int kCalls = 1500;  // beyond what one manager keeps pending
  for (int i = 0; i < kCalls; ++i) {
    client::PerformCommand(manager_, "Hang", record(std::to_string(i)), {});
  }
  manager_.reset();
  ASSERT_TRUE(waitFor(kCalls) && drain());
  std::map<std::int32_t, int> codes;
  for (int i = 0; i < kCalls; ++i) {
    auto done = mail(std::to_string(i));
    ASSERT_EQ(done.size(), 1u) << i;
    ++codes[done[0].result.code];
  }
  EXPECT_GT(codes[kResultLimitsExceeded], 0);
  EXPECT_EQ(codes[kResultLimitsExceeded] + codes[kResultConnectionLost], kCalls);

  // Here the completion holds the last reference, so the manager goes on the queue itself.
  auto last = client::CreateManager("halvextool", *queue_);
  client::PerformCommand(last, "Any",
                         [this, keep = last](Result result, const MessageValue&) {
                           add({"last", std::move(result), {}});
                         },
                         {});
  last.reset();
  ASSERT_TRUE(waitFor(1, "last") && drain());
  EXPECT_EQ(mail().size(), kCalls + 1u);
}

TEST_F(ManagerTest, ManyThreadsShareOneManager) {
  start("{}");
  listen(kEventServerStateChange);
  constexpr std::size_t kThreads = 4, kCalls = 40;
  std::atomic<int> failures{0};
  {
    std::vector<std::jthread> callers;
    callers.reserve(kThreads);
    for (std::size_t t = 0; t < kThreads; ++t) {
      callers.emplace_back([&, t] {
        for (std::size_t i = 0; i < kCalls; ++i) {
          MessageValue reply;
          failures += !client::PerformCommand(manager_, "Sync", sampleRequest(), reply).ok();
          client::PerformCommand(manager_, "Async", record("async"), sampleRequest());
          // Switching delivery while calls fly must not disturb them.
          ((i + t) % 2 == 0 ? client::EventsOn : client::EventsOff)(manager_);
        }
      });
    }
  }
  EXPECT_EQ(failures.load(), 0);
  ASSERT_TRUE(waitFor(kThreads * kCalls, "async") && drain());
  EXPECT_EQ(mail("async").size(), kThreads * kCalls);
  for (const Delivery& done : mail("async")) {
    EXPECT_TRUE(done.result.ok() && done.onQueue) << done.result.message;
  }
}

// A server that comes late, reports its state late, leaves with a request unanswered, comes
// back, loses its bus and dies mid-request: the manager subscribes whenever it appears, of
// itself, and tells of its going.
TEST_F(ManagerTest, EventsFollowTheServerComingAndGoing) {
  const auto started = std::chrono::steady_clock::now();
  start(R"({"server": {"appear_after_ms": 300,
      "state": {"when": "after", "after_ms": 100, "payload": {"ServerState": "Started"}},
      "commands": {"Hang": {"fault": "never_answer"}, "Slow": {"delay_ms": 60000}}}})");
  listen(kEventServerStateChange);
  client::EventsOff(manager_);
  client::EventsOn(manager_);
  ASSERT_TRUE(waitFor(1, kEventServerStateChange));
  EXPECT_GE(std::chrono::steady_clock::now() - started, std::chrono::milliseconds(400));
  client::PerformCommand(manager_, "Hang", record("hang"), {});
  ASSERT_TRUE(barrier());
  ASSERT_EQ(sim_->callControl("SetServerPresent", "b", {"false"}).status.code, 0);
  ASSERT_TRUE(waitFor(1, "hang") && waitFor(2, kEventServerStateChange));
  ASSERT_EQ(sim_->callControl("SetServerPresent", "b", {"true"}).status.code, 0);
  ASSERT_TRUE(waitFor(3, kEventServerStateChange));
  ASSERT_EQ(sim_->callControl("EmitState").status.code, 0);
  ASSERT_TRUE(waitFor(4, kEventServerStateChange));
  // A delayed answer holds up neither the server nor the manager; a bus that goes completes it.
  client::PerformCommand(manager_, "Slow", record("slow"), {});
  ASSERT_TRUE(barrier());
  bus_.restart();
  ASSERT_TRUE(waitFor(1, "slow") && waitFor(5, kEventServerStateChange));
  sim_.reset();  // it ended with the old bus
  sim_.emplace(bus_, R"({"server": {"commands": {"Crash": {"fault": "exit"}}}})");
  ASSERT_TRUE(waitFor(6, kEventServerStateChange));
  client::PerformCommand(manager_, "Crash", record("crash"), {});
  ASSERT_TRUE(waitFor(1, "crash") && waitFor(7, kEventServerStateChange) && drain());
  EXPECT_EQ(mail("hang")[0].result.code, kResultServerGone);
  EXPECT_EQ(mail("slow")[0].result.code, kResultConnectionLost);
  EXPECT_EQ(mail("crash")[0].result.code, kResultServerGone);
  EXPECT_EQ(sim_->waitExit().describe(), "exit 3");
  EXPECT_EQ(states(), (std::vector<std::string>{kServerStateStarted, "Stopped", kServerStateStarted,
                                                kServerStateStarted, "Stopped", kServerStateStarted,
                                                "Stopped"}));
  for (const Delivery& delivery : mail()) {
    EXPECT_TRUE(delivery.onQueue) << delivery.name;
  }
}

// Events come only from the server's owner, and only while on: switching them off drops those
// already received but not yet delivered.
TEST_F(ManagerTest, EventsComeOnlyFromTheServerAndOnlyWhileOn) {
  start("{}");
  listen("Probe");
  listen(kEventServerStateChange);
  client::EventsOn(manager_);
  ASSERT_TRUE(waitFor(1, kEventServerStateChange));
  EXPECT_EQ(sim_->requestLog().at(0).dump(),
            R"({"client":"halvextool","method":"Subscribe","service":"server"})");
  const auto emit = [this](const char* text) {
    return sim_->callControl("EmitEvent", "sv", {"Probe", "s", text}).status.code;
  };
  auto sent = bus_.busctl({"emit", "/org/halvex/Server", "org.halvex.Server1", "Event", "sv",
                           "Probe", "s", "impostor"});
  ASSERT_EQ(sent.status.code, 0) << sent.err;
  ASSERT_EQ(sim_->callControl("EmitEvent", "sv", {"Unheard", "s", "x"}).status.code, 0);
  ASSERT_EQ(emit("genuine"), 0);
  ASSERT_TRUE(waitFor(1, "Probe") && barrier() && drain());
  ASSERT_EQ(mail("Probe").size(), 1u);
  EXPECT_EQ(mail("Probe")[0].value, MessageValue::string("genuine"));

  std::promise<void> release;
  queue_->post([gate = release.get_future().share()] { gate.wait(); });
  ASSERT_EQ(emit("dropped"), 0);
  // The simulator answers this after it sent the event, and our connection reads in order: once
  // the call returns, the event sits on the blocked queue.
  ASSERT_TRUE(barrier());
  client::EventsOff(manager_);
  release.set_value();
  ASSERT_TRUE(drain());
  EXPECT_EQ(mail("Probe").size(), 1u);

  client::EventsOn(manager_);
  ASSERT_TRUE(waitFor(2, kEventServerStateChange));
  ASSERT_EQ(emit("late"), 0);
  ASSERT_TRUE(waitFor(2, "Probe"));
  EXPECT_EQ(mail("Probe")[1].value, MessageValue::string("late"));
}

}  // namespace
}  // namespace halvex::test
