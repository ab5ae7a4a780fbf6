// SPDX-License-Identifier: MIT
// In-process test doubles of every platform service: the device queries, the device-property
// service, the system log, the server's client framework and the helper client.
//
// Linking halvex_platform_fake instead of a host backend routes every platform call here. A test
// sets the answers through FakePlatform::get(), runs the code under test, and then reads the
// journal of calls, in the order they were made, to assert that a query was or was NOT made.
// Asynchronous completions and events run on the real WorkQueue of the manager they belong to.
//
// All members are thread-safe. Answers are read at the moment of each call, so a test may change
// them between calls. Test-only: never link this into the tool.
#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/MessageDict.h"
#include "platform/Result.h"
#include "platform/ServerProtocol.h"
#include "platform/SystemLog.h"

namespace halvex::fake {

// What a fake server or helper answers to one request.
struct Answer {
  Result result;
  MessageValue reply;
};

struct ServerRequest {
  std::string client;
  std::string command;
  MessageDict request;
  bool asynchronous = false;
};

struct HelperRequest {
  std::string service;
  helper::TaskID task = helper::kTaskGeneral;
  std::string command;
  MessageDict request;
};

struct LogLine {
  std::string subsystem;
  std::string category;
  LogLevel level = LogLevel::kInfo;
  std::string message;
};

struct Device {
  int radioType = 1;
  int radioVendor = 1;
  int productType = 0;
  bool internalBuild = false;
  bool carrierBuild = false;
  bool vendorBuild = false;
  bool traceAllowed = true;
  std::set<std::string> runningProcesses;
  std::string programName = "halvextool";
  std::map<std::string, std::string> properties;
};

class FakePlatform {
 public:
  using ServerResponder = std::function<Answer(const std::string& command, const MessageDict&)>;
  using HelperResponder =
      std::function<Answer(helper::TaskID, const std::string& command, const MessageDict&)>;

  // The one fake of the process. It starts from the defaults, to which reset() returns it: a
  // device with radio type 1, vendor 1, nothing running, no server or helper answers.
  static FakePlatform& get();

  // Back to the defaults: every answer, hold and record goes, and deliverEvent() no longer posts
  // to the managers created so far. For a test's set-up; closures already posted to a queue
  // still run.
  void reset();

  void setDevice(Device device);
  Device device() const;

  // Every platform call so far, in order, as "name" or "name:argument", for example
  // "getRadioType", "isProcessRunning:Telvane", "PerformCommand:TraceDumpState",
  // "HelperClient::create:logdump.helper", "EventsOn".
  std::vector<std::string> calls() const;
  // How many recorded calls are exactly entry.
  std::size_t count(std::string_view entry) const;
  void clearCalls();

  // Server. Without a responder every command fails with kResultServerNotRunning.
  void setServerResponder(ServerResponder responder);
  std::vector<ServerRequest> serverRequests() const;

  // Events delivered to a manager, on its queue, each time EventsOn is called on it.
  void setEventsOnDelivery(std::vector<std::pair<std::string, MessageValue>> events);
  // Delivers an event now to every manager whose events are on and that has a handler for it.
  // Returns how many handlers it was posted to.
  std::size_t deliverEvent(const std::string& event, const MessageValue& payload);

  // While held, asynchronous completions are kept back instead of being posted to their queue;
  // releaseCompletions() posts them, in order, and returns how many it posted.
  void holdCompletions(bool hold);
  std::size_t releaseCompletions();

  // Helper. Without a responder every command fails with kResultServerNotRunning.
  // With creatable false, HelperClient::create returns null.
  void setHelperResponder(HelperResponder responder);
  void setHelperCreatable(bool creatable);
  std::vector<HelperRequest> helperRequests() const;

  std::vector<LogLine> logLines() const;

  // Forgets the server and helper requests and the log lines recorded so far, as clearCalls()
  // does the calls, so that a long run (a fuzzer's) does not keep every one.
  void clearRequests();

  // Used by the fake services themselves.
  struct Impl;
  Impl& impl();

 private:
  FakePlatform();
  std::unique_ptr<Impl> impl_;
};

}  // namespace halvex::fake
