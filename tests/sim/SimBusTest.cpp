// SPDX-License-Identifier: MIT
// halvex-sim on a private bus, seen from a plain sd-bus client: it answers as its scenario says,
// logs what it receives, and fails in the ways it is asked to.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <regex>
#include <thread>

#include "platform/ServerProtocol.h"
#include "platform/linux/MessageCodec.h"
#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

constexpr std::uint64_t kCallTimeoutUsec = 10'000'000;

struct BusUnref {
  void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
struct MessageUnref {
  void operator()(sd_bus_message* m) const { sd_bus_message_unref(m); }
};
using MessagePtr = std::unique_ptr<sd_bus_message, MessageUnref>;

// A reply of the "isv" methods, or the D-Bus error that came instead.
struct Answer {
  std::string error;
  std::int32_t code = 0;
  MessageValue value;
};

class Client {
 public:
  Client() {
    sd_bus* raw = nullptr;
    if (sd_bus_open_system(&raw) < 0)
      throw std::runtime_error("cannot open the private bus");
    bus_.reset(raw);
  }
  sd_bus* bus() const { return bus_.get(); }

  MessagePtr newCall(const char* name, const char* member) const {
    // org.halvex.X lives at /org/halvex/X with interface org.halvex.X1.
    const std::string service = name;
    sd_bus_message* m = nullptr;
    std::string path = "/" + service;
    std::replace(path.begin(), path.end(), '.', '/');
    sd_bus_message_new_method_call(bus(), &m, name, path.c_str(), (service + "1").c_str(), member);
    sd_bus_message_set_auto_start(m, 0);
    return MessagePtr(m);
  }

  Answer call(MessagePtr call, const char* outSignature = "isv") const {
    sd_bus_error error = SD_BUS_ERROR_NULL;
    sd_bus_message* raw = nullptr;
    Answer answer;
    if (sd_bus_call(bus(), call.get(), kCallTimeoutUsec, &error, &raw) < 0) {
      answer.error = error.name ? error.name : "?";
      sd_bus_error_free(&error);
      return answer;
    }
    MessagePtr reply(raw);
    if (std::string(outSignature) == "isv") {
      const char* message = nullptr;
      EXPECT_GE(sd_bus_message_read(raw, "is", &answer.code, &message), 0);
      EXPECT_GE(bus::readVariant(raw, answer.value), 0);
    } else {
      MessageDict dict;
      EXPECT_GE(bus::readDict(raw, dict), 0);
      answer.value = MessageValue::dict(dict);
    }
    return answer;
  }

  Answer perform(const std::string& command, const MessageDict& request = {}) const {
    MessagePtr m = newCall("org.halvex.Server", "PerformCommand");
    sd_bus_message_append(m.get(), "ss", "test", command.c_str());
    bus::appendDict(m.get(), request);
    return call(std::move(m));
  }

  Answer helper(const std::string& command, const MessageDict& request = {}) const {
    MessagePtr m = newCall("org.halvex.Helper", "Perform");
    sd_bus_message_append(m.get(), "sis", "logdump.helper", 4, command.c_str());
    bus::appendDict(m.get(), request);
    return call(std::move(m));
  }

  // The events of the Subscribe reply, as "name=value" texts.
  std::vector<std::string> subscribe() const {
    MessagePtr m = newCall("org.halvex.Server", "Subscribe");
    sd_bus_message_append(m.get(), "s", "test");
    sd_bus_message* raw = nullptr;
    sd_bus_error error = SD_BUS_ERROR_NULL;
    std::vector<std::string> events;
    if (sd_bus_call(bus(), m.get(), kCallTimeoutUsec, &error, &raw) < 0) {
      sd_bus_error_free(&error);
      return {"error"};
    }
    MessagePtr reply(raw);
    sd_bus_message_enter_container(raw, 'a', "(sv)");
    while (sd_bus_message_enter_container(raw, 'r', "sv") > 0) {
      const char* name = nullptr;
      MessageValue payload;
      sd_bus_message_read(raw, "s", &name);
      bus::readVariant(raw, payload);
      sd_bus_message_exit_container(raw);
      events.push_back(std::string(name) + "=" + describe(payload));
    }
    return events;
  }

  // Sends PerformCommand without waiting; outcome becomes "answered" or the error's name.
  void performAsync(const char* command, std::string& outcome) const {
    MessagePtr m = newCall("org.halvex.Server", "PerformCommand");
    sd_bus_message_append(m.get(), "ssa{sv}", "test", command, 0);
    const auto done = [](sd_bus_message* reply, void* out, sd_bus_error*) {
      const sd_bus_error* e = sd_bus_message_get_error(reply);
      *static_cast<std::string*>(out) = e ? e->name : "answered";
      return 0;
    };
    EXPECT_GE(sd_bus_call_async(bus(), nullptr, m.get(), done, &outcome, kCallTimeoutUsec), 0);
  }

  // Serves this connection until done() holds or timeout passes; returns done().
  template <typename Done>
  bool serveUntil(Done done, std::chrono::milliseconds timeout) const {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!done() && std::chrono::steady_clock::now() < deadline) {
      if (sd_bus_process(bus(), nullptr) == 0)
        sd_bus_wait(bus(), 50'000);
    }
    return done();
  }

  // Collects Event signals from the server until count have come or timeout passes.
  std::vector<std::string> waitForEvents(std::size_t count, std::chrono::milliseconds timeout) {
    if (!matching_) {
      sd_bus_match_signal(bus(), nullptr, nullptr, "/org/halvex/Server", "org.halvex.Server1",
                          "Event", &Client::onEvent, &events_);
      matching_ = true;
    }
    serveUntil([&] { return events_.size() >= count; }, timeout);
    return events_;
  }

 private:
  static int onEvent(sd_bus_message* m, void* userdata, sd_bus_error*) {
    const char* name = nullptr;
    MessageValue payload;
    sd_bus_message_read(m, "s", &name);
    bus::readVariant(m, payload);
    static_cast<std::vector<std::string>*>(userdata)->push_back(std::string(name) + "=" +
                                                                describe(payload));
    return 0;
  }

  std::unique_ptr<sd_bus, BusUnref> bus_;
  std::vector<std::string> events_;
  bool matching_ = false;
};

MessageDict dumpRequest(const char* action, bool compression) {
  MessageDict request;
  request.set(kKeyTraceAction, MessageValue::string(action));
  request.set(kKeyTraceDumpStateReason, MessageValue::string("[test] reason"));
  request.set(kKeyTraceDumpStatePerformCompression, MessageValue::boolean(compression));
  return request;
}

MessageDict propertyRequest(const char* trace, const char* property) {
  MessageDict request;
  request.set(kKeyTraceName, MessageValue::string(trace));
  request.set(kKeyTracePropertyName, MessageValue::string(property));
  return request;
}

std::string stringAt(const MessageValue& value, const char* key) {
  const MessageDict* dict = value.asDict();
  return dict ? dict->getString(key, "<absent>") : "<not a dict>";
}

TEST(SimBus, DefaultScenarioIsAWorkingDevice) {
  PrivateBus bus;
  SimProcess sim(bus, "{}");
  Client client;

  const Answer identity = client.call(client.newCall("org.halvex.Device", "GetIdentity"), "a{sv}");
  EXPECT_EQ(describe(identity.value),
            R"({"RadioType": 1, "RadioVendor": 2, "ProductType": 0, "InternalBuild": true, )"
            R"("CarrierBuild": false, "VendorBuild": false, "TraceAllowed": true})");
  EXPECT_EQ(client.subscribe(),
            std::vector<std::string>{R"(ServerStateChange={"ServerState": "Started"})"});

  const Answer enabled =
      client.perform(kCommandGetTraceProperty, propertyRequest(kTraceBaseband, kKeyTraceEnabled));
  EXPECT_EQ(enabled.code, 0);
  EXPECT_EQ(stringAt(enabled.value, kKeyTracePropertyValue), "1");
  const Answer mode =
      client.perform(kCommandGetTraceProperty, propertyRequest(kTraceSystemLogs, kKeyTraceMode));
  EXPECT_EQ(stringAt(mode.value, kKeyTracePropertyValue), "0");
  const Answer unknown = client.perform(kCommandGetTraceProperty, propertyRequest("X", "Y"));
  EXPECT_EQ(stringAt(unknown.value, kKeyTracePropertyValue), "<absent>");

  const Answer dump =
      client.perform(kCommandTraceDumpState, dumpRequest(kCollectTelephonyLogs, true));
  EXPECT_EQ(dump.code, 0);
  // The current local time, %Y-%m-%d-%H-%M-%S.
  EXPECT_EQ(stringAt(dump.value, kKeyTimestampString).size(), 19U) << describe(dump.value);
  EXPECT_EQ(describe(client.perform("Unlisted").value), "{}");

  const Answer status = client.helper(helper::kCommandVarniskStatus);
  EXPECT_EQ(status.code, 0);
  EXPECT_EQ(stringAt(status.value, helper::kKeyTimestampString).size(), 19U);
}

// The opening tags of interface in introspection XML, attributes sorted: layout, comments and
// attribute order do not count, names, types, directions and order do.
std::vector<std::string> members(const std::string& xml, const std::string& interface) {
  const std::string text = std::regex_replace(xml, std::regex("<!--[^]*?-->"), "");
  const std::size_t begin = text.find("<interface name=\"" + interface + "\"");
  if (begin == std::string::npos)
    return {};
  const std::string body = text.substr(begin, text.find("</interface>", begin) - begin);
  const std::regex tag(R"(<(\w+)([^>]*)>)"), attribute(R"re(\w+="[^"]*")re");
  std::vector<std::string> tags;
  for (std::sregex_iterator t(body.begin(), body.end(), tag), last; t != last; ++t) {
    const std::string attributes = (*t)[2];
    std::vector<std::string> sorted(
        std::sregex_token_iterator(attributes.begin(), attributes.end(), attribute), {});
    std::sort(sorted.begin(), sorted.end());
    std::string line = (*t)[1];
    for (const std::string& a : sorted)
      line += " " + a;
    tags.push_back(line);
  }
  return tags;
}

TEST(SimBus, IntrospectionMatchesTheInstalledInterfaceFiles) {
  PrivateBus bus;
  SimProcess sim(bus, "{}");
  for (const std::string name : {"Server", "Helper", "Device", "Simulator"}) {
    const std::string interface = "org.halvex." + name + "1";
    std::ifstream file(std::string(HALVEX_INTERFACE_DIR) + "/" + interface + ".xml");
    const std::string xml{std::istreambuf_iterator<char>(file), {}};
    const RunResult live =
        bus.busctl({"introspect", "--xml-interface", "org.halvex." + name, "/org/halvex/" + name});
    ASSERT_EQ(live.status.describe(), "exit 0") << live.err;
    EXPECT_EQ(members(live.out, interface), members(xml, interface));
    EXPECT_GT(members(xml, interface).size(), 2U) << interface;
  }
}

TEST(SimBus, RepliesTakeTheShapeAndCodeTheScenarioGives) {
  PrivateBus bus;
  SimProcess sim(bus, R"({"server": {"commands": {
      "TraceDumpState": {"result": 3760250881, "reply": "dict", "timestamp": null},
      "AsNull": {"reply": "null"}, "AsString": {"reply": "string", "timestamp": "S"},
      "AsInt": {"reply": "int64", "result": -1}, "AsBool": {"reply": "bool"}},
    "properties": {"SystemLogs": {"Mode": {"value": "3", "reply": "string", "result": 2}}}},
    "helper": {"result": 9, "timestamp": null},
    "device": {"radio_vendor": 1, "internal_build": false}})");
  Client client;
  const struct {
    const char* command;
    std::int32_t code;
    std::string value;
  } cases[] = {
      // A null time stamp leaves it out even where the default puts one in.
      {kCommandTraceDumpState, static_cast<std::int32_t>(0xE020E001U), "{}"},
      {"AsNull", 0, "null"},
      {"AsString", 0, "\"S\""},
      {"AsInt", -1, "0"},
      {"AsBool", 0, "true"},
  };
  for (const auto& c : cases) {
    const Answer answer = client.perform(c.command);
    EXPECT_EQ(answer.error, "") << c.command;
    EXPECT_EQ(answer.code, c.code) << c.command;
    EXPECT_EQ(describe(answer.value), c.value) << c.command;
  }
  const Answer mode =
      client.perform(kCommandGetTraceProperty, propertyRequest(kTraceSystemLogs, kKeyTraceMode));
  EXPECT_EQ(mode.code, 2);
  EXPECT_EQ(describe(mode.value), "\"3\"");
  const Answer status = client.helper(helper::kCommandVarniskStatus);
  EXPECT_EQ(status.code, 9);
  EXPECT_EQ(describe(status.value), "{}");
  const Answer identity = client.call(client.newCall("org.halvex.Device", "GetIdentity"), "a{sv}");
  EXPECT_EQ(*identity.value.asDict()->get("RadioVendor"), MessageValue::int64(1));
  EXPECT_EQ(*identity.value.asDict()->get("InternalBuild"), MessageValue::boolean(false));
}

TEST(SimBus, AbsentServicesAndUnknownMethodsGetBusErrors) {
  PrivateBus bus;
  SimProcess sim(bus, R"({"server": {"present": false}, "device": {"present": false}})");
  Client client;
  EXPECT_EQ(client.perform(kCommandTraceDumpState).error,
            "org.freedesktop.DBus.Error.NameHasNoOwner");
  EXPECT_EQ(client.call(client.newCall("org.halvex.Device", "GetIdentity"), "a{sv}").error,
            "org.freedesktop.DBus.Error.NameHasNoOwner");
  EXPECT_EQ(client.call(client.newCall("org.halvex.Helper", "Explode")).error,
            "org.freedesktop.DBus.Error.UnknownMethod");
  // A request with a value outside the message types is refused, not half-read.
  MessagePtr bad = client.newCall("org.halvex.Helper", "Perform");
  sd_bus_message_append(bad.get(), "sisa{sv}", "s", 0, "C", 1, "K", "d", 1.5);
  EXPECT_EQ(client.call(std::move(bad)).error, "org.freedesktop.DBus.Error.InvalidArgs");
  EXPECT_EQ(sim.callControl("EmitState").status.code, 1);
  EXPECT_EQ(sim.callControl("Quit").status.describe(), "exit 0");
  EXPECT_EQ(sim.waitExit().describe(), "exit 0");
}

TEST(SimBus, RequestLogKeepsArrivalOrderAndKeyOrder) {
  PrivateBus bus;
  SimProcess sim(bus, "{}");
  Client client;
  MessageDict nested;
  nested.set("Inner", MessageValue::int64(7));
  MessageDict request = dumpRequest(kCollectBasebandLogs, false);
  request.set("Extra", MessageValue::dict(nested));
  client.perform(kCommandTraceDumpState, request);
  client.subscribe();
  client.call(client.newCall("org.halvex.Device", "GetIdentity"), "a{sv}");
  MessageDict timeout;
  timeout.set(helper::kKeyTimeout, MessageValue::int64(1500));
  client.helper(helper::kCommandVarniskStatus, timeout);

  // Keys within an entry in the order they came; the entry's own fields sorted by requestLog().
  const auto log = sim.requestLog();
  ASSERT_EQ(log.size(), 4U);
  EXPECT_EQ(log[0].dump(),
            R"({"client":"test","command":"TraceDumpState","keys":[)"
            R"({"key":"TraceAction","type":"string","value":"CollectBasebandLogs"},)"
            R"({"key":"TraceDumpStateReason","type":"string","value":"[test] reason"},)"
            R"({"key":"TraceDumpStatePerformCompression","type":"bool","value":false},)"
            R"({"key":"Extra","type":"dict","value":[{"key":"Inner","type":"int64","value":7}]}],)"
            R"("method":"PerformCommand","service":"server"})");
  EXPECT_EQ(log[1].dump(), R"({"client":"test","method":"Subscribe","service":"server"})");
  EXPECT_EQ(log[2].dump(), R"({"method":"GetIdentity","service":"device"})");
  EXPECT_EQ(log[3].dump(), R"({"client":"logdump.helper","command":"VarniskStatus","keys":[)"
                           R"({"key":"Timeout","type":"int64","value":1500}],"method":"Perform",)"
                           R"("service":"helper","task":4})");
}

TEST(SimBus, DelayedAnswerLeavesTheLoopFree) {
  PrivateBus bus;
  SimProcess sim(bus, R"({"server": {"commands": {"Slow": {"delay_ms": 800}}}})");
  Client client;
  const auto started = std::chrono::steady_clock::now();
  std::string slow;
  client.performAsync("Slow", slow);
  EXPECT_EQ(client.perform("Fast").code, 0);
  EXPECT_EQ(slow, "");
  EXPECT_LT(std::chrono::steady_clock::now() - started, 700ms);
  EXPECT_TRUE(client.serveUntil([&] { return !slow.empty(); }, 10s));
  EXPECT_EQ(slow, "answered");
  EXPECT_GE(std::chrono::steady_clock::now() - started, 800ms);
}

TEST(SimBus, ServerLeavingDropsUnansweredRequestsAndComesBack) {
  PrivateBus bus;
  SimProcess sim(bus, R"({"server": {"commands": {"Hang": {"fault": "never_answer"}}}})");
  Client client;
  std::string hang;
  client.performAsync("Hang", hang);
  // Calls from one connection arrive in order: once this is answered, Hang is held.
  EXPECT_EQ(client.perform("Any").error, "");
  ASSERT_EQ(sim.callControl("SetServerPresent", "b", {"false"}).status.code, 0);
  EXPECT_EQ(client.perform("Any").error, "org.freedesktop.DBus.Error.NameHasNoOwner");
  EXPECT_TRUE(client.serveUntil([&] { return !hang.empty(); }, 10s));
  EXPECT_EQ(hang, "org.freedesktop.DBus.Error.NoReply");

  ASSERT_EQ(sim.callControl("SetServerPresent", "b", {"true"}).status.code, 0);
  EXPECT_EQ(client.perform("Any").error, "");
  EXPECT_EQ(sim.callControl("SetServerPresent", "b", {"true"}).status.code, 0);
}

TEST(SimBus, StateEventArrivesWhenTheScenarioSays) {
  {
    PrivateBus bus;
    SimProcess sim(bus,
                   R"({"server": {"state": {"payload": "Up", "when": "after", "after_ms": 50}}})");
    Client client;
    client.waitForEvents(0, 0ms);  // match before subscribing
    EXPECT_TRUE(client.subscribe().empty());
    EXPECT_EQ(client.waitForEvents(1, 10s), std::vector<std::string>{R"(ServerStateChange="Up")"});
  }
  {
    PrivateBus bus;
    SimProcess sim(bus, R"({"server": {"state": {"when": "demand"}}})");
    Client client;
    client.waitForEvents(0, 0ms);
    EXPECT_TRUE(client.subscribe().empty());
    ASSERT_EQ(sim.callControl("EmitState").status.code, 0);
    ASSERT_EQ(sim.callControl("EmitEvent", "sv", {"Custom", "x", "42"}).status.code, 0);
    // A state without a payload sends null.
    EXPECT_EQ(client.waitForEvents(2, 10s),
              (std::vector<std::string>{"ServerStateChange=null", "Custom=42"}));
  }
}

TEST(SimBus, ServerAppearsLate) {
  PrivateBus bus;
  const auto started = std::chrono::steady_clock::now();
  SimProcess sim(bus, R"({"server": {"appear_after_ms": 600}})");
  Client client;
  EXPECT_EQ(client.perform("Any").error, "org.freedesktop.DBus.Error.NameHasNoOwner");
  std::string error = "not yet";
  while (!error.empty() && std::chrono::steady_clock::now() - started < 10s) {
    std::this_thread::sleep_for(20ms);
    error = client.perform("Any").error;
  }
  EXPECT_EQ(error, "");
  EXPECT_GE(std::chrono::steady_clock::now() - started, 600ms);
}

TEST(SimBus, FaultExitEndsTheSimulatorWithoutAnAnswer) {
  PrivateBus bus;
  SimProcess sim(bus, R"({"server": {"commands": {"TraceDumpState": {"fault": "exit"}}}})");
  Client client;
  EXPECT_EQ(client.perform(kCommandTraceDumpState, dumpRequest(kCollectTelephonyLogs, true)).error,
            "org.freedesktop.DBus.Error.NoReply");
  EXPECT_EQ(sim.waitExit().describe(), "exit 3");
  const auto log = sim.requestLog();
  ASSERT_EQ(log.size(), 1U);
  EXPECT_EQ(log[0]["command"], kCommandTraceDumpState);
}

TEST(SimBus, LogRootHoldsWhatTheToolWouldPrint) {
  PrivateBus bus;
  SimOptions options;
  options.logRoot = true;
  SimProcess sim(bus, R"({"device": {"radio_vendor": 1},
    "server": {"commands": {"TraceDumpState": {"timestamp": "T1"}}},
    "helper": {"timestamp": "H1"}})",
                 options);
  Client client;
  const std::string snapshot =
      sim.logRoot().string() + "/var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-";
  EXPECT_TRUE(fs::is_directory(sim.logRoot() / "var/wireless/Library/Logs/Halvex/DIAG.scratch"));

  ASSERT_EQ(client.perform(kCommandTraceDumpState, dumpRequest(kCollectTelephonyLogs, true)).code,
            0);
  const RunResult listing = runProcess({{"/usr/bin/tar", "tzf", snapshot + "T1.tar.gz"}, {}, {}});
  EXPECT_EQ(listing.status.describe(), "exit 0") << listing.err;
  EXPECT_NE(listing.out.find("log-bb-T1/summary.txt"), std::string::npos) << listing.out;

  ASSERT_EQ(client.perform(kCommandTraceDumpState, dumpRequest(kCollectBasebandLogs, false)).code,
            0);
  EXPECT_TRUE(fs::is_regular_file(snapshot + "T1-bb-trace/summary.txt"));
  ASSERT_EQ(client.helper(helper::kCommandVarniskStatus).code, 0);
  EXPECT_TRUE(fs::is_directory(snapshot + "H1-bb-trace"));
}

bool processAlive(const std::string& name) {
  for (const auto& entry : fs::directory_iterator("/proc")) {
    const std::string pid = entry.path().filename().string();
    if (pid.find_first_not_of("0123456789") != std::string::npos)
      continue;
    std::string comm, stat, argv0;
    std::getline(std::ifstream(entry.path() / "comm"), comm);
    std::getline(std::ifstream(entry.path() / "stat"), stat);
    std::getline(std::ifstream(entry.path() / "cmdline"), argv0, '\0');
    const bool zombie = stat.find(") Z") != std::string::npos;
    if (!zombie && comm == name.substr(0, 15) && fs::path(argv0).filename() == name)
      return true;
  }
  return false;
}

TEST(SimBus, KeepsNamedProcessesAliveWhileItRuns) {
  PrivateBus bus;
  const std::string shortName = "Tv" + std::to_string(::getpid());
  const std::string longName = "SimKeptProcessWithALongName" + std::to_string(::getpid());
  auto sim = std::make_unique<SimProcess>(
      bus, R"({"processes": [")" + shortName + R"(", ")" + longName + R"("]})");
  EXPECT_TRUE(processAlive(shortName));
  EXPECT_TRUE(processAlive(longName));
  // Even a simulator killed outright takes them along.
  sim->kill(SIGKILL);
  EXPECT_EQ(sim->waitExit().signal, SIGKILL);
  bool gone = false;
  for (int i = 0; i < 250 && !gone; ++i) {
    gone = !processAlive(shortName) && !processAlive(longName);
    if (!gone)
      std::this_thread::sleep_for(20ms);
  }
  EXPECT_TRUE(gone);
}

// The next datagram on a stand-in for the service manager's notification socket.
std::string nextNotification(int socket) {
  pollfd ready{socket, POLLIN, 0};
  char text[512];
  const ssize_t n = ::poll(&ready, 1, 10'000) == 1 ? ::recv(socket, text, sizeof text, 0) : -1;
  return n < 0 ? "(nothing)" : std::string(text, static_cast<std::size_t>(n));
}

TEST(SimBus, NotifiesTheServiceManagerAndEndsWithTheRightStatus) {
  // One simulator a bus: the control name is unique.
  PrivateBus bus, doomedBus;
  TempDir dir;
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const std::string socketPath = (dir.path() / "notify").string();
  socketPath.copy(address.sun_path, sizeof address.sun_path - 1);
  const int manager = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  ASSERT_EQ(::bind(manager, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  ::setenv("NOTIFY_SOCKET", socketPath.c_str(), 1);
  SimProcess stopped(bus, "{}");
  ::unsetenv("NOTIFY_SOCKET");
  SimProcess orphaned(doomedBus, "{}");
  EXPECT_THAT(nextNotification(manager),
              testing::StartsWith("READY=1\nSTATUS=Serving org.halvex.Simulator, "
                                  "org.halvex.Device, org.halvex.Helper, org.halvex.Server from "));
  stopped.kill(SIGTERM);
  EXPECT_EQ(stopped.waitExit().describe(), "exit 0");
  EXPECT_EQ(nextNotification(manager), "STOPPING=1");
  ::close(manager);
  doomedBus.stop();
  EXPECT_EQ(orphaned.waitExit().describe(), "exit 1");
}

TEST(SimCommandLine, AnswersInOneLineWithTheRightStatus) {
  TempDir dir;
  std::ofstream(dir.path() / "bad.json")
      << R"({"server": {"commands": {"TraceDumpState": {"result": "0"}}}})";
  std::ofstream(dir.path() / "broken.json") << "{\n  \"server\": \n";
  const std::string bad = (dir.path() / "bad.json").string();
  const std::string broken = (dir.path() / "broken.json").string();
  const std::string none = (dir.path() / "none.json").string();
  // "STATUS|STDOUT|STDERR"
  const auto run = [](std::vector<std::string> args) {
    args.insert(args.begin(), simPath());
    const RunResult result = runProcess({args, {}, {}});
    return result.status.describe() + "|" + result.out + "|" + result.err;
  };
  const auto usage = [](const std::string& problem) {
    return "exit 2||halvex-sim: " + problem + " (see --help)\n";
  };
  std::vector<std::pair<std::vector<std::string>, std::string>> cases = {
      {{"--scenario=" + bad},
       "exit 2||" + bad +
           ": /server/commands/TraceDumpState/result: expected an integer, got a string\n"},
      {{"--scenario", broken},
       "exit 2||" + broken +
           ": (top level): not valid JSON at line 3, column 1 (syntax error while parsing value - "
           "unexpected end of input; expected '[', '{', or a literal)\n"},
      {{"--scenario", none}, "exit 2||" + none + ": cannot be read: No such file or directory\n"},
      {{"--scenario", dir.path().string()},
       "exit 2||" + dir.path().string() + ": cannot be read: Is a directory\n"},
      {{"--version"}, "exit 0|halvex-sim " HALVEX_VERSION "\n|"},
      {{"--scenario", bad, "--bogus", "x"}, usage("unknown or ambiguous option --bogus")},
      {{"--help=x"}, usage("--help takes no value")},
      {{"-x"}, usage("unknown option -x")},
      {{"--log-root", "/tmp", "--scenario"}, usage("--scenario needs a value")},
      {{"--scenario", bad, "stray"}, usage("unexpected argument stray")},
      {{"--scenario", bad, "--ready-fd", "999"},
       usage("--ready-fd: 999 is not an open file descriptor")},
  };
  // Without --scenario the installed defaults are read, which a development machine lacks.
  if (!fs::exists(HALVEX_SIM_CONFIG_SCENARIO) && !fs::exists(HALVEX_SIM_DEFAULT_SCENARIO)) {
    cases.push_back(
        {{},
         "exit 2||halvex-sim: no --scenario given, and neither " HALVEX_SIM_CONFIG_SCENARIO
         " nor " HALVEX_SIM_DEFAULT_SCENARIO " exists\n"});
  }
  for (const auto& [args, expected] : cases)
    EXPECT_EQ(run(args), expected);
}

}  // namespace
}  // namespace halvex::test
