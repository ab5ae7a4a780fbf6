// SPDX-License-Identifier: MIT
#include "platform/fake/FakePlatform.h"

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <mutex>
#include <utility>

#include "platform/DevicePropertyService.h"
#include "platform/DeviceQueries.h"
#include "platform/HelperClient.h"
#include "platform/RunLoop.h"
#include "platform/ServerClient.h"

namespace halvex::client {

class Manager {
 public:
  Manager(std::string clientName, WorkQueue callbackQueue)
      : client(std::move(clientName)), queue(std::move(callbackQueue)) {}

  const std::string client;
  const WorkQueue queue;
  // Guarded by the platform's mutex.
  std::map<std::string, EventHandler> handlers;
  bool eventsOn = false;
  // Bumped by EventsOff so that events already posted to the queue are dropped.
  std::uint64_t generation = 0;
};

}  // namespace halvex::client

namespace halvex::fake {

// Everything reset() puts back to its start. Not in an anonymous namespace: Impl derives from it.
struct FakeState {
  Device device;
  std::vector<std::string> calls;
  FakePlatform::ServerResponder serverResponder;
  std::vector<ServerRequest> serverRequests;
  std::vector<std::pair<std::string, MessageValue>> eventsOnDelivery;
  bool holding = false;
  std::vector<std::pair<WorkQueue, WorkQueue::Closure>> heldCompletions;
  FakePlatform::HelperResponder helperResponder;
  bool helperCreatable = true;
  std::vector<HelperRequest> helperRequests;
  std::vector<LogLine> logLines;
  // The managers deliverEvent() posts to.
  std::vector<std::shared_ptr<client::Manager>> managers;
};

struct FakePlatform::Impl : FakeState {
  mutable std::mutex mutex;
  // Managers from before the last reset(). A manager lives as long as the process, as with the
  // real framework, which keeps each one reachable from its registered handlers.
  std::vector<std::shared_ptr<client::Manager>> retired;

  void record(std::string entry) {
    std::lock_guard lock(mutex);
    calls.push_back(std::move(entry));
  }

  template <typename T>
  T read(T Device::*field, const char* name) {
    std::lock_guard lock(mutex);
    calls.emplace_back(name);
    return device.*field;
  }

  // Posts handler(payload) for event to manager's queue; the caller holds the mutex.
  void postEventLocked(const std::shared_ptr<client::Manager>& manager, const std::string& event,
                       const MessageValue& payload) {
    auto found = manager->handlers.find(event);
    if (found == manager->handlers.end()) {
      return;
    }
    manager->queue.post(
        [this, manager, handler = found->second, payload, generation = manager->generation] {
          {
            std::lock_guard lock(mutex);
            if (!manager->eventsOn || manager->generation != generation) {
              return;
            }
          }
          handler(payload, TaskGroup());
        });
  }
};

namespace {

Answer notRunning() {
  return {Result{kResultServerNotRunning, "no fake responder"}, {}};
}

}  // namespace

FakePlatform::FakePlatform() : impl_(std::make_unique<Impl>()) {}

FakePlatform& FakePlatform::get() {
  // Never destroyed: queues and handlers may still run while the process exits.
  static auto* const platform = new FakePlatform();
  return *platform;
}

void FakePlatform::reset() {
  FakeState old;
  {
    std::lock_guard lock(impl_->mutex);
    old = std::exchange(static_cast<FakeState&>(*impl_), FakeState());
    std::move(old.managers.begin(), old.managers.end(), std::back_inserter(impl_->retired));
  }
  // The old closures and queues go here, outside the lock their threads may take.
}

FakePlatform::Impl& FakePlatform::impl() {
  return *impl_;
}

void FakePlatform::setDevice(Device device) {
  std::lock_guard lock(impl_->mutex);
  impl_->device = std::move(device);
}

Device FakePlatform::device() const {
  std::lock_guard lock(impl_->mutex);
  return impl_->device;
}

std::vector<std::string> FakePlatform::calls() const {
  std::lock_guard lock(impl_->mutex);
  return impl_->calls;
}

std::size_t FakePlatform::count(std::string_view entry) const {
  std::lock_guard lock(impl_->mutex);
  return static_cast<std::size_t>(std::count(impl_->calls.begin(), impl_->calls.end(), entry));
}

void FakePlatform::clearCalls() {
  std::lock_guard lock(impl_->mutex);
  impl_->calls.clear();
}

void FakePlatform::setServerResponder(ServerResponder responder) {
  std::lock_guard lock(impl_->mutex);
  impl_->serverResponder = std::move(responder);
}

std::vector<ServerRequest> FakePlatform::serverRequests() const {
  std::lock_guard lock(impl_->mutex);
  return impl_->serverRequests;
}

void FakePlatform::setEventsOnDelivery(std::vector<std::pair<std::string, MessageValue>> events) {
  std::lock_guard lock(impl_->mutex);
  impl_->eventsOnDelivery = std::move(events);
}

std::size_t FakePlatform::deliverEvent(const std::string& event, const MessageValue& payload) {
  std::lock_guard lock(impl_->mutex);
  std::size_t posted = 0;
  for (const auto& manager : impl_->managers) {
    if (manager->eventsOn && manager->handlers.count(event) != 0) {
      impl_->postEventLocked(manager, event, payload);
      ++posted;
    }
  }
  return posted;
}

void FakePlatform::holdCompletions(bool hold) {
  std::lock_guard lock(impl_->mutex);
  impl_->holding = hold;
}

std::size_t FakePlatform::releaseCompletions() {
  std::vector<std::pair<WorkQueue, WorkQueue::Closure>> held;
  {
    std::lock_guard lock(impl_->mutex);
    held.swap(impl_->heldCompletions);
  }
  for (auto& [queue, closure] : held) {
    queue.post(std::move(closure));
  }
  return held.size();
}

void FakePlatform::setHelperResponder(HelperResponder responder) {
  std::lock_guard lock(impl_->mutex);
  impl_->helperResponder = std::move(responder);
}

void FakePlatform::setHelperCreatable(bool creatable) {
  std::lock_guard lock(impl_->mutex);
  impl_->helperCreatable = creatable;
}

std::vector<HelperRequest> FakePlatform::helperRequests() const {
  std::lock_guard lock(impl_->mutex);
  return impl_->helperRequests;
}

std::vector<LogLine> FakePlatform::logLines() const {
  std::lock_guard lock(impl_->mutex);
  return impl_->logLines;
}

void FakePlatform::clearRequests() {
  std::lock_guard lock(impl_->mutex);
  impl_->serverRequests.clear();
  impl_->helperRequests.clear();
  impl_->logLines.clear();
}

}  // namespace halvex::fake

// The platform interfaces, answered by the fake.

namespace {

halvex::fake::FakePlatform::Impl& fakeImpl() {
  return halvex::fake::FakePlatform::get().impl();
}

}  // namespace

namespace halvex::device {

int getRadioType() {
  return fakeImpl().read(&fake::Device::radioType, "getRadioType");
}
int getRadioVendor() {
  return fakeImpl().read(&fake::Device::radioVendor, "getRadioVendor");
}
int getProductType() {
  return fakeImpl().read(&fake::Device::productType, "getProductType");
}
bool isInternalBuild() {
  return fakeImpl().read(&fake::Device::internalBuild, "isInternalBuild");
}
bool isCarrierBuild() {
  return fakeImpl().read(&fake::Device::carrierBuild, "isCarrierBuild");
}
bool isVendorBuild() {
  return fakeImpl().read(&fake::Device::vendorBuild, "isVendorBuild");
}
bool isTraceAllowed() {
  return fakeImpl().read(&fake::Device::traceAllowed, "isTraceAllowed");
}

bool isProcessRunning(const std::string& name) {
  auto& impl = fakeImpl();
  std::lock_guard lock(impl.mutex);
  impl.calls.push_back("isProcessRunning:" + name);
  return impl.device.runningProcesses.count(name) != 0;
}

std::string getProgramName() {
  return fakeImpl().read(&fake::Device::programName, "getProgramName");
}

}  // namespace halvex::device

namespace halvex {

namespace {

class FakePropertyService final : public DevicePropertyService {
 public:
  std::map<std::string, std::string> getPropertyMap() override {
    return fakeImpl().read(&fake::Device::properties, "getPropertyMap");
  }
};

class FakeLogServer final : public LogServer {
 public:
  void write(const LogContext& context, LogLevel level, std::string_view message) override {
    auto& impl = fakeImpl();
    std::lock_guard lock(impl.mutex);
    impl.logLines.push_back({context.subsystem(), context.category(), level, std::string(message)});
  }
};

class FakeHelperClient final : public HelperClient {
 public:
  explicit FakeHelperClient(std::string service) : service_(std::move(service)) {}

  Result perform(helper::TaskID task, const char* command, MessageDict request,
                 MessageValue& reply) override {
    auto& impl = fakeImpl();
    fake::FakePlatform::HelperResponder responder;
    {
      std::lock_guard lock(impl.mutex);
      impl.calls.push_back(std::string("HelperClient::perform:") + command);
      impl.helperRequests.push_back({service_, task, command, request});
      responder = impl.helperResponder;
    }
    fake::Answer answer = responder ? responder(task, command, request) : fake::notRunning();
    if (answer.result.ok()) {
      reply = std::move(answer.reply);
    }
    return answer.result;
  }

 private:
  std::string service_;
};

}  // namespace

std::shared_ptr<DevicePropertyService> DevicePropertyService::create() {
  fakeImpl().record("DevicePropertyService::create");
  return std::make_shared<FakePropertyService>();
}

std::shared_ptr<LogServer> LogServer::create() {
  fakeImpl().record("LogServer::create");
  return std::make_shared<FakeLogServer>();
}

std::shared_ptr<HelperClient> HelperClient::create(const char* serviceName,
                                                   std::shared_ptr<LogServer> /*logger*/) {
  auto& impl = fakeImpl();
  std::lock_guard lock(impl.mutex);
  impl.calls.push_back(std::string("HelperClient::create:") + serviceName);
  if (!impl.helperCreatable) {
    return nullptr;
  }
  return std::make_shared<FakeHelperClient>(serviceName);
}

}  // namespace halvex

namespace halvex::client {

std::shared_ptr<Manager> CreateManager(const std::string& clientName, WorkQueue queue) {
  auto& impl = fakeImpl();
  auto manager = std::make_shared<Manager>(clientName, std::move(queue));
  std::lock_guard lock(impl.mutex);
  impl.calls.push_back("CreateManager:" + clientName);
  impl.managers.push_back(manager);
  return manager;
}

void RegisterEventHandler(const std::shared_ptr<Manager>& manager, const std::string& event,
                          EventHandler handler) {
  auto& impl = fakeImpl();
  std::lock_guard lock(impl.mutex);
  impl.calls.push_back("RegisterEventHandler:" + event);
  manager->handlers[event] = std::move(handler);
}

void EventsOff(const std::shared_ptr<Manager>& manager) {
  auto& impl = fakeImpl();
  std::lock_guard lock(impl.mutex);
  impl.calls.emplace_back("EventsOff");
  manager->eventsOn = false;
  ++manager->generation;
}

void EventsOn(const std::shared_ptr<Manager>& manager) {
  auto& impl = fakeImpl();
  std::lock_guard lock(impl.mutex);
  impl.calls.emplace_back("EventsOn");
  manager->eventsOn = true;
  for (const auto& [event, payload] : impl.eventsOnDelivery) {
    impl.postEventLocked(manager, event, payload);
  }
}

namespace {

fake::Answer answerServer(const std::shared_ptr<Manager>& manager, const std::string& command,
                          const MessageDict& request, bool asynchronous) {
  auto& impl = fakeImpl();
  fake::FakePlatform::ServerResponder responder;
  {
    std::lock_guard lock(impl.mutex);
    impl.calls.push_back("PerformCommand:" + command);
    impl.serverRequests.push_back({manager->client, command, request, asynchronous});
    responder = impl.serverResponder;
  }
  return responder ? responder(command, request) : fake::notRunning();
}

}  // namespace

Result PerformCommand(const std::shared_ptr<Manager>& manager, const std::string& command,
                      const MessageDict& request, MessageValue& reply) {
  fake::Answer answer = answerServer(manager, command, request, false);
  reply = answer.result.ok() ? std::move(answer.reply) : MessageValue();
  return answer.result;
}

void PerformCommand(const std::shared_ptr<Manager>& manager, const std::string& command,
                    Completion completion, const MessageDict& request) {
  fake::Answer answer = answerServer(manager, command, request, true);
  WorkQueue::Closure deliver = [completion = std::move(completion),
                                answer = std::move(answer)]() mutable {
    completion(answer.result, answer.result.ok() ? answer.reply : MessageValue());
  };
  auto& impl = fakeImpl();
  {
    std::lock_guard lock(impl.mutex);
    if (impl.holding) {
      impl.heldCompletions.emplace_back(manager->queue, std::move(deliver));
      return;
    }
  }
  manager->queue.post(std::move(deliver));
}

}  // namespace halvex::client

namespace halvex::platform {

void runMainLoop() {
  fakeImpl().record("runMainLoop");
}

}  // namespace halvex::platform
