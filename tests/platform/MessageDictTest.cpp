// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include "platform/MessageDict.h"

namespace halvex {
namespace {

// Every kind renders as itself: a value that reported a wrong kind would not.
TEST(MessageDictTest, KeysKeepInsertionOrderAndReplacingKeepsPosition) {
  MessageDict dict;
  dict.set("s", MessageValue::string(R"(q"\)"));
  dict.set("n", MessageValue::int64(-7));
  dict.set("b", MessageValue::boolean(true));
  dict.set("z", MessageValue());
  dict.set("d", MessageValue::dict(MessageDict()));
  dict.set("n", MessageValue::boolean(false));
  EXPECT_EQ(describe(MessageValue::dict(dict)),
            R"({"s": "q\"\\", "n": false, "b": true, "z": null, "d": {}})");

  // Equal only with the same keys in the same order.
  MessageDict same, reversed;
  for (const auto& [key, value] : dict.entries())
    same.set(key, value);
  for (auto entry = dict.entries().rbegin(); entry != dict.entries().rend(); ++entry)
    reversed.set(entry->first, entry->second);
  EXPECT_EQ(same, dict);
  EXPECT_NE(reversed, dict);
}

TEST(MessageDictTest, GetStringFallsBackForAnythingButAString) {
  const std::string binary("a\0\xff", 3);  // keys and strings are byte strings
  MessageDict dict;
  dict.set(binary, MessageValue::string(binary));
  dict.set("a", MessageValue::string(""));
  dict.set("null", MessageValue::null());
  dict.set("number", MessageValue::int64(3));
  dict.set("nested", MessageValue::dict(MessageDict()));
  EXPECT_EQ(dict.size(), 5u);
  EXPECT_EQ(dict.getString(binary, "default"), binary);
  EXPECT_EQ(dict.getString("a", "default"), "");
  for (const char* key : {"absent", "null", "number", "nested"}) {
    EXPECT_EQ(dict.getString(key, "default"), "default") << key;
  }
}

}  // namespace
}  // namespace halvex
