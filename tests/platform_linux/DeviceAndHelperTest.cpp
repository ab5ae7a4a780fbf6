// SPDX-License-Identifier: MIT
// Device queries, the helper client and the host's own facts (processes, boot arguments).
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/DevicePropertyService.h"
#include "platform/DeviceQueries.h"
#include "platform/HelperClient.h"
#include "platform/ServerProtocol.h"
#include "tests/platform_linux/BusTestSupport.h"
#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

struct Identity {
  int radio, vendor, product;
  bool internal, carrier, vendorBuild, trace;
  bool operator==(const Identity&) const = default;
};

Identity askDevice() {
  return {device::getRadioType(),    device::getRadioVendor(), device::getProductType(),
          device::isInternalBuild(), device::isCarrierBuild(), device::isVendorBuild(),
          device::isTraceAllowed()};
}

// The identity is asked once per process, but only an answer is kept: a host whose device
// service was missing, or whose bus restarted, must not read as "no baseband" for good.
TEST(DeviceIdentityTest, AskedOnceAndKeptOnlyWhenAnswered) {
  PrivateBus bus;
  const Identity none{0, 0, 0, false, false, false, false};
  const Identity device{7, 1, 58, false, true, true, false};
  {
    SimProcess sim(bus, R"({"device": {"present": false}})");
    EXPECT_EQ(askDevice(), none);
  }
  bus.restart();
  SimProcess sim(bus, R"({"device": {"radio_type": 7, "radio_vendor": 1, "product_type": 58,
      "internal_build": false, "carrier_build": true, "vendor_build": true,
      "trace_allowed": false}})");
  EXPECT_EQ(askDevice(), device);
  EXPECT_EQ(askDevice(), device);
  EXPECT_EQ(sim.requestLog().size(), 1u);
  bus.stop();
  EXPECT_EQ(askDevice(), device);
}

TEST(HelperClientTest, PerformRunsTheCommandInTheService) {
  PrivateBus bus;
  SimProcess sim(bus, R"({"helper": {"timestamp": "20261122-090000"}})");
  auto helper = HelperClient::create("logdump.helper", nullptr);
  ASSERT_TRUE(helper);
  MessageDict request;
  request.set(helper::kKeyTimeout, MessageValue::int64(1500));
  MessageValue reply = MessageValue::dict({});
  Result result = helper->perform(helper::kTaskDiagnosticsCollection, helper::kCommandVarniskStatus,
                                  request, reply);
  ASSERT_TRUE(result.ok()) << result.message;
  ASSERT_TRUE(reply.isDict());
  EXPECT_EQ(reply.asDict()->getString(helper::kKeyTimestampString), "20261122-090000");

  auto log = sim.requestLog();
  ASSERT_EQ(log.size(), 1u);
  EXPECT_EQ(log[0].value("service", ""), "helper");
  EXPECT_EQ(log[0].value("client", ""), "logdump.helper");
  EXPECT_EQ(log[0].value("task", -1), 4);
  EXPECT_EQ(log[0].value("command", ""), helper::kCommandVarniskStatus);
  ASSERT_EQ(log[0]["keys"].size(), 1u);
  EXPECT_EQ(log[0]["keys"][0].value("key", ""), helper::kKeyTimeout);
  EXPECT_EQ(log[0]["keys"][0].value("value", 0), 1500);
}

TEST(HelperClientTest, FailuresLeaveTheReplyAlone) {
  PrivateBus bus;
  const struct {
    const char* scenario;
    const char* command;
    std::int32_t code;
  } cases[] = {
      {R"({"helper": {"result": 9}})", helper::kCommandVarniskStatus, 9},
      {R"({"helper": {"present": false}})", helper::kCommandVarniskStatus, kResultServerNotRunning},
      {R"({"helper": {"fault": "exit"}})", helper::kCommandVarniskStatus, kResultServerGone},
      {R"({"helper": {"reply": "string"}})", helper::kCommandVarniskStatus, 0},
      {"{}", "Bad\xff", kResultInvalidRequest},
  };
  for (const auto& c : cases) {
    SimProcess sim(bus, c.scenario);
    auto helper = HelperClient::create("logdump.helper", nullptr);
    ASSERT_TRUE(helper);
    MessageValue reply = MessageValue::dict({});
    Result result = helper->perform(helper::kTaskDiagnosticsCollection, c.command, {}, reply);
    EXPECT_EQ(result.code, c.code) << c.scenario << ": " << result.message;
    EXPECT_EQ(reply.isDict(), c.code != 0) << c.scenario << ": " << describe(reply);
  }
}

TEST(HelperClientTest, OnlyPlainNamesNameAService) {
  const std::string tooLong(300, 'h');
  const char* const refused[] = {
      nullptr, "", "two words", "tab\there", "del\x7f", "\xc3\xa9t\xc3\xa9", tooLong.c_str()};
  for (const char* name : refused) {
    EXPECT_EQ(HelperClient::create(name, nullptr), nullptr) << (name ? name : "(null)");
  }
  EXPECT_NE(HelperClient::create("logdump.helper", nullptr), nullptr);
}

bool becomes(bool wanted, const std::function<bool()>& check) {
  auto deadline = std::chrono::steady_clock::now() + kFailsafe;
  while (check() != wanted) {
    if (std::chrono::steady_clock::now() > deadline) {
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return true;
}

TEST(ProcessCheckTest, FindsProcessesByTheirWholeName) {
  TempDir dir;
  // Unique per test process, so that parallel tests cannot see each other's processes. The long
  // name is cut to 15 bytes in the kernel's view; the short one is not.
  const std::string pid = std::to_string(getpid());
  const std::string longName = "halvex-long-process-name-" + pid;
  const std::string shortName = "hx" + pid.substr(0, 8);
  for (const std::string& name : {longName, shortName}) {
    std::filesystem::create_symlink("/bin/sleep", dir.path() / name);
  }
  EXPECT_FALSE(device::isProcessRunning(longName));
  pid_t longChild = spawnChild({(dir.path() / longName).string(), "60"});
  pid_t shortChild = spawnChild({(dir.path() / shortName).string(), "60"});
  EXPECT_TRUE(becomes(true, [&] { return device::isProcessRunning(longName); }));
  EXPECT_TRUE(becomes(true, [&] { return device::isProcessRunning(shortName); }));
  EXPECT_FALSE(device::isProcessRunning(longName.substr(0, 15)));
  EXPECT_FALSE(device::isProcessRunning(longName + "x"));
  EXPECT_FALSE(device::isProcessRunning(shortName.substr(0, shortName.size() - 1)));
  EXPECT_FALSE(device::isProcessRunning(""));
  kill(longChild, SIGKILL);
  waitChild(longChild, kFailsafe);
  EXPECT_FALSE(device::isProcessRunning(longName));
  kill(shortChild, SIGKILL);
  waitChild(shortChild, kFailsafe);
  EXPECT_EQ(device::getProgramName(), "platform_linux_bus_test");
}

TEST(DevicePropertyTest, BootArgumentsAreTheKernelCommandLine) {
  std::ifstream file("/proc/cmdline");
  std::string line;
  std::getline(file, line);
  auto properties = DevicePropertyService::create()->getPropertyMap();
  ASSERT_TRUE(properties.count("boot-args"));
  EXPECT_EQ(properties["boot-args"], line);
}

}  // namespace
}  // namespace halvex::test
