// SPDX-License-Identifier: MIT
// Encoding what the tool may be asked to send: the input becomes a MessageDict or a MessageValue
// with any bytes in its keys and strings, nesting and sizes on both sides of the limits. The
// append either succeeds and the message reads back the same value, or fails for a reason the
// value gives and leaves the message exactly as it was.
#include <systemd/sd-bus.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <map>
#include <string>
#include <string_view>

#include "fuzz/FuzzBus.h"
#include "fuzz/FuzzSupport.h"
#include "platform/MessageDict.h"
#include "platform/linux/MessageCodec.h"

namespace halvex::fuzz {
namespace {

// Strings on either side of what sd-bus takes, which random bytes rarely hit.
constexpr std::string_view kOddStrings[] = {
    std::string_view("a\0b", 3),
    "\xC0\x80",          // overlong NUL
    "\xED\xA0\x80",      // UTF-16 surrogate
    "\xEF\xB7\x90",      // U+FDD0, a noncharacter
    "\xF0\x9F\xBF\xBF",  // U+1FFFF, a noncharacter
    "\xF4\x90\x80\x80",  // beyond U+10FFFF
    "\xE2\x98",          // cut short
    "\xEF\xBF\xBD",      // U+FFFD, fine
    "\xF0\x9F\x98\x80",  // U+1F600, fine
    "",
};
constexpr int kMaxGeneratedDepth = bus::kMaxDictDepth + 3;
constexpr std::size_t kValueBudget = 40000;

class Builder {
 public:
  explicit Builder(FuzzInput& in) : in_(in) {}

  // depth: the dictionaries around the value.
  MessageValue value(int depth) {
    if (budget_ == 0) {
      return MessageValue::null();
    }
    --budget_;
    switch (in_.byte() % 8) {
      case 0: return MessageValue::null();
      case 1:
      case 2: return MessageValue::string(string());
      case 3: return MessageValue::int64(in_.integer<std::int64_t>());
      case 4: return MessageValue::boolean((in_.byte() & 1) != 0);
      default:
        return depth < kMaxGeneratedDepth ? MessageValue::dict(dict(depth + 1))
                                          : MessageValue::null();
    }
  }

  // depth: the dictionary's own level, 1 for the outermost.
  MessageDict dict(int depth) {
    MessageDict out;
    const std::uint8_t count = in_.byte();
    if (count < 0xF8) {
      for (int i = 0; i < count % 6; ++i) {
        std::string key = string();
        out.set(key, value(depth));
      }
      return out;
    }
    // Entries holding copies of one value, within the budget.
    const std::size_t before = budget_;
    const MessageValue pattern = value(depth);
    const std::size_t used = before - budget_ + 1;
    const std::size_t entries = std::min(largeSizes_.pick(count), budget_ / used);
    budget_ -= entries * used;
    for (std::size_t i = 0; i < entries; ++i) {
      out.set(largeKey(i), pattern);
    }
    return out;
  }

 private:
  std::string string() {
    const std::uint8_t choice = in_.byte();
    if ((choice & 1) != 0) {
      return std::string(kOddStrings[(choice >> 1) % std::size(kOddStrings)]);
    }
    return in_.text();
  }

  FuzzInput& in_;
  std::size_t budget_ = kValueBudget;
  LargeSizes largeSizes_;
};

// What the codec may do with a value. Whether a string can travel is sd-bus's own call, asked on
// a message of its own so that a refusal harms nothing.
class Oracle {
 public:
  // A key the bus cannot carry, or a value beyond the nesting or size limits.
  bool mustRefuse = false;
  // A string value the bus cannot carry: the codec may refuse the whole value or send that
  // string as null.
  bool oddString = false;
  std::size_t values = 0;

  // depth: the dictionaries around the value.
  void survey(const MessageValue& value, int depth) {
    ++values;
    if (const std::string* text = value.asString()) {
      oddString = oddString || !carryable(*text);
    } else if (const MessageDict* dict = value.asDict()) {
      surveyDict(*dict, depth + 1);
    }
  }

  // depth: the dictionary's own level.
  void surveyDict(const MessageDict& dict, int depth) {
    if (depth > bus::kMaxDictDepth || dict.size() > bus::kMaxDictEntries) {
      mustRefuse = true;
    }
    for (const auto& [key, item] : dict.entries()) {
      mustRefuse = mustRefuse || !carryable(key);
      survey(item, depth);
    }
    if (values > bus::kMaxValues) {
      mustRefuse = true;
    }
  }

  // Whether got is sent as it came back: equal, but for null where a string could not travel.
  bool cameBack(const MessageValue& got, const MessageValue& sent) {
    if (const std::string* text = sent.asString(); text != nullptr && !carryable(*text)) {
      return got.isNull();
    }
    const MessageDict* gotDict = got.asDict();
    const MessageDict* sentDict = sent.asDict();
    if (gotDict == nullptr || sentDict == nullptr) {
      return got == sent;
    }
    if (gotDict->size() != sentDict->size()) {
      return false;
    }
    for (std::size_t i = 0; i < sentDict->size(); ++i) {
      const auto& [gotKey, gotItem] = gotDict->entries()[i];
      const auto& [sentKey, sentItem] = sentDict->entries()[i];
      if (gotKey != sentKey || !cameBack(gotItem, sentItem)) {
        return false;
      }
    }
    return true;
  }

 private:
  bool carryable(const std::string& text) {
    auto found = known_.find(text);
    if (found == known_.end()) {
      Message scratch = newMessage();
      const bool fits = text.find('\0') == std::string::npos &&
                        sd_bus_message_append_basic(scratch.get(), 's', text.c_str()) >= 0;
      found = known_.emplace(text, fits).first;
    }
    return found->second;
  }

  std::map<std::string, bool> known_;
};

constexpr char kHead[] = "head";
constexpr std::int64_t kTail = 42;

// The marker appended before the value must come first, and the one appended after it last.
void checkMarkers(sd_bus_message* message, bool atHead) {
  if (atHead) {
    const char* head = nullptr;
    check(sd_bus_message_read_basic(message, 's', &head) > 0 && std::strcmp(head, kHead) == 0,
          "the head marker reads back");
  } else {
    std::int64_t tail = 0;
    check(sd_bus_message_read_basic(message, 'x', &tail) > 0 && tail == kTail,
          "the tail marker follows the value");
  }
}

}  // namespace
}  // namespace halvex::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace halvex;
  using namespace halvex::fuzz;
  FuzzInput in(data, size);
  const bool asVariant = (in.byte() & 1) != 0;
  Builder builder(in);
  const MessageValue original = asVariant ? builder.value(0) : MessageValue::dict(builder.dict(1));

  Oracle oracle;
  if (asVariant) {
    oracle.survey(original, 0);
  } else {
    oracle.surveyDict(*original.asDict(), 1);
  }

  Message message = newMessage();
  check(sd_bus_message_append_basic(message.get(), 's', kHead) >= 0, "append the head marker");
  const int r = asVariant ? bus::appendVariant(message.get(), original)
                          : bus::appendDict(message.get(), *original.asDict());
  sd_bus_message_append_basic(message.get(), 'x', &kTail);
  check(sealForReading(message.get()) >= 0, "the message is complete after the call",
        [&] { return std::to_string(r); });
  const std::string signature = sd_bus_message_get_signature(message.get(), 1);
  checkMarkers(message.get(), true);

  if (r < 0) {
    check(oracle.mustRefuse || oracle.oddString, "a value the bus can carry is sent",
          [&] { return std::to_string(r) + " for " + describe(original); });
    check(signature == "sx", "a refused value leaves the message as it was", signature);
  } else {
    check(r == 0, "success is 0", [&] { return std::to_string(r); });
    check(!oracle.mustRefuse, "a value beyond the limits or with a bad key is refused",
          [&] { return describe(original); });
    check(signature == (asVariant ? "svx" : "sa{sv}x"), "one value is appended", signature);
    MessageValue got;
    if (asVariant) {
      check(bus::readVariant(message.get(), got) == 0, "what was sent is read back");
    } else {
      MessageDict dict;
      check(bus::readDict(message.get(), dict) == 0, "what was sent is read back");
      got = MessageValue::dict(std::move(dict));
    }
    check(oracle.cameBack(got, original), "the value survives the trip",
          [&] { return "sent " + describe(original) + "\nread " + describe(got); });
  }
  checkMarkers(message.get(), false);
  return 0;
}
