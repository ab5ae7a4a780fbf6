// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

#include "Tools/HalvexTool/DumpOptions.h"

namespace halvex {
namespace {

TEST(ParseDumpOptions, WordsBeforeTheReasonSetFlagsAndTheRestIsLeft) {
  // Words, then the flags, the reason and the words left after parsing.
  const std::string p = "[halvextool] ";
  using Words = std::vector<std::string>;
  const std::tuple<Words, bool, bool, std::string, Words> rows[] = {
      {{}, true, false, p + "User triggered", {}},
      {{"nocompress", "nonui", "crash1"}, false, true, p + "crash1", {}},
      {{"crash1", "nocompress"}, true, false, p + "crash1", {"nocompress"}},
      {{"NoCompress"}, true, false, p + "NoCompress", {}},
      {{"nonui", "nonui"}, true, true, p + "User triggered", {}},
      {{"nonui", "nocompress", "a", "b", "nonui"}, false, true, p + "a", {"b", "nonui"}},
      {{""}, true, false, p, {}},
  };
  for (const auto& [given, compressed, nonuiSet, reasonSet, left] : rows) {
    SCOPED_TRACE(testing::PrintToString(given));
    std::vector<std::string> words = given;
    bool compress = true, nonui = false;
    std::string reason = "stale";
    parseDumpOptions(words, compress, reason, nonui);
    EXPECT_EQ(compress, compressed);
    EXPECT_EQ(nonui, nonuiSet);
    EXPECT_EQ(reason, reasonSet);
    EXPECT_EQ(words, left);
  }
}

TEST(ParseTraceValue, NamedWordsAndWholeIntegerLiterals) {
  std::vector<std::pair<std::string, std::int32_t>> accepted = {
      {"FALSE", 0}, {"Off", 0},  {"no", 0}, {"TRUE", 1},      {"on", 1},    {"Yes", 1},
      {"full", 1},  {"LITE", 2}, {"3", 3},  {"0x3", 3},       {"0X10", 16}, {"010", 8},
      {"-1", -1},   {"+5", 5},   {" 7", 7}, {"\t-0x10", -16},
  };
  accepted.insert(accepted.end(), {{"2147483647", INT32_MAX}, {"-2147483648", INT32_MIN}});
  for (const auto& [text, expected] : accepted) {
    std::int32_t value = 12345;
    EXPECT_TRUE(parseTraceValue(text, value)) << '"' << text << '"';
    EXPECT_EQ(value, expected) << '"' << text << '"';
  }
  const std::string rejected[] = {
      "2147483648", "-2147483649", "99999999999999999999", "3a", "7 ", "", " ", "0x", "08", "nope",
      "yes!",       "lit",         std::string("3\0", 2),
  };
  for (const std::string& text : rejected) {
    std::int32_t value = 12345;
    EXPECT_FALSE(parseTraceValue(text, value)) << '"' << text << '"';
    EXPECT_EQ(value, 12345) << '"' << text << '"';
  }
}

}  // namespace
}  // namespace halvex
