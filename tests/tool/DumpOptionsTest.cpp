// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

#include "Tools/HalvexTool/DumpOptions.h"

namespace halvex {
namespace {

TEST(ParseDumpOptions, WordsBeforeTheReasonSetFlagsAndTheRestIsLeft) {
  struct Row {
    std::vector<std::string> words;
    bool compress;
    bool nonui;
    std::string reason;
    std::vector<std::string> left;
  };
  const Row rows[] = {
      {{}, true, false, "[halvextool] User triggered", {}},
      {{"nocompress", "nonui", "crash1"}, false, true, "[halvextool] crash1", {}},
      {{"crash1", "nocompress"}, true, false, "[halvextool] crash1", {"nocompress"}},
      {{"NoCompress"}, true, false, "[halvextool] NoCompress", {}},
      {{"nonui", "nonui"}, true, true, "[halvextool] User triggered", {}},
      {{"nonui", "nocompress", "a", "b", "nonui"}, false, true, "[halvextool] a", {"b", "nonui"}},
      {{""}, true, false, "[halvextool] ", {}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(testing::PrintToString(row.words));
    std::vector<std::string> words = row.words;
    bool compress = true;
    bool nonui = false;
    std::string reason = "stale";
    parseDumpOptions(words, compress, reason, nonui);
    EXPECT_EQ(compress, row.compress);
    EXPECT_EQ(nonui, row.nonui);
    EXPECT_EQ(reason, row.reason);
    EXPECT_EQ(words, row.left);
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
