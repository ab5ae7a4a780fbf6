// SPDX-License-Identifier: MIT
#include "sim/Scenario.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <limits>
#include <nlohmann/json.hpp>
#include <set>

#include "platform/ServerProtocol.h"
#include "platform/linux/MessageCodec.h"
#include "platform/linux/detail/BusString.h"

namespace halvex::sim {
namespace {

// ordered_json keeps a payload's keys in the order written: they go on the bus in that order.
using Json = nlohmann::ordered_json;

constexpr std::size_t kMaxFileBytes = 1 << 20;
// Deeper than any payload can be sent (kMaxDictDepth), shallow enough that nothing recursive
// downstream can run out of stack.
constexpr std::size_t kMaxJsonDepth = 64;
constexpr std::uint32_t kMaxDelayMs = 24 * 60 * 60 * 1000;
constexpr std::size_t kMaxProcesses = 64;
constexpr std::size_t kMaxProcessName = 255;  // one file name: the keeper links it in a folder

std::string escapePointerToken(std::string_view token) {
  std::string out;
  for (const char c : token) {
    if (c == '~') {
      out += "~0";
    } else if (c == '/') {
      out += "~1";
    } else {
      out += c;
    }
  }
  return out;
}

// Control characters (NUL and newline among them, from keys and words the scenario wrote) as
// \u00XX, so that a message stays one printable line.
std::string printable(std::string_view text) {
  std::string out;
  for (const char c : text) {
    if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) {
      char escaped[8];
      std::snprintf(escaped, sizeof escaped, "\\u%04x", static_cast<unsigned char>(c));
      out += escaped;
    } else {
      out += c;
    }
  }
  return out;
}

std::string child(const std::string& pointer, std::string_view key) {
  return pointer + "/" + escapePointerToken(key);
}

const char* typeName(const Json& value) {
  switch (value.type()) {
    case Json::value_t::null:
      return "null";
    case Json::value_t::boolean:
      return "a boolean";
    case Json::value_t::string:
      return "a string";
    case Json::value_t::array:
      return "an array";
    case Json::value_t::object:
      return "an object";
    case Json::value_t::number_float:
      return "a fractional number";
    default:
      return "an integer";
  }
}

[[noreturn]] void fail(const std::string& pointer, const std::string& problem) {
  throw ScenarioError(pointer, problem);
}

[[noreturn]] void expected(const std::string& pointer, const char* what, const Json& got) {
  fail(pointer, std::string("expected ") + what + ", got " + typeName(got));
}

// Checks that value is an object holding only the allowed keys.
void checkObject(const Json& value, const std::string& pointer,
                 std::initializer_list<std::string_view> allowed) {
  if (!value.is_object())
    expected(pointer, "an object", value);
  for (const auto& [key, item] : value.items()) {
    bool known = false;
    for (std::string_view name : allowed)
      known = known || key == name;
    if (!known) {
      std::string list;
      for (std::string_view name : allowed)
        list += (list.empty() ? "" : ", ") + std::string(name);
      fail(child(pointer, key), "unknown key (known here: " + list + ")");
    }
  }
}

bool readBool(const Json& value, const std::string& pointer) {
  if (!value.is_boolean())
    expected(pointer, "a boolean", value);
  return value.get<bool>();
}

std::string readString(const Json& value, const std::string& pointer) {
  if (!value.is_string())
    expected(pointer, "a string", value);
  return value.get<std::string>();
}

constexpr char kNotForTheBus[] = "holds NUL or a Unicode noncharacter, which the bus cannot carry";

// A string the simulator sends: refused here, with its place, rather than failing on the bus.
std::string readBusString(const Json& value, const std::string& pointer) {
  std::string text = readString(value, pointer);
  if (!bus::isBusString(text))
    fail(pointer, kNotForTheBus);
  return text;
}

// An integer in [low, high]; JSON numbers with a fraction or exponent are refused.
template <typename Int>
Int readInteger(const Json& value, const std::string& pointer, std::int64_t low,
                std::uint64_t high) {
  if (value.is_number_unsigned()) {
    const auto number = value.get<std::uint64_t>();
    if (number <= high)
      return static_cast<Int>(number);
  } else if (value.is_number_integer()) {
    const auto number = value.get<std::int64_t>();
    if (number >= low && (number < 0 || static_cast<std::uint64_t>(number) <= high)) {
      return static_cast<Int>(number);
    }
  } else {
    expected(pointer, "an integer", value);
  }
  fail(pointer, "out of range (" + std::to_string(low) + " to " + std::to_string(high) + ")");
}

std::uint32_t readDelay(const Json& value, const std::string& pointer) {
  return readInteger<std::uint32_t>(value, pointer, 0, kMaxDelayMs);
}

// One of the words in names, returned as its index.
template <typename Enum, std::size_t N>
Enum readChoice(const Json& value, const std::string& pointer,
                const std::pair<std::string_view, Enum> (&names)[N]) {
  std::string list;
  for (const auto& [name, choice] : names)
    list += (list.empty() ? "\"" : ", \"") + std::string(name) + "\"";
  if (!value.is_string())
    expected(pointer, ("one of " + list).c_str(), value);
  const auto& text = value.get_ref<const std::string&>();
  for (const auto& [name, choice] : names) {
    if (text == name)
      return choice;
  }
  fail(pointer, "\"" + text + "\" is not one of " + list);
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
    if (readAnswerKey(answer, key, item, at))
      continue;
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
    if (!readAnswerKey(property.answer, key, item, at))
      property.value = readBusString(item, at);
  }
  return property;
}

// A payload the bus can carry as one variant: the codec's depth, size and string limits, checked
// here so that the daemon never holds an event it cannot send. values counts every value read.
MessageValue readPayload(const Json& value, const std::string& pointer, int depth,
                         std::size_t& values) {
  if (++values > bus::kMaxValues)
    fail(pointer, "more than " + std::to_string(bus::kMaxValues) + " values in one payload");
  switch (value.type()) {
    case Json::value_t::null:
      return MessageValue::null();
    case Json::value_t::boolean:
      return MessageValue::boolean(value.get<bool>());
    case Json::value_t::string:
      return MessageValue::string(readBusString(value, pointer));
    case Json::value_t::number_integer:
    case Json::value_t::number_unsigned:
      return MessageValue::int64(readInteger<std::int64_t>(
          value, pointer, std::numeric_limits<std::int64_t>::min(),
          static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())));
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
        if (!bus::isBusString(key))
          fail(at, std::string("this key ") + kNotForTheBus);
        dict.set(key, readPayload(item, at, depth + 1, values));
      }
      return MessageValue::dict(std::move(dict));
    }
    default:
      fail(pointer, std::string(typeName(value)) + " has no form on the bus");
  }
}

std::optional<StateEvent> readState(const Json& value, const std::string& pointer) {
  if (value.is_null())
    return std::nullopt;
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
      if (!item.is_object())
        expected(at, "an object", item);
      for (const auto& [name, answer] : item.items()) {
        if (name == kCommandGetTraceProperty) {
          fail(child(at, name), "trace properties are answered as /server/properties says");
        }
        server.commands[name] = readCommandAnswer(answer, child(at, name));
      }
    } else {
      if (!item.is_object())
        expected(at, "an object", item);
      for (const auto& [trace, properties] : item.items()) {
        const std::string traceAt = child(at, trace);
        if (!properties.is_object())
          expected(traceAt, "an object", properties);
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
  constexpr auto kLow = std::numeric_limits<std::int64_t>::min();
  constexpr auto kHigh = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
  for (const auto& [key, item] : value.items()) {
    const std::string at = child(pointer, key);
    if (key == "present")
      device.present = readBool(item, at);
    if (key == "radio_type")
      device.radioType = readInteger<std::int64_t>(item, at, kLow, kHigh);
    if (key == "radio_vendor")
      device.radioVendor = readInteger<std::int64_t>(item, at, kLow, kHigh);
    if (key == "product_type")
      device.productType = readInteger<std::int64_t>(item, at, kLow, kHigh);
    if (key == "internal_build")
      device.internalBuild = readBool(item, at);
    if (key == "carrier_build")
      device.carrierBuild = readBool(item, at);
    if (key == "vendor_build")
      device.vendorBuild = readBool(item, at);
    if (key == "trace_allowed")
      device.traceAllowed = readBool(item, at);
  }
}

std::vector<std::string> readProcesses(const Json& value, const std::string& pointer) {
  if (!value.is_array())
    expected(pointer, "an array of process names", value);
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
    if (!seen.insert(name).second)
      fail(at, "\"" + name + "\" is listed twice");
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

std::string parseErrorPlace(std::string_view text, std::size_t byte) {
  std::size_t line = 1, column = 1;
  for (std::size_t i = 0; i + 1 < byte && i < text.size(); ++i) {
    if (text[i] == '\n') {
      ++line;
      column = 1;
    } else {
      ++column;
    }
  }
  return "line " + std::to_string(line) + ", column " + std::to_string(column);
}

// What the parser says is wrong, from "[json.exception...] parse error at ...: REASON; last read:
// 'TEXT'". TEXT is raw input (a newline, a byte that is not UTF-8) and stays out of the message.
std::string parseErrorReason(const std::string& what) {
  const std::size_t begin = what.find(": ");
  if (begin == std::string::npos)
    return {};
  return " (" + what.substr(begin + 2, what.find("; last read") - begin - 2) + ")";
}

// Builds the document from the parser's events rather than letting the library build it, so that
// what is known only while reading comes with a place: where a number overflows, an integer too
// long for 64 bits (which the library would silently turn into a fraction), nesting too deep.
// A place given as a JSON pointer always exists in the document; one in text that turns out not
// to be JSON, or that the library cannot hold, is reported at the top level.
class DocumentReader final : public nlohmann::json_sax<Json> {
 public:
  explicit DocumentReader(std::string_view text) : text_(text) {}
  // The document, once the whole text has been read.
  const Json& document() const {
    if (tooLong_)
      throw *tooLong_;
    return document_;
  }

  bool null() override { return add(nullptr); }
  bool boolean(bool value) override { return add(value); }
  bool number_integer(number_integer_t value) override { return add(value); }
  bool number_unsigned(number_unsigned_t value) override { return add(value); }
  bool number_float(number_float_t value, const string_t& text) override {
    // Reported once the rest of the text has proven to be JSON.
    if (text.find_first_of(".eE") == string_t::npos && !tooLong_)
      tooLong_.emplace(place(), text + " is out of range (beyond 64 bits)");
    return add(value);
  }
  bool string(string_t& value) override { return add(std::move(value)); }
  bool binary(binary_t&) override { return false; }  // JSON text has no binary values
  bool start_object(std::size_t) override { return open(Json::object()); }
  bool key(string_t& key) override {
    open_.back().key = std::move(key);
    return true;
  }
  bool end_object() override { return close(); }
  bool start_array(std::size_t) override { return open(Json::array()); }
  bool end_array() override { return close(); }
  bool parse_error(std::size_t byte, const std::string& token,
                   const nlohmann::detail::exception& error) override {
    const std::string at = parseErrorPlace(text_, byte);
    // 406: a number too large for a double; it is complete, so its place is known.
    if (error.id == 406)
      fail("", token + " at " + place() + " is out of range (" + at + ")");
    fail("", "not valid JSON at " + at + parseErrorReason(error.what()));
  }

 private:
  struct Open {
    Json* container;
    std::string key;  // of the member being read, in an object
  };

  // The JSON pointer of the value being read. Only the innermost open container grows, so the
  // others' last element is the open one.
  std::string place() const {
    std::string pointer;
    for (std::size_t i = 0; i < open_.size(); ++i) {
      const Open& o = open_[i];
      if (!o.container->is_array()) {
        pointer = child(pointer, o.key);
      } else {
        const std::size_t size = o.container->size();
        pointer += '/';
        pointer += std::to_string(i + 1 == open_.size() ? size : size - 1);
      }
    }
    return pointer;
  }

  // Appending moves only the innermost container's elements, none of which is open: the
  // pointers kept in open_ stay valid.
  Json& insert(Json value) {
    if (open_.empty())
      return document_ = std::move(value);
    Json& container = *open_.back().container;
    if (container.is_array()) {
      container.push_back(std::move(value));
      return container.back();
    }
    return container[open_.back().key] = std::move(value);
  }
  bool add(Json value) {
    insert(std::move(value));
    return true;
  }
  bool open(Json container) {
    if (open_.size() >= kMaxJsonDepth) {
      fail("", "nested deeper than " + std::to_string(kMaxJsonDepth) + " levels at " + place());
    }
    open_.push_back({&insert(std::move(container)), {}});
    return true;
  }
  bool close() {
    open_.pop_back();
    return true;
  }

  std::string_view text_;
  Json document_;
  std::vector<Open> open_;
  std::optional<ScenarioError> tooLong_;
};

}  // namespace

ScenarioError::ScenarioError(std::string pointer, std::string problem)
    : std::runtime_error(
          printable((pointer.empty() ? std::string("(top level)") : pointer) + ": " + problem)),
      pointer_(std::move(pointer)),
      problem_(std::move(problem)) {}

Answer Server::commandAnswer(std::string_view command) const {
  const auto found = commands.find(command);
  return found == commands.end() ? Answer{} : found->second;
}

PropertyAnswer Server::propertyAnswer(std::string_view trace, std::string_view property) const {
  const auto traceFound = properties.find(trace);
  if (traceFound == properties.end())
    return {};
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
  DocumentReader reader(text);
  if (!Json::sax_parse(text, &reader))
    fail("", "not valid JSON");
  const Json& document = reader.document();
  Scenario scenario = defaultScenario();
  checkObject(document, "", {"device", "processes", "server", "helper"});
  for (const auto& [key, item] : document.items()) {
    const std::string at = child("", key);
    if (key == "device")
      readDevice(scenario.device, item, at);
    if (key == "processes")
      scenario.processes = readProcesses(item, at);
    if (key == "server")
      readServer(scenario.server, item, at);
    if (key == "helper")
      readHelper(scenario.helper, item, at);
  }
  return scenario;
}

Scenario loadScenario(const std::string& path) {
  const auto unreadable = [&path](int error) {
    return std::runtime_error(path + ": cannot be read: " + std::strerror(error));
  };
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0)
    throw unreadable(errno);
  std::string text(kMaxFileBytes + 1, '\0');
  std::size_t size = 0;
  int readError = 0;
  while (size < text.size()) {
    const ssize_t n = ::read(fd, text.data() + size, text.size() - size);
    if (n < 0 && errno == EINTR)
      continue;
    if (n < 0)
      readError = errno;
    if (n <= 0)
      break;
    size += static_cast<std::size_t>(n);
  }
  ::close(fd);
  if (readError != 0)
    throw unreadable(readError);
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
    if (choice == kind)
      return name;
  }
  return "?";
}

}  // namespace halvex::sim
