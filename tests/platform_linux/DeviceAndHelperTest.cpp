// SPDX-License-Identifier: MIT
// Device queries, the helper client and the host's own facts (processes, boot arguments).
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <thread>

#include "platform/DevicePropertyService.h"
#include "platform/DeviceQueries.h"
#include "platform/HelperClient.h"
#include "platform/ServerProtocol.h"
#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

std::string askDevice() {
  return std::to_string(device::getRadioType()) + " " + std::to_string(device::getRadioVendor()) +
         " " + std::to_string(device::getProductType()) + " " +
         std::to_string(device::isInternalBuild()) + std::to_string(device::isCarrierBuild()) +
         std::to_string(device::isVendorBuild()) + std::to_string(device::isTraceAllowed());
}

// The identity is asked once per process, but only an answer is kept: a host whose device
// service was missing, or whose bus restarted, must not read as "no baseband" for good.
TEST(DeviceIdentityTest, AskedOnceAndKeptOnlyWhenAnswered) {
  PrivateBus bus;
  {
    SimProcess sim(bus, R"({"device": {"present": false}})");
    EXPECT_EQ(askDevice(), "0 0 0 0000");
  }
  bus.restart();
  SimProcess sim(bus, R"({"device": {"radio_type": 7, "radio_vendor": 1, "product_type": 58,
      "internal_build": false, "carrier_build": true, "vendor_build": true,
      "trace_allowed": false}})");
  EXPECT_EQ(askDevice(), "7 1 58 0110");
  EXPECT_EQ(askDevice(), "7 1 58 0110");
  ASSERT_EQ(sim.requestLog().size(), 1u);
  EXPECT_EQ(sim.requestLog()[0].dump(), R"({"method":"GetIdentity","service":"device"})");
  bus.stop();
  EXPECT_EQ(askDevice(), "7 1 58 0110");
}

// The reply comes in as an empty dictionary and is left alone when the request fails.
TEST(HelperClientTest, PerformRunsTheCommandInTheService) {
  PrivateBus bus;
  MessageDict request;
  request.set(helper::kKeyTimeout, MessageValue::int64(1500));
  const struct {
    const char* scenario;
    const char* command;
    std::int32_t code;
    const char* reply;
  } cases[] = {
      {R"({"helper": {"timestamp": "H"}})", helper::kCommandVarniskStatus, 0,
       R"({"TimestampString": "H"})"},
      {R"({"helper": {"reply": "string", "timestamp": "S"}})", helper::kCommandVarniskStatus, 0,
       R"("S")"},
      {R"({"helper": {"result": 9}})", helper::kCommandVarniskStatus, 9, "{}"},
      {R"({"helper": {"present": false}})", helper::kCommandVarniskStatus, kResultServerNotRunning,
       "{}"},
      {R"({"helper": {"fault": "exit"}})", helper::kCommandVarniskStatus, kResultServerGone, "{}"},
      {"{}", "Bad\xff", kResultInvalidRequest, "{}"},
  };
  for (const auto& c : cases) {
    SimProcess sim(bus, c.scenario);
    auto helper = HelperClient::create("logdump.helper", nullptr);
    ASSERT_TRUE(helper);
    MessageValue reply = MessageValue::dict({});
    Result result = helper->perform(helper::kTaskDiagnosticsCollection, c.command, request, reply);
    EXPECT_EQ(result.code, c.code) << c.scenario << ": " << result.message;
    EXPECT_EQ(describe(reply), c.reply) << c.scenario;
    if (&c == &cases[0]) {
      EXPECT_EQ(sim.requestLog().at(0).dump(),
                R"({"client":"logdump.helper","command":"VarniskStatus","keys":[)"
                R"({"key":"Timeout","type":"int64","value":1500}],"method":"Perform",)"
                R"("service":"helper","task":4})");
    }
  }
}

TEST(HelperClientTest, OnlyPlainNamesNameAService) {
  const std::string tooLong(300, 'h');
  for (const char* name : {static_cast<const char*>(nullptr), "", "two words", "tab\there",
                           "del\x7f", "\xc3\xa9t\xc3\xa9", tooLong.c_str()}) {
    EXPECT_EQ(HelperClient::create(name, nullptr), nullptr) << (name ? name : "(null)");
  }
  EXPECT_NE(HelperClient::create("logdump.helper", nullptr), nullptr);
}

// Waits until isProcessRunning(name) says running, with a failsafe time-out.
bool becomes(bool running, const std::string& name) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(15);
  while (device::isProcessRunning(name) != running && std::chrono::steady_clock::now() < deadline)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  return device::isProcessRunning(name) == running;
}

// The simulator keeps the processes a scenario names, for as long as it runs.
TEST(ProcessCheckTest, FindsProcessesByTheirWholeName) {
  // Unique per test process, so that parallel tests cannot see each other's processes. The long
  // name is cut to 15 bytes in the kernel's view; the short one is not.
  const std::string pid = std::to_string(getpid());
  const std::string longName = "halvex-long-process-name-" + pid;
  const std::string shortName = "hx" + pid.substr(0, 8);
  EXPECT_FALSE(device::isProcessRunning(longName));
  PrivateBus bus;
  SimProcess sim(bus, R"({"processes": [")" + longName + R"(", ")" + shortName + R"("]})");
  EXPECT_TRUE(device::isProcessRunning(longName));
  EXPECT_TRUE(device::isProcessRunning(shortName));
  for (const std::string& wrong : {longName.substr(0, 15), longName + "x",
                                   shortName.substr(0, shortName.size() - 1), std::string()})
    EXPECT_FALSE(device::isProcessRunning(wrong)) << wrong;
  // Even a simulator killed outright takes them along.
  sim.kill(SIGKILL);
  EXPECT_EQ(sim.waitExit().signal, SIGKILL);
  EXPECT_TRUE(becomes(false, longName));
  EXPECT_TRUE(becomes(false, shortName));
  EXPECT_EQ(device::getProgramName(), "platform_linux_bus_test");
}

TEST(DevicePropertyTest, BootArgumentsAreTheKernelCommandLine) {
  std::string line;
  std::getline(std::ifstream("/proc/cmdline"), line);
  EXPECT_EQ(DevicePropertyService::create()->getPropertyMap()["boot-args"], line);
}

}  // namespace
}  // namespace halvex::test
