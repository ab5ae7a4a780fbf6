// SPDX-License-Identifier: MIT
// Decoding what a peer may send: the input becomes a message of one to three values of any D-Bus
// type, appended one typed piece at a time, then sealed as a received message would be.
// readDict and readVariant must each accept exactly the values the mapping covers within its
// limits, decode them to what was appended, and leave the read position right after the value.
// What they must accept is worked out here from what was appended, not from the codec.
#include <systemd/sd-bus.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "fuzz/FuzzBus.h"
#include "fuzz/FuzzSupport.h"
#include "platform/MessageDict.h"
#include "platform/linux/MessageCodec.h"

namespace halvex::fuzz {
namespace {

// A D-Bus type: a basic type code, 'v', 'a' with its element, 'e' (dictionary entry) with key
// and value, or 'r' (structure) with its members. Shared, since copies of values share them.
struct Type;
using TypeRef = std::shared_ptr<const Type>;

struct Type {
  char code = 'y';
  std::vector<TypeRef> members;
  std::string signature;
};

TypeRef makeType(char code, std::vector<TypeRef> members = {}) {
  auto type = std::make_shared<Type>();
  type->code = code;
  std::string inner;
  for (const TypeRef& member : members) {
    inner += member->signature;
  }
  type->members = std::move(members);
  switch (code) {
    case 'a': type->signature = "a" + inner; break;
    case 'e': type->signature = "{" + inner + "}"; break;
    case 'r': type->signature = "(" + inner + ")"; break;
    default: type->signature = std::string(1, code); break;
  }
  return type;
}

TypeRef dictType() {
  static const TypeRef type = makeType('a', {makeType('e', {makeType('s'), makeType('v')})});
  return type;
}

struct Value {
  TypeRef type;
  std::uint64_t bits = 0;    // integers, booleans and doubles
  std::string text;          // strings, object paths and signatures
  std::vector<Value> items;  // a variant's value, array elements, entry key and value, members
};

constexpr char kBasicTypes[] = "ybnqiuxtdsog";
constexpr std::size_t kBasicCount = sizeof(kBasicTypes) - 1;
constexpr const char* kObjectPaths[] = {"/", "/org/halvex"};
// The empty one is how null travels; the others must not pass for it.
constexpr const char* kSignatures[] = {"", "s", "x", "a{sv}", "v", "i"};
// Enough nodes to go past kMaxValues, few enough to keep one run short.
constexpr std::size_t kNodeBudget = 80000;

class Builder {
 public:
  explicit Builder(FuzzInput& in) : in_(in) {}

  // Mostly what the mapping covers, sometimes anything.
  TypeRef mappedType() {
    switch (in_.byte() % 8) {
      case 0: return dictType();
      case 1: return makeType('s');
      case 2: return makeType('x');
      case 3: return makeType('b');
      case 4: return makeType('g');
      default: return anyType(0);
    }
  }

  TypeRef anyType(int depth) {
    const std::uint8_t choice = in_.byte();
    const std::size_t kind = choice % 16u;
    if (kind < kBasicCount || depth >= 6) {
      return makeType(kBasicTypes[choice % kBasicCount]);
    }
    switch (kind) {
      case 12: return makeType('v');
      case 13: return makeType('a', {anyType(depth + 1)});
      case 14: {
        TypeRef key = makeType(kBasicTypes[in_.byte() % kBasicCount]);
        return makeType('a', {makeType('e', {std::move(key), anyType(depth + 1)})});
      }
      default: {
        std::vector<TypeRef> members;
        const std::size_t count = 1U + in_.byte() % 3U;
        members.reserve(count);
        for (std::size_t i = 0; i < count; ++i) {
          members.push_back(anyType(depth + 1));
        }
        return makeType('r', std::move(members));
      }
    }
  }

  Value topValue() {
    switch (in_.byte() % 4) {
      case 0: return value(dictType());
      case 1: return value(makeType('v'));
      case 2: return value(anyType(0));
      default: return value(mappedType());
    }
  }

  Value value(const TypeRef& type) {
    Value out{type, 0, {}, {}};
    if (budget_ > 0) {
      --budget_;
    }
    switch (type->code) {
      case 'y':
      case 'b':  // sd-bus stores any non-zero int as true
        out.bits = in_.byte();
        break;
      case 'n':
      case 'q': out.bits = in_.integer<std::uint16_t>(); break;
      case 'i':
      case 'u': out.bits = in_.integer<std::uint32_t>(); break;
      case 'x':
      case 't':
      case 'd': out.bits = in_.integer<std::uint64_t>(); break;
      case 's':
        // sd-bus takes C strings: what follows a NUL never reaches the message.
        out.text = in_.text();
        out.text.resize(std::strlen(out.text.c_str()));
        break;
      case 'o': out.text = kObjectPaths[in_.byte() % std::size(kObjectPaths)]; break;
      case 'g': out.text = kSignatures[in_.byte() % std::size(kSignatures)]; break;
      case 'v': out.items.push_back(value(budget_ > 0 ? mappedType() : makeType('b'))); break;
      case 'a': fillArray(out); break;
      default:  // 'e' and 'r'
        for (const TypeRef& member : type->members) {
          out.items.push_back(value(member));
        }
        break;
    }
    return out;
  }

 private:
  // A rare count byte asks for many copies of one element; string keys of dictionary entries
  // then cycle through largeKey(0), largeKey(1), ... up to a modulus, so that the copies reach the
  // entry limit, repeat keys, or both.
  void fillArray(Value& array) {
    const TypeRef& element = array.type->members[0];
    const std::uint8_t count = in_.byte();
    if (count < 0xF8) {
      for (int i = 0; i < count % 8 && budget_ > 0; ++i) {
        array.items.push_back(value(element));
      }
      return;
    }
    std::size_t copies = largeSizes_.pick(count);
    const std::size_t modulus = 1u + in_.integer<std::uint16_t>();
    const std::size_t before = budget_;
    const Value pattern = value(element);
    const std::size_t used = before - budget_ + 1;
    copies = std::min(copies, budget_ / used);
    budget_ -= copies * used;
    const bool stringKeys = element->code == 'e' && element->members[0]->code == 's';
    for (std::size_t i = 0; i < copies; ++i) {
      array.items.push_back(pattern);
      if (stringKeys) {
        array.items.back().items[0].text = largeKey(i % modulus);
      }
    }
  }

  FuzzInput& in_;
  std::size_t budget_ = kNodeBudget;
  LargeSizes largeSizes_;
};

int append(sd_bus_message* message, const Value& value) {
  const char code = value.type->code;
  switch (code) {
    case 'y': {
      const auto number = static_cast<std::uint8_t>(value.bits);
      return sd_bus_message_append_basic(message, code, &number);
    }
    case 'n':
    case 'q': {
      const auto number = static_cast<std::uint16_t>(value.bits);
      return sd_bus_message_append_basic(message, code, &number);
    }
    case 'b': {
      const int flag = static_cast<int>(value.bits);
      return sd_bus_message_append_basic(message, code, &flag);
    }
    case 'i':
    case 'u': {
      const auto number = static_cast<std::uint32_t>(value.bits);
      return sd_bus_message_append_basic(message, code, &number);
    }
    case 'x':
    case 't':
    case 'd': return sd_bus_message_append_basic(message, code, &value.bits);
    case 's':
    case 'o':
    case 'g': return sd_bus_message_append_basic(message, code, value.text.c_str());
    default: break;
  }
  const std::string& own = value.type->signature;
  std::string contents;
  if (code == 'v') {
    contents = value.items[0].type->signature;
  } else if (code == 'a') {
    contents = own.substr(1);
  } else {
    contents = own.substr(1, own.size() - 2);
  }
  int r = sd_bus_message_open_container(message, code, contents.c_str());
  for (std::size_t i = 0; r >= 0 && i < value.items.size(); ++i) {
    r = append(message, value.items[i]);
  }
  return r < 0 ? r : sd_bus_message_close_container(message);
}

// What decoding must give, or nothing when the value lies outside the mapping. depth as the
// codec counts it: the dictionaries around a variant, or a dictionary's own level.
std::optional<MessageDict> expectDict(const Value& array, int depth, std::size_t& values);

std::optional<MessageValue> expectVariant(const Value& variant, int depth, std::size_t& values) {
  ++values;
  const Value& inner = variant.items[0];
  const std::string& type = inner.type->signature;
  if (type == "s") {
    return MessageValue::string(inner.text);
  }
  if (type == "x") {
    return MessageValue::int64(static_cast<std::int64_t>(inner.bits));
  }
  if (type == "b") {
    return MessageValue::boolean(inner.bits != 0);
  }
  if (type == "g" && inner.text.empty()) {
    return MessageValue::null();
  }
  if (type == "a{sv}") {
    std::optional<MessageDict> dict = expectDict(inner, depth + 1, values);
    if (dict) {
      return MessageValue::dict(std::move(*dict));
    }
  }
  return std::nullopt;
}

std::optional<MessageDict> expectDict(const Value& array, int depth, std::size_t& values) {
  if (depth > bus::kMaxDictDepth) {
    return std::nullopt;
  }
  MessageDict dict;
  for (const Value& entry : array.items) {
    std::optional<MessageValue> item = expectVariant(entry.items[1], depth, values);
    if (!item) {
      return std::nullopt;
    }
    dict.set(entry.items[0].text, std::move(*item));
    if (dict.size() > bus::kMaxDictEntries) {
      return std::nullopt;
    }
  }
  return dict;
}

// After a value was read, the next one in the body is the one that follows it.
void checkNext(sd_bus_message* message, const std::vector<Value>& body) {
  char type = 0;
  const char* contents = nullptr;
  const int r = sd_bus_message_peek_type(message, &type, &contents);
  if (body.size() > 1) {
    check(r > 0 && type == body[1].type->code, "the read stops right after the value");
  } else {
    check(r == 0, "the read ends the message", [&] { return std::to_string(r); });
  }
}

void checkRead(sd_bus_message* message, const std::vector<Value>& body, bool asDict) {
  check(sd_bus_message_rewind(message, 1) >= 0, "rewind");
  const Value& first = body[0];
  std::size_t values = 0;
  std::optional<MessageValue> want;
  if (asDict && first.type->signature == "a{sv}") {
    if (std::optional<MessageDict> dict = expectDict(first, 1, values)) {
      want = MessageValue::dict(std::move(*dict));
    }
  } else if (!asDict && first.type->code == 'v') {
    want = expectVariant(first, 0, values);
  }
  if (values > bus::kMaxValues) {
    want.reset();
  }

  MessageValue got;
  int r = 0;
  if (asDict) {
    MessageDict dict;
    r = bus::readDict(message, dict);
    got = MessageValue::dict(std::move(dict));
  } else {
    r = bus::readVariant(message, got);
  }
  const char* reader = asDict ? "readDict" : "readVariant";
  if (!want) {
    check(r < 0, "a value outside the mapping or its limits is refused", [&] {
      return std::string(reader) + " took " + first.type->signature + " as " + describe(got);
    });
    return;
  }
  check(r == 0, "a value the mapping covers is accepted", [&] {
    return std::string(reader) + " returned " + std::to_string(r) + " for " + describe(*want);
  });
  check(got == *want, "decoding gives what was appended", [&] {
    return std::string(reader) + " gave " + describe(got) + "\nappended " + describe(*want);
  });
  checkNext(message, body);
}

}  // namespace
}  // namespace halvex::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace halvex::fuzz;
  FuzzInput in(data, size);
  Builder builder(in);
  std::vector<Value> body;
  const std::size_t count = 1U + in.byte() % 3U;
  body.reserve(count);
  for (std::size_t i = 0; i < count; ++i) {
    body.push_back(builder.topValue());
  }
  Message message = newMessage();
  for (const Value& value : body) {
    // sd-bus refused a piece (a string that is not UTF-8, a container nested too deep): no peer
    // can send such a message, so there is nothing to decode.
    if (append(message.get(), value) < 0) {
      return 0;
    }
  }
  check(sealForReading(message.get()) >= 0, "seal");
  checkRead(message.get(), body, true);
  checkRead(message.get(), body, false);
  return 0;
}
