// SPDX-License-Identifier: MIT
// The helper-client framework over D-Bus: org.halvex.Helper1.Perform, synchronously, on the
// process's one connection (detail/ProcessBus.h).
#include <string>
#include <string_view>

#include "detail/BusSupport.h"
#include "detail/CallBounds.h"
#include "detail/ProcessBus.h"
#include "platform/HelperClient.h"
#include "platform/linux/MessageCodec.h"

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
        log_(LogContext(bus::kLogSubsystem, "helper"), std::move(logger)) {}

  Result perform(helper::TaskID task, const char* command, MessageDict request,
                 MessageValue& reply) override {
    if (command == nullptr || !bus::isSendableName(command)) {
      return bus::makeResult(kResultInvalidRequest, "command name cannot be sent");
    }
    MessageValue value;
    Result result = bus::ProcessBus::instance().call(
        {bus::kHelperName, bus::kHelperPath, bus::kHelperInterface, bus::kHelperPerform,
         bus::callBounds().helper, "helper",
         std::string(bus::kHelperPerform) + " " + service_ + " " + command},
        [&](sd_bus_message* message) {
          int r = sd_bus_message_append(message, "sis", service_.c_str(),
                                        static_cast<std::int32_t>(task), command);
          return r < 0 ? r : bus::appendDict(message, request);
        },
        [&value](sd_bus_message* answer) { return bus::readOutcome(answer, value); });
    if (result.ok()) {
      reply = std::move(value);
    } else {
      // The platform's own log has every request; a caller that gave a logger sees failures too.
      log_.log(LogLevel::kError, service_ + " " + command + " failed: " + result.message);
    }
    return result;
  }

 private:
  const std::string service_;
  const Logger log_;
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
