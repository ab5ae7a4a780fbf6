// SPDX-License-Identifier: MIT
// parseDumpOptions over any list of words (the input split at newlines): the flags come from the
// option words before the first other word, that word becomes the reason, and exactly the words
// after it are left, in order.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "Tools/HalvexTool/DumpOptions.h"
#include "fuzz/FuzzSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace halvex;
  using halvex::fuzz::check;
  const std::string text(reinterpret_cast<const char*>(data), size);
  std::vector<std::string> words = halvex::fuzz::split(text, '\n');

  bool wantCompress = true;
  bool wantNonui = false;
  std::string wantReason = kDefaultReason;
  std::vector<std::string> wantLeft;
  std::size_t i = 0;
  for (; i < words.size() && (words[i] == "nocompress" || words[i] == "nonui"); ++i) {
    if (words[i] == "nonui") {
      wantNonui = true;
    } else {
      wantCompress = false;
    }
  }
  if (i < words.size()) {
    wantReason = std::string(kReasonPrefix) + words[i];
    wantLeft.assign(words.begin() + static_cast<std::ptrdiff_t>(i) + 1, words.end());
  }

  bool compress = true;
  bool nonui = false;
  std::string reason = "stale";
  parseDumpOptions(words, compress, reason, nonui);
  check(compress == wantCompress, "nocompress before the reason clears compress");
  check(nonui == wantNonui, "nonui before the reason sets nonui");
  check(reason == wantReason, "the first other word is the reason", reason);
  check(words == wantLeft, "the words after the reason stay, in order");
  return 0;
}
