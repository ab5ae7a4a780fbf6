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
  struct Row {
    std::string text;
    bool parsed;
    std::int32_t value;
  };
  const Row rows[] = {
      {"FALSE", true, 0},
      {"Off", true, 0},
      {"no", true, 0},
      {"TRUE", true, 1},
      {"on", true, 1},
      {"Yes", true, 1},
      {"full", true, 1},
      {"LITE", true, 2},
      {"3", true, 3},
      {"0x3", true, 3},
      {"0X10", true, 16},
      {"010", true, 8},
      {"-1", true, -1},
      {"+5", true, 5},
      {" 7", true, 7},
      {"\t-0x10", true, -16},
      {"2147483647", true, 2147483647},
      {"-2147483648", true, -2147483647 - 1},
      {"2147483648", false, 0},
      {"-2147483649", false, 0},
      {"99999999999999999999", false, 0},
      {"3a", false, 0},
      {"7 ", false, 0},
      {"", false, 0},
      {" ", false, 0},
      {"0x", false, 0},
      {"08", false, 0},
      {"nope", false, 0},
      {"yes!", false, 0},
      {"lit", false, 0},
      {std::string("3\0", 2), false, 0},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE("text \"" + row.text + "\"");
    std::int32_t value = 12345;
    EXPECT_EQ(parseTraceValue(row.text, value), row.parsed);
    EXPECT_EQ(value, row.parsed ? row.value : 12345);
  }
}

}  // namespace
}  // namespace halvex
