// SPDX-License-Identifier: MIT
// The codec against real sd-bus messages, without a bus daemon.
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <cerrno>
#include <functional>
#include <string>

#include "platform/linux/MessageCodec.h"

namespace halvex::bus {
namespace {

using Message = std::unique_ptr<sd_bus_message, decltype(&sd_bus_message_unref)>;

// A message to fill. sd-bus makes messages only on a started bus: the process keeps one on one
// end of a socket pair, whose other end nobody reads, so the messages never leave the process.
Message newMessage() {
  static sd_bus* const bus = [] {
    int fds[2];
    sd_bus* started = nullptr;
    const bool ok = socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == 0 &&
                    sd_bus_new(&started) >= 0 && sd_bus_set_fd(started, fds[0], fds[0]) >= 0 &&
                    sd_bus_start(started) >= 0;
    return ok ? started : nullptr;
  }();
  sd_bus_message* message = nullptr;
  EXPECT_GE(sd_bus_message_new_method_call(bus, &message, "org.halvex.Test", "/org/halvex/Test",
                                           "org.halvex.Test1", "Echo"),
            0);
  return Message(message, sd_bus_message_unref);
}

// Seals message as if it had been sent and rewinds it for reading, as a received one would be.
void seal(const Message& message) {
  ASSERT_GE(sd_bus_message_seal(message.get(), 1, 0), 0);
  ASSERT_GE(sd_bus_message_rewind(message.get(), 1), 0);
}

MessageValue dictOf(std::initializer_list<std::pair<const char*, MessageValue>> entries) {
  MessageDict dict;
  for (const auto& [key, value] : entries) {
    dict.set(key, value);
  }
  return MessageValue::dict(std::move(dict));
}

MessageValue nested(int depth) {
  MessageValue value = MessageValue::string("leaf");
  for (int i = 0; i < depth; ++i) {
    value = dictOf({{"inner", value}});
  }
  return value;
}

TEST(CodecTest, ValuesSurviveTheTripWithTheirKeyOrder) {
  const MessageValue cases[] = {
      MessageValue::null(),
      MessageValue::string(""),
      MessageValue::string("Grüße \u2603 \U0001F600"),
      MessageValue::string("\u0080\u0800\U00010000"),  // the least of each length
      MessageValue::int64(INT64_MIN),
      MessageValue::int64(INT64_MAX),
      MessageValue::boolean(true),
      MessageValue::boolean(false),
      MessageValue::dict({}),
      dictOf({{"zeta", MessageValue::int64(1)},
              {"alpha", MessageValue::null()},
              {"mid", dictOf({{"y", MessageValue::boolean(false)}, {"x", MessageValue()}})}}),
      nested(kMaxDictDepth),
  };
  for (const MessageValue& value : cases) {
    Message message = newMessage();
    ASSERT_EQ(appendVariant(message.get(), value), 0) << describe(value);
    const MessageDict* dict = value.asDict();
    ASSERT_TRUE(dict == nullptr || appendDict(message.get(), *dict) == 0);
    seal(message);
    MessageValue decoded = MessageValue::string("sentinel");
    EXPECT_EQ(readVariant(message.get(), decoded), 0);
    EXPECT_EQ(decoded, value) << describe(value);
    if (dict != nullptr) {
      MessageDict plain;
      EXPECT_EQ(readDict(message.get(), plain), 0);
      EXPECT_EQ(plain, *dict);
    }
  }

  // Null is a variant holding an empty signature.
  Message message = newMessage();
  ASSERT_EQ(appendVariant(message.get(), MessageValue::null()), 0);
  ASSERT_EQ(appendDict(message.get(), MessageDict()), 0);
  seal(message);
  EXPECT_STREQ(sd_bus_message_get_signature(message.get(), 1), "va{sv}");
  const char* empty = nullptr;
  ASSERT_GT(sd_bus_message_read(message.get(), "v", "g", &empty), 0);
  EXPECT_STREQ(empty, "");
}

TEST(CodecTest, StringsTheBusCannotCarryTravelAsNull) {
  const std::string cases[] = {
      "caf\xe9",
      "ab\xc3",
      "\xc0\xaf" /* overlong */,
      "\xed\xa0\x80" /* surrogate */,
      "\xf4\x90\x80\x80" /* beyond Unicode */,
      "\xef\xbf\xbe" /* U+FFFE */,
      "\xef\xb7\x90" /* U+FDD0 */,
      "\xf0\x9f\xbf\xbf" /* U+1FFFF */,
      std::string("a\0b", 3),
  };
  MessageDict sent, expected;
  for (const std::string& text : cases) {
    const std::string key = "k" + std::to_string(sent.size());
    sent.set(key, MessageValue::string(text));
    expected.set(key, MessageValue::null());
  }
  Message message = newMessage();
  ASSERT_EQ(appendDict(message.get(), sent), 0);
  seal(message);
  MessageDict back;
  ASSERT_EQ(readDict(message.get(), back), 0);
  EXPECT_EQ(back, expected);
}

TEST(CodecTest, UnsendableShapesAreRejectedBeforeAnythingIsAppended) {
  MessageDict tooWide;
  for (std::size_t i = 0; i <= kMaxDictEntries; ++i) {
    tooWide.set("k" + std::to_string(i), MessageValue());
  }
  const std::pair<MessageValue, int> cases[] = {
      {dictOf({{"ok", MessageValue()}, {"\xfe", MessageValue()}}), -EINVAL},
      {nested(kMaxDictDepth + 1), -EINVAL},
      {MessageValue::dict(tooWide), -E2BIG},
  };
  for (const auto& [value, error] : cases) {
    Message message = newMessage();
    EXPECT_EQ(appendVariant(message.get(), value), error) << describe(value).substr(0, 40);
    EXPECT_EQ(appendDict(message.get(), *value.asDict()), error);
    // The message is still usable and holds nothing of the rejected value.
    ASSERT_EQ(appendVariant(message.get(), MessageValue::int64(7)), 0);
    seal(message);
    EXPECT_STREQ(sd_bus_message_get_signature(message.get(), 1), "v");
  }
}

// Builds "a{sv}" whose only value is the next level, innermost holding an empty dictionary.
void appendRawNesting(sd_bus_message* message, int levels) {
  ASSERT_GE(sd_bus_message_open_container(message, 'a', "{sv}"), 0);
  if (levels > 1) {
    ASSERT_GE(sd_bus_message_open_container(message, 'e', "sv"), 0);
    ASSERT_GE(sd_bus_message_append_basic(message, 's', "k"), 0);
    ASSERT_GE(sd_bus_message_open_container(message, 'v', "a{sv}"), 0);
    appendRawNesting(message, levels - 1);
    ASSERT_GE(sd_bus_message_close_container(message), 0);
    ASSERT_GE(sd_bus_message_close_container(message), 0);
  }
  ASSERT_GE(sd_bus_message_close_container(message), 0);
}

// A builder that appends its arguments with sd_bus_message_append.
#define APPENDING(...) [](sd_bus_message* m) { return sd_bus_message_append(m, __VA_ARGS__); }

TEST(CodecTest, ForeignShapesAreRefusedWithoutCrashing) {
  const std::pair<const char*, std::function<int(sd_bus_message*)>> cases[] = {
      {"nothing there", [](sd_bus_message*) { return 0; }},
      {"plain int32", APPENDING("i", 1)},
      {"string dict", APPENDING("a{ss}", 1, "k", "v")},
      {"variant int32", APPENDING("v", "i", 5)},
      {"non-empty signature", APPENDING("v", "g", "s")},
      {"int32 in a dict", APPENDING("v", "a{sv}", 1, "k", "i", 3)},
      {"too deep",
       [](sd_bus_message* m) {
         sd_bus_message_open_container(m, 'v', "a{sv}");
         appendRawNesting(m, kMaxDictDepth + 1);
         return sd_bus_message_close_container(m);
       }},
      {"too many entries",
       [](sd_bus_message* m) {
         sd_bus_message_open_container(m, 'v', "a{sv}");
         sd_bus_message_open_container(m, 'a', "{sv}");
         for (std::size_t i = 0; i <= kMaxDictEntries; ++i) {
           sd_bus_message_append(m, "{sv}", std::to_string(i).c_str(), "b", 1);
         }
         sd_bus_message_close_container(m);
         return sd_bus_message_close_container(m);
       }},
  };
  for (const auto& [name, build] : cases) {
    Message message = newMessage();
    ASSERT_GE(build(message.get()), 0) << name;
    seal(message);
    MessageValue value = MessageValue::string("untouched");
    EXPECT_LT(readVariant(message.get(), value), 0) << name;
    EXPECT_EQ(value, MessageValue::string("untouched")) << name;
    ASSERT_GE(sd_bus_message_rewind(message.get(), 1), 0);
    MessageDict dict;
    dict.set("kept", MessageValue());
    EXPECT_LT(readDict(message.get(), dict), 0) << name;
    EXPECT_TRUE(dict.contains("kept")) << name;
  }
}

}  // namespace
}  // namespace halvex::bus
