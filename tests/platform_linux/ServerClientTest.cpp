// SPDX-License-Identifier: MIT
// The server's client framework against halvex-sim on a private bus.
#include <gtest/gtest.h>
#include <systemd/sd-bus.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <optional>
#include <string_view>
#include <thread>

#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "platform/linux/testing/BusTesting.h"
#include "tests/platform_linux/BusTestSupport.h"
#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

using client::Manager;

class ManagerTest : public ::testing::Test {
 protected:
  // Starts the simulator (unless scenario is empty), the queue and the manager. Anything that
  // changes the environment must come before: this is where threads start.
  void start(const std::string& scenario) {
    if (!scenario.empty()) {
      sim_.emplace(bus_, scenario);
    }
    loop_.emplace();
    queue_.emplace(WorkQueue::create("test.queue"));
    manager_ = client::CreateManager("halvextool", *queue_);
  }

  client::Completion record(std::string tag) {
    return [this, tag](Result result, MessageValue reply) {
      mail_.add({tag, std::move(result), std::move(reply), queue_->isCurrent()});
    };
  }

  void listen(const std::string& event) {
    client::RegisterEventHandler(manager_, event, [this, event](MessageValue payload, TaskGroup) {
      Delivery delivery;
      delivery.name = event;
      delivery.value = std::move(payload);
      delivery.onQueue = queue_->isCurrent();
      mail_.add(std::move(delivery));
    });
  }

  std::vector<std::string> states() {
    std::vector<std::string> out;
    for (const Delivery& event : mail_.all(kEventServerStateChange)) {
      const MessageDict* payload = event.value.asDict();
      out.push_back(payload ? payload->getString(kKeyServerState, "?") : describe(event.value));
    }
    return out;
  }

  // Waits until the simulator has logged a request for command.
  bool requested(const std::string& command) {
    auto deadline = std::chrono::steady_clock::now() + kFailsafe;
    while (std::chrono::steady_clock::now() < deadline) {
      for (const auto& entry : sim_->requestLog()) {
        if (entry.value("command", "") == command) {
          return true;
        }
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
  }

  PrivateBus bus_;
  std::optional<bus::RunLoopThreadForTesting> loop_;
  std::optional<SimProcess> sim_;
  Mailbox mail_;
  std::optional<WorkQueue> queue_;
  std::shared_ptr<Manager> manager_;
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
  request.set("empty", MessageValue::null());
  return request;
}

TEST_F(ManagerTest, RoundTripsDeliverRepliesOnTheQueue) {
  start(R"({"server": {"commands": {"TraceDumpState": {"timestamp": "20261122-101500"}}}})");
  MessageValue reply = MessageValue::string("stale");
  Result result = client::PerformCommand(manager_, kCommandTraceDumpState, {}, reply);
  ASSERT_TRUE(result.ok()) << result.message;
  ASSERT_TRUE(reply.isDict()) << describe(reply);
  EXPECT_EQ(reply.asDict()->getString(kKeyTimestampString), "20261122-101500");

  client::PerformCommand(manager_, kCommandTraceDumpState, record("async"), {});
  // A completion may itself make a synchronous call: the queue waits, the I/O thread does not.
  client::PerformCommand(manager_, "Unlisted",
                         [this](Result, MessageValue) {
                           MessageValue inner;
                           Result nested =
                               client::PerformCommand(manager_, kCommandTraceDumpState, {}, inner);
                           mail_.add({"nested", nested, inner, queue_->isCurrent()});
                         },
                         {});
  ASSERT_TRUE(mail_.waitFor(1, "async") && mail_.waitFor(1, "nested"));
  ASSERT_TRUE(drain(*queue_));
  for (const Delivery& done : mail_.all()) {
    EXPECT_TRUE(done.onQueue) << done.name;
    EXPECT_TRUE(done.result.ok()) << done.name << ": " << done.result.message;
    ASSERT_TRUE(done.value.isDict()) << done.name;
    EXPECT_EQ(done.value.asDict()->getString(kKeyTimestampString), "20261122-101500");
  }
  EXPECT_EQ(mail_.count(), 2u);
}

TEST_F(ManagerTest, RepliesOfEveryShapeAndServerCodesComeThrough) {
  start(R"({"server": {"commands": {
      "Null": {"reply": "null"}, "Text": {"reply": "string"}, "Number": {"reply": "int64"},
      "Flag": {"reply": "bool"}, "Dict": {"reply": "dict"},
      "Refused": {"result": 7, "reply": "dict"}}}})");
  const struct {
    const char* command;
    std::int32_t code;
    MessageValue::Kind kind;
  } cases[] = {
      {"Null", 0, MessageValue::Kind::kNull},    {"Text", 0, MessageValue::Kind::kString},
      {"Number", 0, MessageValue::Kind::kInt64}, {"Flag", 0, MessageValue::Kind::kBool},
      {"Dict", 0, MessageValue::Kind::kDict},    {"Unlisted", 0, MessageValue::Kind::kDict},
      {"Refused", 7, MessageValue::Kind::kDict},  // whatever the server sent, whatever its code
  };
  for (const auto& c : cases) {
    MessageValue reply = MessageValue::string("stale");
    Result result = client::PerformCommand(manager_, c.command, {}, reply);
    EXPECT_EQ(result.code, c.code) << c.command << ": " << result.message;
    EXPECT_EQ(reply.kind(), c.kind) << c.command << ": " << describe(reply);
  }
}

// The simulator's log lists keys as {"key", "type", "value"}, nested dictionaries as lists.
void expectLogged(const nlohmann::json& logged, const MessageDict& sent, const std::string& where) {
  ASSERT_TRUE(logged.is_array()) << where;
  ASSERT_EQ(logged.size(), sent.size()) << where;
  std::size_t i = 0;
  for (const auto& [key, value] : sent.entries()) {
    const nlohmann::json& entry = logged[i++];
    EXPECT_EQ(entry.value("key", ""), key) << where;
    static const char* const kTypes[] = {"null", "string", "int64", "bool", "dict"};
    EXPECT_EQ(entry.value("type", ""), kTypes[static_cast<int>(value.kind())]) << where << key;
    if (const MessageDict* dict = value.asDict()) {
      expectLogged(entry["value"], *dict, where + "." + key);
    } else if (value.isString()) {
      EXPECT_EQ(entry["value"], *value.asString()) << where << key;
    } else if (value.isInt64()) {
      EXPECT_EQ(entry["value"], *value.asInt64()) << where << key;
    } else if (value.isBool()) {
      EXPECT_EQ(entry["value"], *value.asBool()) << where << key;
    }
  }
}

TEST_F(ManagerTest, RequestKeysArriveInTheirOrder) {
  start("{}");
  MessageValue reply;
  ASSERT_TRUE(client::PerformCommand(manager_, "Ordered", sampleRequest(), reply).ok());
  auto log = sim_->requestLog();
  ASSERT_EQ(log.size(), 1u);
  EXPECT_EQ(log[0].value("client", ""), "halvextool");
  EXPECT_EQ(log[0].value("command", ""), "Ordered");
  expectLogged(log[0]["keys"], sampleRequest(), "request");
}

TEST_F(ManagerTest, RequestsThatCannotBeSentFailLocally) {
  start("{}");
  MessageDict badKey;
  badKey.set("\xff", MessageValue::null());
  const struct {
    std::string command;
    MessageDict request;
  } cases[] = {{"Bad\xff", {}},
               {std::string("Nul\0", 4), {}},
               {"", {}},
               {std::string(300, 'c'), {}},
               {"Fine", badKey}};
  for (const auto& c : cases) {
    MessageValue reply;
    EXPECT_EQ(client::PerformCommand(manager_, c.command, c.request, reply).code,
              kResultInvalidRequest);
  }
  EXPECT_TRUE(sim_->requestLog().empty());
}

// A server of our own that owns the server's name and misbehaves: PerformCommand "Garbage" gets a
// plain string (no method of the protocol returns one), "Impostor" the bus driver's error name for
// an absent service, and Subscribe lists more events than a client takes, its state last. Its
// connection lives on its own thread.
class RogueServer {
 public:
  static constexpr int kListed = 300;

  RogueServer() {
    thread_ = std::thread([this] {
      sd_bus* bus = nullptr;
      bool ok = sd_bus_open_system(&bus) >= 0 &&
                sd_bus_add_object(bus, nullptr, "/org/halvex/Server", &answer, nullptr) >= 0 &&
                sd_bus_request_name(bus, "org.halvex.Server", 0) >= 0;
      ready_.set_value(ok);
      while (ok && !stop_) {
        if (sd_bus_process(bus, nullptr) == 0) {
          sd_bus_wait(bus, 50000);
        }
      }
      sd_bus_flush_close_unref(bus);
    });
  }
  ~RogueServer() {
    stop_ = true;
    thread_.join();
  }
  bool ready() { return ready_.get_future().get(); }

 private:
  static int answer(sd_bus_message* call, void*, sd_bus_error*) {
    if (sd_bus_message_is_method_call(call, nullptr, "Subscribe") > 0) {
      sd_bus_message* reply = nullptr;
      sd_bus_message_new_method_return(call, &reply);
      sd_bus_message_open_container(reply, 'a', "(sv)");
      for (int i = 0; i < kListed; ++i) {
        if (i + 1 < kListed) {
          sd_bus_message_append(reply, "(sv)", "Noise", "x", std::int64_t{i});
        } else {
          sd_bus_message_append(reply, "(sv)", "ServerStateChange", "a{sv}", 1, "ServerState", "s",
                                "Started");
        }
      }
      sd_bus_message_close_container(reply);
      int r = sd_bus_send(nullptr, reply, nullptr);
      sd_bus_message_unref(reply);
      return r;
    }
    const char* client = nullptr;
    const char* command = nullptr;
    sd_bus_message_read(call, "ss", &client, &command);
    if (command != nullptr && std::string_view(command) == "Impostor") {
      return sd_bus_reply_method_errorf(call, SD_BUS_ERROR_SERVICE_UNKNOWN, "not me");
    }
    return sd_bus_reply_method_return(call, "s", "garbage");
  }
  std::promise<bool> ready_;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

TEST_F(ManagerTest, OnlyTheBusDriverSaysTheServerIsNotRunning) {
  start(R"({"server": {"present": false}})");
  RogueServer server;
  ASSERT_TRUE(server.ready());
  const struct {
    const char* command;
    std::int32_t code;
  } cases[] = {{"Garbage", kResultBadReply}, {"Impostor", kResultBusError}};
  for (const auto& c : cases) {
    MessageValue reply = MessageValue::string("stale");
    EXPECT_EQ(client::PerformCommand(manager_, c.command, {}, reply).code, c.code) << c.command;
    EXPECT_TRUE(reply.isNull()) << c.command;
  }
}

TEST_F(ManagerTest, AnOverlongSubscribeReplyStillDeliversTheState) {
  start(R"({"server": {"present": false}})");
  RogueServer server;
  ASSERT_TRUE(server.ready());
  listen("Noise");
  listen(kEventServerStateChange);
  client::EventsOn(manager_);
  ASSERT_TRUE(mail_.waitFor(1, kEventServerStateChange));
  ASSERT_TRUE(drain(*queue_));
  EXPECT_EQ(states(), std::vector<std::string>{kServerStateStarted});
  EXPECT_EQ(mail_.count("Noise"), 256u);
}

TEST_F(ManagerTest, AbsentServerAndAbsentBusAreNotRunning) {
  start(R"({"server": {"present": false}})");
  MessageValue reply = MessageValue::string("stale");
  EXPECT_EQ(client::PerformCommand(manager_, "Any", {}, reply).code, kResultServerNotRunning);
  EXPECT_TRUE(reply.isNull());
  bus_.stop();
  EXPECT_EQ(client::PerformCommand(manager_, "Any", {}, reply).code, kResultServerNotRunning);
  client::PerformCommand(manager_, "Any", record("async"), {});
  ASSERT_TRUE(mail_.waitFor(1));
  EXPECT_EQ(mail_.all()[0].result.code, kResultServerNotRunning);
}

TEST_F(ManagerTest, ServerThatDiesMidRequestIsGone) {
  start(R"({"server": {"commands": {"Crash": {"fault": "exit"}}}})");
  listen(kEventServerStateChange);
  client::EventsOn(manager_);
  ASSERT_TRUE(mail_.waitFor(1, kEventServerStateChange));
  client::PerformCommand(manager_, "Crash", record("crash"), {});
  ASSERT_TRUE(mail_.waitFor(1, "crash"));
  EXPECT_EQ(mail_.all("crash")[0].result.code, kResultServerGone);
  ASSERT_TRUE(mail_.waitFor(2, kEventServerStateChange));
  EXPECT_EQ(states(), (std::vector<std::string>{kServerStateStarted, "Stopped"}));
}

// The bounds are the platform's own: not even sd-bus's default of "infinity" outlasts them.
TEST_F(ManagerTest, UnansweredCallsTimeOutWhateverTheEnvironmentSays) {
  ASSERT_EQ(setenv("SYSTEMD_BUS_TIMEOUT", "infinity", 1), 0);  // read once, before any thread
  bus::CallBounds bounds = bus::callBounds();
  bounds.otherCommand = std::chrono::milliseconds(300);
  bus::ScopedCallBoundsForTesting shorter(bounds);
  start(R"({"server": {"commands": {"Hang": {"fault": "never_answer"}}}})");
  MessageValue reply;
  EXPECT_EQ(client::PerformCommand(manager_, "Hang", {}, reply).code, kResultTimeout);
  client::PerformCommand(manager_, "Hang", record("async"), {});
  ASSERT_TRUE(mail_.waitFor(1));
  EXPECT_EQ(mail_.all()[0].result.code, kResultTimeout);
}

TEST_F(ManagerTest, LosingOurConnectionCompletesPendingCalls) {
  start(R"({"server": {"commands": {"Slow": {"delay_ms": 60000}}}})");
  listen(kEventServerStateChange);
  client::EventsOn(manager_);
  ASSERT_TRUE(mail_.waitFor(1, kEventServerStateChange));
  client::PerformCommand(manager_, "Slow", record("slow"), {});
  ASSERT_TRUE(requested("Slow"));
  bus_.stop();
  ASSERT_TRUE(mail_.waitFor(1, "slow"));
  EXPECT_EQ(mail_.all("slow")[0].result.code, kResultConnectionLost);
  ASSERT_TRUE(mail_.waitFor(2, kEventServerStateChange));
  EXPECT_EQ(states(), (std::vector<std::string>{kServerStateStarted, "Stopped"}));
}

// Nothing but the manager's own retries brings it back: no command is sent after the restart.
TEST_F(ManagerTest, EventsResumeByThemselvesAfterTheBusRestarts) {
  start("{}");
  listen(kEventServerStateChange);
  client::EventsOn(manager_);
  ASSERT_TRUE(mail_.waitFor(1, kEventServerStateChange));
  bus_.restart();
  ASSERT_TRUE(mail_.waitFor(2, kEventServerStateChange));
  sim_.reset();  // it ended with the old bus
  sim_.emplace(bus_, "{}");
  ASSERT_TRUE(mail_.waitFor(3, kEventServerStateChange));
  ASSERT_TRUE(drain(*queue_));
  EXPECT_EQ(states(),
            (std::vector<std::string>{kServerStateStarted, "Stopped", kServerStateStarted}));
}

TEST_F(ManagerTest, DestroyingAManagerCompletesWhatIsPending) {
  start(R"({"server": {"commands": {"Slow": {"fault": "never_answer"}}}})");
  client::PerformCommand(manager_, "Slow", record("dropped"), {});
  ASSERT_TRUE(requested("Slow"));
  manager_.reset();
  ASSERT_TRUE(mail_.waitFor(1, "dropped"));
  EXPECT_EQ(mail_.all("dropped")[0].result.code, kResultConnectionLost);

  // Here the completion holds the last reference, so the manager goes on the queue itself.
  auto last = client::CreateManager("halvextool", *queue_);
  client::PerformCommand(last, "Any",
                         [this, keep = last](Result result, MessageValue reply) {
                           mail_.add({"last", result, reply, true});
                         },
                         {});
  last.reset();
  ASSERT_TRUE(mail_.waitFor(1, "last"));
  ASSERT_TRUE(drain(*queue_));
  EXPECT_EQ(mail_.count(), 2u);
}

TEST_F(ManagerTest, PendingCallsAreBoundedAndEachCompletesOnce) {
  start(R"({"server": {"commands": {"Hang": {"fault": "never_answer"}}}})");
  constexpr int kCalls = 1500;  // beyond what one manager keeps pending
  for (int i = 0; i < kCalls; ++i) {
    client::PerformCommand(manager_, "Hang", record(std::to_string(i)), {});
  }
  manager_.reset();
  ASSERT_TRUE(mail_.waitFor(kCalls));
  ASSERT_TRUE(drain(*queue_));
  std::map<std::int32_t, int> codes;
  for (int i = 0; i < kCalls; ++i) {
    auto done = mail_.all(std::to_string(i));
    ASSERT_EQ(done.size(), 1u) << i;
    ++codes[done[0].result.code];
  }
  EXPECT_GT(codes[kResultLimitsExceeded], 0);
  EXPECT_EQ(codes[kResultLimitsExceeded] + codes[kResultConnectionLost], kCalls);
}

TEST_F(ManagerTest, ManyThreadsShareOneManager) {
  start("{}");
  listen(kEventServerStateChange);
  constexpr int kThreads = 4;
  constexpr int kCalls = 40;
  std::vector<std::thread> callers;
  std::atomic<int> failures{0};
  for (int t = 0; t < kThreads; ++t) {
    callers.emplace_back([&, t] {
      for (int i = 0; i < kCalls; ++i) {
        MessageValue reply;
        if (!client::PerformCommand(manager_, "Sync", sampleRequest(), reply).ok()) {
          ++failures;
        }
        client::PerformCommand(manager_, "Async", record("async"), sampleRequest());
        // Switching delivery while calls fly must not disturb them.
        if ((i + t) % 2 == 0) {
          client::EventsOn(manager_);
        } else {
          client::EventsOff(manager_);
        }
      }
    });
  }
  for (std::thread& caller : callers) {
    caller.join();
  }
  EXPECT_EQ(failures.load(), 0);
  ASSERT_TRUE(mail_.waitFor(kThreads * kCalls, "async"));
  ASSERT_TRUE(drain(*queue_));
  EXPECT_EQ(mail_.count("async"), static_cast<std::size_t>(kThreads * kCalls));
  for (const Delivery& done : mail_.all("async")) {
    EXPECT_TRUE(done.result.ok() && done.onQueue) << done.result.message;
  }
}

TEST_F(ManagerTest, EventsFollowTheServerComingAndGoing) {
  start(R"({"server": {"present": false}})");
  listen(kEventServerStateChange);
  client::EventsOff(manager_);
  client::EventsOn(manager_);
  const char* const steps[] = {"true", "false", "true"};
  std::size_t expected = 0;
  for (const char* present : steps) {
    ASSERT_TRUE(sim_->callControl("SetServerPresent", "b", {present}).status.exited);
    ASSERT_TRUE(mail_.waitFor(++expected, kEventServerStateChange)) << present;
  }
  ASSERT_TRUE(drain(*queue_));
  EXPECT_EQ(states(),
            (std::vector<std::string>{kServerStateStarted, "Stopped", kServerStateStarted}));
  for (const Delivery& event : mail_.all()) {
    EXPECT_TRUE(event.onQueue);
  }
}

TEST_F(ManagerTest, EventsFromAnyoneButTheServerAreIgnored) {
  start("{}");
  listen("Probe");
  listen(kEventServerStateChange);
  client::EventsOn(manager_);
  ASSERT_TRUE(mail_.waitFor(1, kEventServerStateChange));
  auto sent = bus_.busctl({"emit", "/org/halvex/Server", "org.halvex.Server1", "Event", "sv",
                           "Probe", "s", "impostor"});
  ASSERT_EQ(sent.status.code, 0) << sent.err;
  ASSERT_EQ(sim_->callControl("EmitEvent", "sv", {"Probe", "s", "genuine"}).status.code, 0);
  ASSERT_TRUE(mail_.waitFor(1, "Probe"));
  ASSERT_TRUE(drain(*queue_));
  auto probes = mail_.all("Probe");
  ASSERT_EQ(probes.size(), 1u);
  EXPECT_EQ(probes[0].value, MessageValue::string("genuine"));
}

TEST_F(ManagerTest, EventsOffDropsEventsNotYetDelivered) {
  start("{}");
  listen("Probe");
  listen(kEventServerStateChange);
  client::EventsOn(manager_);
  ASSERT_TRUE(mail_.waitFor(1, kEventServerStateChange));

  std::promise<void> release;
  queue_->post([gate = release.get_future().share()] { gate.wait(); });
  ASSERT_EQ(sim_->callControl("EmitEvent", "sv", {"Probe", "s", "early"}).status.code, 0);
  // The simulator answers this after it sent the event, and our connection reads in order: once
  // the call returns, the event sits on the blocked queue.
  MessageValue reply;
  ASSERT_TRUE(client::PerformCommand(manager_, "Barrier", {}, reply).ok());
  client::EventsOff(manager_);
  release.set_value();
  ASSERT_TRUE(drain(*queue_));
  EXPECT_EQ(mail_.count("Probe"), 0u);

  client::EventsOn(manager_);
  ASSERT_TRUE(mail_.waitFor(2, kEventServerStateChange));
  ASSERT_EQ(sim_->callControl("EmitEvent", "sv", {"Probe", "s", "late"}).status.code, 0);
  ASSERT_TRUE(mail_.waitFor(1, "Probe"));
  EXPECT_EQ(mail_.all("Probe")[0].value, MessageValue::string("late"));
}

}  // namespace
}  // namespace halvex::test
