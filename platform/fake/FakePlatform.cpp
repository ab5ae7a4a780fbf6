// SPDX-License-Identifier: MIT
#include "platform/fake/FakePlatform.h"

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <utility>

#include "platform/DevicePropertyService.h"
#include "platform/DeviceQueries.h"
#include "platform/HelperClient.h"
#include "platform/Mutex.h"
#include "platform/RunLoop.h"
#include "platform/ServerClient.h"

namespace halvex::client {

class Manager {
 public:
  Manager(std::string clientName, WorkQueue callbackQueue)
      : client(std::move(clientName)), queue(std::move(callbackQueue)) {}

  const std::string client;
  const WorkQueue queue;
  // Taken after the platform's, when both are.
  Mutex mutex;
  std::map<std::string, EventHandler> handlers GUARDED_BY(mutex);
  bool eventsOn GUARDED_BY(mutex) = false;
  // Bumped by EventsOff so that events already posted to the queue are dropped.
  std::uint64_t generation GUARDED_BY(mutex) = 0;
};

}  // namespace halvex::client

namespace halvex::fake {

// Everything reset() puts back to its start.
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

struct FakePlatform::Impl {
  mutable Mutex mutex;
  FakeState state GUARDED_BY(mutex);
  // Managers from before the last reset(). A manager lives as long as the process, as with the
  // real framework, which keeps each one reachable from its registered handlers.
  std::vector<std::shared_ptr<client::Manager>> retired GUARDED_BY(mutex);

  void record(std::string entry) EXCLUDES(mutex) {
    MutexLock lock(mutex);
    state.calls.push_back(std::move(entry));
  }

  template <typename T>
  T read(T Device::*field, const char* name) EXCLUDES(mutex) {
    MutexLock lock(mutex);
    state.calls.emplace_back(name);
    return state.device.*field;
  }

  // Posts handler(payload) for event to manager's queue.
  static void postEventLocked(const std::shared_ptr<client::Manager>& manager,
                              const std::string& event, const MessageValue& payload)
      REQUIRES(manager->mutex) {
    auto found = manager->handlers.find(event);
    if (found == manager->handlers.end()) {
      return;
    }
    manager->queue.post(
        [manager, handler = found->second, payload, generation = manager->generation] {
          {
            MutexLock lock(manager->mutex);
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
    MutexLock lock(impl_->mutex);
    old = std::exchange(impl_->state, FakeState());
    std::move(old.managers.begin(), old.managers.end(), std::back_inserter(impl_->retired));
  }
  // The old closures and queues go here, outside the lock their threads may take.
}

FakePlatform::Impl& FakePlatform::impl() {
  return *impl_;
}

void FakePlatform::setDevice(Device device) {
  MutexLock lock(impl_->mutex);
  impl_->state.device = std::move(device);
}

Device FakePlatform::device() const {
  MutexLock lock(impl_->mutex);
  return impl_->state.device;
}

std::vector<std::string> FakePlatform::calls() const {
  MutexLock lock(impl_->mutex);
  return impl_->state.calls;
}

std::size_t FakePlatform::count(std::string_view entry) const {
  MutexLock lock(impl_->mutex);
  return static_cast<std::size_t>(
      std::count(impl_->state.calls.begin(), impl_->state.calls.end(), entry));
}

void FakePlatform::clearCalls() {
  MutexLock lock(impl_->mutex);
  impl_->state.calls.clear();
}

void FakePlatform::setServerResponder(ServerResponder responder) {
  MutexLock lock(impl_->mutex);
  impl_->state.serverResponder = std::move(responder);
}

std::vector<ServerRequest> FakePlatform::serverRequests() const {
  MutexLock lock(impl_->mutex);
  return impl_->state.serverRequests;
}

void FakePlatform::setEventsOnDelivery(std::vector<std::pair<std::string, MessageValue>> events) {
  MutexLock lock(impl_->mutex);
  impl_->state.eventsOnDelivery = std::move(events);
}

std::size_t FakePlatform::deliverEvent(const std::string& event, const MessageValue& payload) {
  MutexLock lock(impl_->mutex);
  std::size_t posted = 0;
  for (const auto& manager : impl_->state.managers) {
    MutexLock managerLock(manager->mutex);
    if (manager->eventsOn && manager->handlers.count(event) != 0) {
      Impl::postEventLocked(manager, event, payload);
      ++posted;
    }
  }
  return posted;
}

void FakePlatform::holdCompletions(bool hold) {
  MutexLock lock(impl_->mutex);
  impl_->state.holding = hold;
}

std::size_t FakePlatform::releaseCompletions() {
  std::vector<std::pair<WorkQueue, WorkQueue::Closure>> held;
  {
    MutexLock lock(impl_->mutex);
    held.swap(impl_->state.heldCompletions);
  }
  for (auto& [queue, closure] : held) {
    queue.post(std::move(closure));
  }
  return held.size();
}

void FakePlatform::setHelperResponder(HelperResponder responder) {
  MutexLock lock(impl_->mutex);
  impl_->state.helperResponder = std::move(responder);
}

void FakePlatform::setHelperCreatable(bool creatable) {
  MutexLock lock(impl_->mutex);
  impl_->state.helperCreatable = creatable;
}

std::vector<HelperRequest> FakePlatform::helperRequests() const {
  MutexLock lock(impl_->mutex);
  return impl_->state.helperRequests;
}

std::vector<LogLine> FakePlatform::logLines() const {
  MutexLock lock(impl_->mutex);
  return impl_->state.logLines;
}

void FakePlatform::clearRequests() {
  MutexLock lock(impl_->mutex);
  impl_->state.serverRequests.clear();
  impl_->state.helperRequests.clear();
  impl_->state.logLines.clear();
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
  MutexLock lock(impl.mutex);
  impl.state.calls.push_back("isProcessRunning:" + name);
  return impl.state.device.runningProcesses.count(name) != 0;
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
    MutexLock lock(impl.mutex);
    impl.state.logLines.push_back(
        {context.subsystem(), context.category(), level, std::string(message)});
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
      MutexLock lock(impl.mutex);
      impl.state.calls.push_back(std::string("HelperClient::perform:") + command);
      impl.state.helperRequests.push_back({service_, task, command, request});
      responder = impl.state.helperResponder;
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
  MutexLock lock(impl.mutex);
  impl.state.calls.push_back(std::string("HelperClient::create:") + serviceName);
  if (!impl.state.helperCreatable) {
    return nullptr;
  }
  return std::make_shared<FakeHelperClient>(serviceName);
}

}  // namespace halvex

namespace halvex::client {

std::shared_ptr<Manager> CreateManager(const std::string& clientName, WorkQueue queue) {
  auto& impl = fakeImpl();
  auto manager = std::make_shared<Manager>(clientName, std::move(queue));
  MutexLock lock(impl.mutex);
  impl.state.calls.push_back("CreateManager:" + clientName);
  impl.state.managers.push_back(manager);
  return manager;
}

void RegisterEventHandler(const std::shared_ptr<Manager>& manager, const std::string& event,
                          EventHandler handler) {
  auto& impl = fakeImpl();
  MutexLock lock(impl.mutex);
  impl.state.calls.push_back("RegisterEventHandler:" + event);
  MutexLock managerLock(manager->mutex);
  manager->handlers[event] = std::move(handler);
}

void EventsOff(const std::shared_ptr<Manager>& manager) {
  auto& impl = fakeImpl();
  MutexLock lock(impl.mutex);
  impl.state.calls.emplace_back("EventsOff");
  MutexLock managerLock(manager->mutex);
  manager->eventsOn = false;
  ++manager->generation;
}

void EventsOn(const std::shared_ptr<Manager>& manager) {
  auto& impl = fakeImpl();
  MutexLock lock(impl.mutex);
  impl.state.calls.emplace_back("EventsOn");
  MutexLock managerLock(manager->mutex);
  manager->eventsOn = true;
  for (const auto& [event, payload] : impl.state.eventsOnDelivery) {
    fake::FakePlatform::Impl::postEventLocked(manager, event, payload);
  }
}

namespace {

fake::Answer answerServer(const std::shared_ptr<Manager>& manager, const std::string& command,
                          const MessageDict& request, bool asynchronous) {
  auto& impl = fakeImpl();
  fake::FakePlatform::ServerResponder responder;
  {
    MutexLock lock(impl.mutex);
    impl.state.calls.push_back("PerformCommand:" + command);
    impl.state.serverRequests.push_back({manager->client, command, request, asynchronous});
    responder = impl.state.serverResponder;
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
    MutexLock lock(impl.mutex);
    if (impl.state.holding) {
      impl.state.heldCompletions.emplace_back(manager->queue, std::move(deliver));
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
