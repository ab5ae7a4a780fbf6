// SPDX-License-Identifier: MIT
// The codec against real sd-bus messages, without a bus daemon.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <functional>
#include <string>

#include "platform/linux/MessageCodec.h"

namespace halvex::bus {
namespace {

// sd-bus refuses to create messages on a bus that was never started, so each test starts one on
// one end of a socket pair. Nothing reads the other end; the messages never leave the process.
class CodecTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds_), 0);
    ASSERT_GE(sd_bus_new(&bus_), 0);
    ASSERT_GE(sd_bus_set_fd(bus_, fds_[0], fds_[0]), 0);
    ASSERT_GE(sd_bus_start(bus_), 0);
  }

  void TearDown() override {
    sd_bus_unref(bus_);  // closes fds_[0]
    close(fds_[1]);
  }

  sd_bus_message* newMessage() {
    sd_bus_message* message = nullptr;
    EXPECT_GE(sd_bus_message_new_method_call(bus_, &message, "org.halvex.Test", "/org/halvex/Test",
                                             "org.halvex.Test1", "Echo"),
              0);
    return message;
  }

  // Seals message as if it had been sent and rewinds it for reading, as a received one would be.
  static void seal(sd_bus_message* message) {
    ASSERT_GE(sd_bus_message_seal(message, 1, 0), 0);
    ASSERT_GE(sd_bus_message_rewind(message, 1), 0);
  }

  sd_bus* bus_ = nullptr;
  int fds_[2] = {-1, -1};
};

using Message = std::unique_ptr<sd_bus_message, decltype(&sd_bus_message_unref)>;

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

TEST_F(CodecTest, ValuesSurviveTheTripWithTheirKeyOrder) {
  const MessageValue cases[] = {
      MessageValue::null(),
      MessageValue::string(""),
      MessageValue::string("Grüße \u2603 \U0001F600"),
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
    Message message(newMessage(), sd_bus_message_unref);
    ASSERT_EQ(appendVariant(message.get(), value), 0) << describe(value);
    if (const MessageDict* dict = value.asDict()) {
      ASSERT_EQ(appendDict(message.get(), *dict), 0);
    }
    seal(message.get());
    MessageValue decoded = MessageValue::string("sentinel");
    EXPECT_EQ(readVariant(message.get(), decoded), 0);
    EXPECT_EQ(decoded, value) << describe(value);
    if (const MessageDict* dict = value.asDict()) {
      MessageDict plain;
      EXPECT_EQ(readDict(message.get(), plain), 0);
      EXPECT_EQ(plain, *dict);
    }
  }
}

TEST_F(CodecTest, WireSignaturesFollowTheMapping) {
  Message message(newMessage(), sd_bus_message_unref);
  ASSERT_EQ(appendVariant(message.get(), MessageValue::null()), 0);
  ASSERT_EQ(appendDict(message.get(), MessageDict()), 0);
  seal(message.get());
  EXPECT_STREQ(sd_bus_message_get_signature(message.get(), 1), "va{sv}");
  const char* empty = nullptr;
  ASSERT_GT(sd_bus_message_read(message.get(), "v", "g", &empty), 0);
  EXPECT_STREQ(empty, "");
}

TEST_F(CodecTest, StringsTheBusCannotCarryTravelAsNull) {
  const std::string withNul("a\0b", 3);
  const struct {
    const char* name;
    std::string text;
  } cases[] = {
      {"invalid byte", "caf\xe9"},
      {"truncated sequence", "ab\xc3"},
      {"overlong slash", "\xc0\xaf"},
      {"surrogate", "\xed\xa0\x80"},
      {"beyond unicode", "\xf4\x90\x80\x80"},
      {"noncharacter U+FFFE", "\xef\xbf\xbe"},
      {"noncharacter U+FDD0", "\xef\xb7\x90"},
      {"noncharacter U+1FFFF", "\xf0\x9f\xbf\xbf"},
      {"embedded NUL", withNul},
  };
  for (const auto& c : cases) {
    MessageDict request;
    request.set("before", MessageValue::int64(1));
    request.set("reason", MessageValue::string(c.text));
    Message message(newMessage(), sd_bus_message_unref);
    ASSERT_EQ(appendDict(message.get(), request), 0) << c.name;
    seal(message.get());
    MessageDict back;
    ASSERT_EQ(readDict(message.get(), back), 0) << c.name;
    request.set("reason", MessageValue::null());
    EXPECT_EQ(back, request) << c.name;
  }
}

TEST_F(CodecTest, UnsendableShapesAreRejectedBeforeAnythingIsAppended) {
  MessageDict tooWide;
  for (std::size_t i = 0; i <= kMaxDictEntries; ++i) {
    tooWide.set(std::string("k").append(std::to_string(i)), MessageValue());
  }
  const struct {
    const char* name;
    MessageValue value;
    int error;
  } cases[] = {
      {"bad key", dictOf({{"ok", MessageValue()}, {"\xfe", MessageValue()}}), -EINVAL},
      {"too deep", nested(kMaxDictDepth + 1), -EINVAL},
      {"too many entries", MessageValue::dict(tooWide), -E2BIG},
  };
  for (const auto& c : cases) {
    Message message(newMessage(), sd_bus_message_unref);
    EXPECT_EQ(appendVariant(message.get(), c.value), c.error) << c.name;
    EXPECT_EQ(appendDict(message.get(), *c.value.asDict()), c.error) << c.name;
    // The message is still usable and holds nothing of the rejected value.
    ASSERT_EQ(appendVariant(message.get(), MessageValue::int64(7)), 0) << c.name;
    seal(message.get());
    EXPECT_STREQ(sd_bus_message_get_signature(message.get(), 1), "v") << c.name;
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

TEST_F(CodecTest, ForeignShapesAreRefusedWithoutCrashing) {
  using Build = std::function<int(sd_bus_message*)>;
  const struct {
    const char* name;
    Build build;
  } cases[] = {
      {"nothing there", [](sd_bus_message*) { return 0; }},
      {"plain int32", [](sd_bus_message* m) { return sd_bus_message_append(m, "i", 1); }},
      {"string array", [](sd_bus_message* m) { return sd_bus_message_append(m, "as", 1, "x"); }},
      {"string dict",
       [](sd_bus_message* m) { return sd_bus_message_append(m, "a{ss}", 1, "k", "v"); }},
      {"variant int32", [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "i", 5); }},
      {"variant struct",
       [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "(s)", "x"); }},
      {"variant in variant",
       [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "v", "s", "x"); }},
      {"signature that is not empty",
       [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "g", "s"); }},
      {"dict with int32 inside",
       [](sd_bus_message* m) { return sd_bus_message_append(m, "v", "a{sv}", 1, "k", "i", 3); }},
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
  for (const auto& c : cases) {
    Message message(newMessage(), sd_bus_message_unref);
    ASSERT_GE(c.build(message.get()), 0) << c.name;
    seal(message.get());
    MessageValue value = MessageValue::string("untouched");
    EXPECT_LT(readVariant(message.get(), value), 0) << c.name;
    EXPECT_EQ(value, MessageValue::string("untouched")) << c.name;
    ASSERT_GE(sd_bus_message_rewind(message.get(), 1), 0);
    MessageDict dict;
    dict.set("kept", MessageValue());
    EXPECT_LT(readDict(message.get(), dict), 0) << c.name;
    EXPECT_TRUE(dict.contains("kept")) << c.name;
  }
}

TEST_F(CodecTest, RepeatedKeyKeepsFirstPositionAndLastValue) {
  Message message(newMessage(), sd_bus_message_unref);
  ASSERT_GE(sd_bus_message_append(message.get(), "a{sv}", 3, "a", "x", int64_t{1}, "b", "b", 1, "a",
                                  "s", "last"),
            0);
  seal(message.get());
  MessageDict dict;
  ASSERT_EQ(readDict(message.get(), dict), 0);
  ASSERT_EQ(dict.size(), 2u);
  EXPECT_EQ(dict.entries()[0].first, "a");
  EXPECT_EQ(dict.entries()[0].second, MessageValue::string("last"));
  EXPECT_EQ(dict.entries()[1].first, "b");
}

}  // namespace
}  // namespace halvex::bus
