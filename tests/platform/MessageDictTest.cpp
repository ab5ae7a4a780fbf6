// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include "platform/MessageDict.h"

namespace halvex {
namespace {

std::vector<std::string> keysOf(const MessageDict& dict) {
  std::vector<std::string> keys;
  for (const auto& entry : dict.entries()) {
    keys.push_back(entry.first);
  }
  return keys;
}

TEST(MessageDictTest, KeysKeepInsertionOrderAndReplacingKeepsPosition) {
  MessageDict dict;
  dict.set("zeta", MessageValue::string("z"));
  dict.set("alpha", MessageValue::int64(1));
  dict.set("Mid", MessageValue::boolean(true));
  dict.set("alpha", MessageValue::string("replaced"));

  EXPECT_EQ(keysOf(dict), (std::vector<std::string>{"zeta", "alpha", "Mid"}));
  EXPECT_EQ(dict.getString("alpha"), "replaced");
}

TEST(MessageDictTest, GetStringFallsBackForMissingNullAndOtherKinds) {
  MessageDict dict;
  dict.set("text", MessageValue::string(""));
  dict.set("null", MessageValue::null());
  dict.set("number", MessageValue::int64(3));
  dict.set("flag", MessageValue::boolean(true));
  dict.set("nested", MessageValue::dict(MessageDict()));

  // An empty string is a string, not a missing value.
  EXPECT_EQ(dict.getString("text", "default"), "");
  for (const char* key : {"absent", "null", "number", "flag", "nested"}) {
    EXPECT_EQ(dict.getString(key, "default"), "default") << key;
  }
}

TEST(MessageDictTest, ValuesReportExactlyOneKind) {
  struct Case {
    MessageValue value;
    MessageValue::Kind kind;
  };
  const Case cases[] = {
      {MessageValue(), MessageValue::Kind::kNull},
      {MessageValue::string("s"), MessageValue::Kind::kString},
      {MessageValue::int64(-5), MessageValue::Kind::kInt64},
      {MessageValue::boolean(false), MessageValue::Kind::kBool},
      {MessageValue::dict(MessageDict()), MessageValue::Kind::kDict},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(c.value.kind(), c.kind) << describe(c.value);
    EXPECT_EQ(c.value.isDict(), c.kind == MessageValue::Kind::kDict);
    EXPECT_EQ(c.value.asString() != nullptr, c.kind == MessageValue::Kind::kString);
    EXPECT_EQ(c.value.asInt64() != nullptr, c.kind == MessageValue::Kind::kInt64);
    EXPECT_EQ(c.value.asBool() != nullptr, c.kind == MessageValue::Kind::kBool);
  }
  // A false boolean and a zero are values, not null.
  EXPECT_FALSE(MessageValue::boolean(false).isNull());
  EXPECT_FALSE(MessageValue::int64(0).isNull());
}

TEST(MessageDictTest, NestedDictionariesCopyDeeply) {
  MessageDict inner;
  inner.set("k", MessageValue::string("before"));
  MessageDict outer;
  outer.set("inner", MessageValue::dict(inner));

  MessageDict copy = outer;
  inner.set("k", MessageValue::string("after"));
  outer.set("inner", MessageValue::dict(inner));

  EXPECT_EQ(copy.get("inner")->asDict()->getString("k"), "before");
  EXPECT_EQ(outer.get("inner")->asDict()->getString("k"), "after");
  EXPECT_NE(copy, outer);
}

TEST(MessageDictTest, EqualityDependsOnKeyOrder) {
  MessageDict a;
  a.set("x", MessageValue::int64(1));
  a.set("y", MessageValue::int64(2));
  MessageDict b;
  b.set("y", MessageValue::int64(2));
  b.set("x", MessageValue::int64(1));
  EXPECT_NE(a, b);
}

TEST(MessageDictTest, KeysAndStringsAreByteStrings) {
  const std::string binary("a\0\xff", 3);
  MessageDict dict;
  dict.set(binary, MessageValue::string(binary));
  dict.set("a", MessageValue::string("short"));
  EXPECT_EQ(dict.size(), 2u);
  EXPECT_EQ(dict.getString(binary), binary);
  EXPECT_EQ(dict.getString("a"), "short");
}

TEST(MessageDictTest, DescribeRendersEveryKind) {
  MessageDict dict;
  dict.set("s", MessageValue::string("q\""));
  dict.set("n", MessageValue::int64(-7));
  dict.set("b", MessageValue::boolean(true));
  dict.set("z", MessageValue());
  dict.set("d", MessageValue::dict(MessageDict()));
  EXPECT_EQ(describe(MessageValue::dict(dict)),
            R"({"s": "q\"", "n": -7, "b": true, "z": null, "d": {}})");
}

}  // namespace
}  // namespace halvex
