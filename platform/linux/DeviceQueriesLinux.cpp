// SPDX-License-Identifier: MIT
// The device identity on a Linux host: org.halvex.Device's GetIdentity over the system bus, kept
// between questions for as long as nothing says it may have changed (platform/DeviceQueries.h
// says when that is). The process check is in ProcessCheckLinux.cpp.
#include <atomic>
#include <cstdint>
#include <limits>
#include <memory>
#include <optional>
#include <string>

#include "detail/BusSupport.h"
#include "detail/CallBounds.h"
#include "detail/ProcessBus.h"
#include "platform/DeviceQueries.h"
#include "platform/Mutex.h"
#include "platform/linux/MessageCodec.h"

namespace halvex::device {

namespace {

using bus::ProcessBus;

class IdentityCache;
const std::shared_ptr<IdentityCache>& identityCache();

class IdentityCache final : public bus::ConnectionListener {
 public:
  MessageDict get() EXCLUDES(mutex_) {
    ProcessBus& processBus = ProcessBus::instance();
    // With no loop reading the connection, a change signalled already may still wait in it.
    processBus.catchUp();
    // Held across the question, so that concurrent first callers make one between them.
    MutexLock lock(mutex_);
    // Read before asking: a change signalled while the question is out makes the next one ask
    // again.
    const std::uint64_t generation = generation_.load();
    if (kept_ && keptGeneration_ == generation) {
      return *kept_;
    }
    MessageDict identity;
    const Result result = processBus.call(
        {bus::kDeviceName, bus::kDevicePath, bus::kDeviceInterface, bus::kDeviceGetIdentity,
         bus::callBounds().identity, "device", bus::kDeviceGetIdentity},
        [this](sd_bus_message*) {
          watch();
          return 0;
        },
        [&identity](sd_bus_message* reply) {
          if (sd_bus_message_has_signature(reply, "a{sv}") <= 0 ||
              bus::readDict(reply, identity) < 0) {
            identity = {};
            return bus::makeResult(kResultBadReply, "identity of the wrong shape");
          }
          return Result{};
        });
    // Only an answer is kept, so that a passing fault never reads as "no baseband" for good.
    kept_.reset();
    if (result.ok()) {
      kept_ = identity;
      keptGeneration_ = generation;
    }
    return identity;
  }

  void connected(sd_bus*) override {}
  // Whatever happened while we were away is unknown.
  void disconnected() override { forget(); }

 private:
  void forget() { generation_.fetch_add(1); }

  // In the I/O context, right before the question goes out: the bus handles our messages in
  // order, so no change after the answer can slip by unseen.
  void watch() {
    ProcessBus& processBus = ProcessBus::instance();
    if (watchedEpoch_ == processBus.epoch()) {
      return;
    }
    if (watchedEpoch_ == 0) {
      processBus.addListener(identityCache());
    }
    watchedEpoch_ = processBus.epoch();
    // Never destroyed: the loop may still use them while the process exits.
    static const auto* const changedRule = new std::string(bus::signalRule(
        bus::kDeviceName, bus::kDevicePath, bus::kDeviceInterface, bus::kDeviceIdentityChanged));
    static const auto* const ownerRule = new std::string(bus::ownerChangedRule(bus::kDeviceName));
    processBus.addMatch(this, changedRule->c_str(), &IdentityCache::onChange, this);
    processBus.addMatch(this, ownerRule->c_str(), &IdentityCache::onChange, this);
  }

  static int onChange(sd_bus_message*, void* userdata, sd_bus_error*) {
    static_cast<IdentityCache*>(userdata)->forget();
    return 0;
  }

  Mutex mutex_;
  std::optional<MessageDict> kept_ GUARDED_BY(mutex_);
  std::uint64_t keptGeneration_ GUARDED_BY(mutex_) = 0;
  std::atomic<std::uint64_t> generation_{1};
  std::uint64_t watchedEpoch_ = 0;  // I/O context
};

const std::shared_ptr<IdentityCache>& identityCache() {
  // Never destroyed: the connection's matches point at it until the process ends.
  static const auto* const cache =
      new std::shared_ptr<IdentityCache>(std::make_shared<IdentityCache>());
  return *cache;
}

int identityNumber(const char* key) {
  const MessageDict identity = identityCache()->get();
  const MessageValue* value = identity.get(key);
  const std::int64_t* number = value ? value->asInt64() : nullptr;
  if (number == nullptr || *number < std::numeric_limits<int>::min() ||
      *number > std::numeric_limits<int>::max()) {
    return 0;
  }
  return static_cast<int>(*number);
}

bool identityFlag(const char* key) {
  const MessageDict identity = identityCache()->get();
  const MessageValue* value = identity.get(key);
  const bool* flag = value ? value->asBool() : nullptr;
  return flag != nullptr && *flag;
}

}  // namespace

int getRadioType() {
  return identityNumber(bus::kIdentityRadioType);
}

int getRadioVendor() {
  return identityNumber(bus::kIdentityRadioVendor);
}

int getProductType() {
  return identityNumber(bus::kIdentityProductType);
}

bool isInternalBuild() {
  return identityFlag(bus::kIdentityInternalBuild);
}

bool isCarrierBuild() {
  return identityFlag(bus::kIdentityCarrierBuild);
}

bool isVendorBuild() {
  return identityFlag(bus::kIdentityVendorBuild);
}

bool isTraceAllowed() {
  return identityFlag(bus::kIdentityTraceAllowed);
}

}  // namespace halvex::device
