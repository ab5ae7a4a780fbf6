// SPDX-License-Identifier: MIT
// The helper-client framework over D-Bus: org.halvex.Helper1.Perform, synchronously.
//
// Each client opens its own connection at its first request and keeps it, reopening it when it
// broke. A client is used by one thread at a time, so the blocking sd_bus_call is enough; the
// mutex only keeps a caller that breaks that rule from corrupting the connection.
#include <mutex>
#include <string>
#include <string_view>

#include "platform/HelperClient.h"
#include "platform/linux/MessageCodec.h"
#include "platform/linux/detail/BusSupport.h"

namespace halvex {

namespace {

// Service names are identifiers: visible ASCII only, so that nothing a log or the bus could
// misread gets through.
bool isServiceName(const char* name) {
  if (name == nullptr) {
    return false;
  }
  std::string_view text(name);
  if (text.empty() || text.size() > bus::kMaxNameLength) {
    return false;
  }
  for (char c : text) {
    if (c <= ' ' || c > '~') {
      return false;
    }
  }
  return true;
}

class LinuxHelperClient final : public HelperClient {
 public:
  LinuxHelperClient(std::string service, std::shared_ptr<LogServer> logger)
      : service_(std::move(service)),
        log_(LogContext("org.halvex.platform", "helper"), std::move(logger)) {}

  Result perform(helper::TaskID task, const char* command, MessageDict request,
                 MessageValue& reply) override {
    std::lock_guard lock(mutex_);
    Result result = call(task, command, request, reply);
    if (!result.ok()) {
      log_.log(LogLevel::kError,
               service_ + " " + (command ? command : "(null)") + " failed: " + result.message);
    }
    return result;
  }

 private:
  Result call(helper::TaskID task, const char* command, const MessageDict& request,
              MessageValue& reply) {
    if (command == nullptr || !bus::isSendableName(command)) {
      return bus::makeResult(kResultInvalidRequest, "command name cannot be sent");
    }
    if (!bus_ || sd_bus_is_open(bus_.get()) <= 0) {
      bus_.reset();
      sd_bus* opened = nullptr;
      int r = sd_bus_open_system(&opened);
      if (r < 0) {
        return bus::resultFromOpenFailure(r);
      }
      bus_.reset(opened);
    }
    bus::MessagePtr answer;
    Result result = bus::callSync(
        bus_.get(), bus::kHelperName, bus::kHelperPath, bus::kHelperInterface, "Perform",
        [&](sd_bus_message* message) {
          int r = sd_bus_message_append(message, "sis", service_.c_str(),
                                        static_cast<std::int32_t>(task), command);
          return r < 0 ? r : bus::appendDict(message, request);
        },
        answer);
    if (!result.ok()) {
      return result;
    }
    MessageValue value;
    result = bus::readOutcome(answer.get(), value);
    if (result.ok()) {
      reply = std::move(value);
    }
    return result;
  }

  const std::string service_;
  const Logger log_;
  std::mutex mutex_;
  bus::BusPtr bus_;
};

}  // namespace

std::shared_ptr<HelperClient> HelperClient::create(const char* serviceName,
                                                   std::shared_ptr<LogServer> logger) {
  if (!isServiceName(serviceName)) {
    return nullptr;
  }
  return std::make_shared<LinuxHelperClient>(serviceName, std::move(logger));
}

}  // namespace halvex
