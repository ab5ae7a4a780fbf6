// SPDX-License-Identifier: MIT
// The scenario's rules: which keys each part holds, what their values may be, and the limits
// that keep every value one the simulator can send.
#include "sim/Scenario.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <limits>
#include <set>
#include <system_error>

#include "platform/ServerProtocol.h"
#include "platform/linux/MessageCodec.h"
#include "sim/JsonDocument.h"

namespace halvex::sim {
namespace {

using json::checkObject;
using json::child;
using json::expected;
using json::fail;
using json::Json;
using json::readBool;
using json::readChoice;
using json::readInteger;
using json::readString;
using json::typeName;

constexpr std::size_t kMaxFileBytes = 1 << 20;
constexpr std::uint32_t kMaxDelayMs = 24 * 60 * 60 * 1000;
constexpr std::size_t kMaxProcesses = 64;
constexpr std::size_t kMaxProcessName = 255;  // one file name: the keeper links it in a folder

constexpr char kNotForTheBus[] = "holds NUL or a Unicode noncharacter, which the bus cannot carry";

// A string the simulator sends: refused here, with its place, rather than failing on the bus.
std::string readBusString(const Json& value, const std::string& pointer) {
  std::string text = readString(value, pointer);
  if (!bus::isBusString(text)) {
    fail(pointer, kNotForTheBus);
  }
  return text;
}

std::int64_t readInt64(const Json& value, const std::string& pointer) {
  return readInteger<std::int64_t>(
      value, pointer, std::numeric_limits<std::int64_t>::min(),
      static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max()));
}

std::uint32_t readDelay(const Json& value, const std::string& pointer) {
  return readInteger<std::uint32_t>(value, pointer, 0, kMaxDelayMs);
}

constexpr std::pair<std::string_view, ReplyKind> kReplyKinds[] = {{"dict", ReplyKind::kDict},
                                                                  {"null", ReplyKind::kNull},
                                                                  {"string", ReplyKind::kString},
                                                                  {"int64", ReplyKind::kInt64},
                                                                  {"bool", ReplyKind::kBool}};
constexpr std::pair<std::string_view, Fault> kFaults[] = {
    {"none", Fault::kNone}, {"never_answer", Fault::kNeverAnswer}, {"exit", Fault::kExit}};
constexpr std::pair<std::string_view, StateWhen> kWhens[] = {{"subscribe", StateWhen::kSubscribe},
                                                             {"after", StateWhen::kAfter},
                                                             {"demand", StateWhen::kDemand}};

// The keys common to commands, properties and the helper. Returns false for a key it does not
// own, so the caller can check its own keys.
bool readAnswerKey(Answer& answer, const std::string& key, const Json& value,
                   const std::string& pointer) {
  if (key == "result") {
    // Codes are 32-bit; written either signed or as the unsigned hexadecimal-style value
    // (3760250881 for 0xE020E001), which keeps its bit pattern.
    answer.result = static_cast<std::int32_t>(
        readInteger<std::uint32_t>(value, pointer, std::numeric_limits<std::int32_t>::min(),
                                   std::numeric_limits<std::uint32_t>::max()));
  } else if (key == "reply") {
    answer.reply = readChoice(value, pointer, kReplyKinds);
  } else if (key == "delay_ms") {
    answer.delayMs = readDelay(value, pointer);
  } else if (key == "fault") {
    answer.fault = readChoice(value, pointer, kFaults);
  } else {
    return false;
  }
  return true;
}

Answer readCommandAnswer(const Json& value, const std::string& pointer) {
  checkObject(value, pointer, {"result", "reply", "timestamp", "delay_ms", "fault"});
  Answer answer;
  for (const auto& [key, item] : value.items()) {
    const std::string at = child(pointer, key);
    if (readAnswerKey(answer, key, item, at)) {
      continue;
    }
    if (item.is_null()) {
      answer.stamp = Stamp::kNone;
    } else {
      answer.stamp = Stamp::kText;
      answer.timestamp = readBusString(item, at);
    }
  }
  return answer;
}

PropertyAnswer readPropertyAnswer(const Json& value, const std::string& pointer) {
  checkObject(value, pointer, {"value", "result", "reply", "delay_ms", "fault"});
  PropertyAnswer property;
  for (const auto& [key, item] : value.items()) {
    const std::string at = child(pointer, key);
    if (!readAnswerKey(property.answer, key, item, at)) {
      property.value = readBusString(item, at);
    }
  }
  return property;
}

// A payload the bus can carry as one variant: the codec's depth, size and string limits, checked
// here so that the daemon never holds an event it cannot send. values counts every value read.
MessageValue readPayload(const Json& value, const std::string& pointer, int depth,
                         std::size_t& values) {
  if (++values > bus::kMaxValues) {
    fail(pointer, "more than " + std::to_string(bus::kMaxValues) + " values in one payload");
  }
  switch (value.type()) {
    case Json::value_t::null: return MessageValue::null();
    case Json::value_t::boolean: return MessageValue::boolean(value.get<bool>());
    case Json::value_t::string: return MessageValue::string(readBusString(value, pointer));
    case Json::value_t::number_integer:
    case Json::value_t::number_unsigned: return MessageValue::int64(readInt64(value, pointer));
    case Json::value_t::object: {
      if (depth >= bus::kMaxDictDepth) {
        fail(pointer, "nested deeper than " + std::to_string(bus::kMaxDictDepth) + " objects");
      }
      if (value.size() > bus::kMaxDictEntries) {
        fail(pointer, "more than " + std::to_string(bus::kMaxDictEntries) + " entries");
      }
      MessageDict dict;
      for (const auto& [key, item] : value.items()) {
        const std::string at = child(pointer, key);
        if (!bus::isBusString(key)) {
          fail(at, std::string("this key ") + kNotForTheBus);
        }
        dict.set(key, readPayload(item, at, depth + 1, values));
      }
      return MessageValue::dict(std::move(dict));
    }
    default: fail(pointer, std::string(typeName(value)) + " has no form on the bus");
  }
}

std::optional<StateEvent> readState(const Json& value, const std::string& pointer) {
  if (value.is_null()) {
    return std::nullopt;
  }
  checkObject(value, pointer, {"payload", "when", "after_ms"});
  StateEvent state;
  for (const auto& [key, item] : value.items()) {
    const std::string at = child(pointer, key);
    if (key == "payload") {
      std::size_t values = 0;
      state.payload = readPayload(item, at, 0, values);
    } else if (key == "when") {
      state.when = readChoice(item, at, kWhens);
    } else {
      state.afterMs = readDelay(item, at);
    }
  }
  return state;
}

void readServer(Server& server, const Json& value, const std::string& pointer) {
  checkObject(value, pointer, {"present", "appear_after_ms", "state", "commands", "properties"});
  for (const auto& [key, item] : value.items()) {
    const std::string at = child(pointer, key);
    if (key == "present") {
      server.present = readBool(item, at);
    } else if (key == "appear_after_ms") {
      server.appearAfterMs = readDelay(item, at);
    } else if (key == "state") {
      server.state = readState(item, at);
    } else if (key == "commands") {
      if (!item.is_object()) {
        expected(at, "an object", item);
      }
      for (const auto& [name, answer] : item.items()) {
        if (name == kCommandGetTraceProperty) {
          fail(child(at, name), "trace properties are answered as /server/properties says");
        }
        server.commands[name] = readCommandAnswer(answer, child(at, name));
      }
    } else {
      if (!item.is_object()) {
        expected(at, "an object", item);
      }
      for (const auto& [trace, properties] : item.items()) {
        const std::string traceAt = child(at, trace);
        if (!properties.is_object()) {
          expected(traceAt, "an object", properties);
        }
        for (const auto& [name, answer] : properties.items()) {
          server.properties[trace][name] = readPropertyAnswer(answer, child(traceAt, name));
        }
      }
    }
  }
}

void readDevice(Device& device, const Json& value, const std::string& pointer) {
  checkObject(value, pointer,
              {"present", "radio_type", "radio_vendor", "product_type", "internal_build",
               "carrier_build", "vendor_build", "trace_allowed"});
  for (const auto& [key, item] : value.items()) {
    const std::string at = child(pointer, key);
    if (key == "present") {
      device.present = readBool(item, at);
    }
    if (key == "radio_type") {
      device.radioType = readInt64(item, at);
    }
    if (key == "radio_vendor") {
      device.radioVendor = readInt64(item, at);
    }
    if (key == "product_type") {
      device.productType = readInt64(item, at);
    }
    if (key == "internal_build") {
      device.internalBuild = readBool(item, at);
    }
    if (key == "carrier_build") {
      device.carrierBuild = readBool(item, at);
    }
    if (key == "vendor_build") {
      device.vendorBuild = readBool(item, at);
    }
    if (key == "trace_allowed") {
      device.traceAllowed = readBool(item, at);
    }
  }
}

std::vector<std::string> readProcesses(const Json& value, const std::string& pointer) {
  if (!value.is_array()) {
    expected(pointer, "an array of process names", value);
  }
  if (value.size() > kMaxProcesses) {
    fail(pointer, "more than " + std::to_string(kMaxProcesses) + " processes");
  }
  std::vector<std::string> names;
  std::set<std::string> seen;
  for (std::size_t i = 0; i < value.size(); ++i) {
    const std::string at = pointer + "/" + std::to_string(i);
    std::string name = readString(value[i], at);
    if (name.empty() || name.size() > kMaxProcessName || name == "." || name == ".." ||
        name.find_first_of(std::string_view("/\0\n", 3)) != std::string::npos) {
      fail(at, "not a process name (1 to 255 bytes, no \"/\", NUL or newline, not . or ..)");
    }
    if (!seen.insert(name).second) {
      fail(at, "\"" + name + "\" is listed twice");
    }
    names.push_back(std::move(name));
  }
  return names;
}

void readHelper(Helper& helper, const Json& value, const std::string& pointer) {
  checkObject(value, pointer, {"present", "result", "reply", "timestamp", "delay_ms", "fault"});
  Json answer = Json::object();
  for (const auto& [key, item] : value.items()) {
    if (key == "present") {
      helper.present = readBool(item, child(pointer, key));
    } else {
      answer[key] = item;
    }
  }
  helper.status = readCommandAnswer(answer, pointer);
}

}  // namespace

Answer Server::commandAnswer(std::string_view command) const {
  const auto found = commands.find(command);
  return found == commands.end() ? Answer{} : found->second;
}

PropertyAnswer Server::propertyAnswer(std::string_view trace, std::string_view property) const {
  const auto traceFound = properties.find(trace);
  if (traceFound == properties.end()) {
    return {};
  }
  const auto found = traceFound->second.find(property);
  return found == traceFound->second.end() ? PropertyAnswer{} : found->second;
}

Scenario defaultScenario() {
  Scenario scenario;
  MessageDict started;
  started.set(kKeyServerState, MessageValue::string(kServerStateStarted));
  scenario.server.state =
      StateEvent{MessageValue::dict(std::move(started)), StateWhen::kSubscribe, 0};
  scenario.server.properties[kTraceBaseband][kKeyTraceEnabled].value = "1";
  scenario.server.properties[kTraceSystemLogs][kKeyTraceMode].value = "0";
  return scenario;
}

Scenario parseScenario(std::string_view text) {
  const Json document = json::parse(text);
  Scenario scenario = defaultScenario();
  checkObject(document, "", {"device", "processes", "server", "helper"});
  for (const auto& [key, item] : document.items()) {
    const std::string at = child("", key);
    if (key == "device") {
      readDevice(scenario.device, item, at);
    }
    if (key == "processes") {
      scenario.processes = readProcesses(item, at);
    }
    if (key == "server") {
      readServer(scenario.server, item, at);
    }
    if (key == "helper") {
      readHelper(scenario.helper, item, at);
    }
  }
  return scenario;
}

Scenario loadScenario(const std::string& path) {
  const auto unreadable = [&path](int error) {
    return std::system_error(error, std::generic_category(), path + ": cannot be read");
  };
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    throw unreadable(errno);
  }
  std::string text(kMaxFileBytes + 1, '\0');
  std::size_t size = 0;
  int readError = 0;
  while (size < text.size()) {
    const ssize_t n = ::read(fd, text.data() + size, text.size() - size);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0) {
      readError = errno;
    }
    if (n <= 0) {
      break;
    }
    size += static_cast<std::size_t>(n);
  }
  ::close(fd);
  if (readError != 0) {
    throw unreadable(readError);
  }
  if (size > kMaxFileBytes) {
    throw std::runtime_error(path + ": larger than " + std::to_string(kMaxFileBytes) + " bytes");
  }
  text.resize(size);
  try {
    return parseScenario(text);
  } catch (const ScenarioError& error) {
    throw std::runtime_error(path + ": " + error.what());
  }
}

std::string_view replyKindName(ReplyKind kind) {
  for (const auto& [name, choice] : kReplyKinds) {
    if (choice == kind) {
      return name;
    }
  }
  return "?";
}

}  // namespace halvex::sim
