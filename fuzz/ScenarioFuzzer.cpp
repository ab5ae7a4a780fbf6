// SPDX-License-Identifier: MIT
// The scenario loader over any text. It either returns a scenario whose every value can go on the
// bus as it is (the simulator checks up front so that the daemon never meets one it cannot
// send), or throws a ScenarioError whose pointer names a place that exists in the document.
// Any other exception escapes and ends the run.
#include <systemd/sd-bus.h>

#include <cstdint>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>

#include "fuzz/FuzzBus.h"
#include "fuzz/FuzzSupport.h"
#include "platform/MessageDict.h"
#include "platform/ServerProtocol.h"
#include "platform/linux/MessageCodec.h"
#include "sim/Scenario.h"

namespace halvex::fuzz {
namespace {

// Sends value through the codec and reads it back unchanged.
void checkTravels(const MessageValue& value, const char* what) {
  Message message = newMessage();
  const int r = bus::appendVariant(message.get(), value);
  check(r == 0, what, [&] { return "cannot be sent: " + describe(value); });
  check(sealForReading(message.get()) >= 0, "seal");
  MessageValue back;
  check(bus::readVariant(message.get(), back) == 0 && back == value, what,
        [&] { return "does not survive the trip: " + describe(value); });
}

// A time stamp or a property value: a string, or an optional one that may be absent.
template <typename Text>
void checkText(const Text& text, const char* what) {
  if constexpr (requires { text.has_value(); }) {
    if (text) {
      checkTravels(MessageValue::string(*text), what);
    }
  } else {
    checkTravels(MessageValue::string(text), what);
  }
}

void checkScenario(const sim::Scenario& scenario) {
  if (scenario.server.state) {
    checkTravels(scenario.server.state->payload, "the state payload");
  }
  for (const auto& [name, answer] : scenario.server.commands) {
    checkText(answer.timestamp, "a command's time stamp");
  }
  for (const auto& [trace, properties] : scenario.server.properties) {
    for (const auto& [name, property] : properties) {
      checkText(property.value, "a property value");
      checkText(property.answer.timestamp, "a property's time stamp");
    }
  }
  checkText(scenario.helper.status.timestamp, "the helper's time stamp");
}

// The loader reports places as JSON pointers into what it read; they must lead somewhere.
void checkError(std::string_view text, const sim::ScenarioError& error) {
  check(!error.problem().empty(), "an error says what is wrong", [&] { return error.what(); });
  if (error.pointer().empty()) {
    return;
  }
  const auto document = nlohmann::ordered_json::parse(text, nullptr, false);
  check(!document.is_discarded(), "text that is not JSON is reported at the top level",
        [&] { return error.what(); });
  bool found = false;
  try {
    found = document.contains(nlohmann::ordered_json::json_pointer(error.pointer()));
  } catch (const nlohmann::ordered_json::exception&) {
    found = false;
  }
  check(found, "the error's place exists in the document", [&] { return error.what(); });
}

}  // namespace
}  // namespace halvex::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace halvex;
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  try {
    fuzz::checkScenario(sim::parseScenario(text));
  } catch (const sim::ScenarioError& error) {
    fuzz::checkError(text, error);
  }
  return 0;
}
