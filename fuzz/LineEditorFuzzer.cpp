// SPDX-License-Identifier: MIT
// The line editor at a terminal that sends anything at all, in pieces of any size, with pauses
// anywhere. The first byte sets the terminal's width and how the rest is cut into reads (a piece
// whose first byte is 0xFE comes after a pause). Besides never crashing or hanging: raw mode
// never outlives a line and nothing is drawn outside it; and when only printable bytes and CR
// were sent, the lines that come back are exactly the pieces between the CRs.
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "fuzz/FuzzSupport.h"
#include "shell/Completion.h"
#include "shell/editor/LineEditor.h"
#include "tests/shell/FakeTerminal.h"
#include "tests/shell/TestTree.h"

namespace halvex::fuzz {
namespace {

bool onlyPrintableAndReturns(std::string_view keys) {
  for (const char c : keys) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte != '\r' && (byte < 0x20 || byte == 0x7F)) {
      return false;
    }
  }
  return true;
}

}  // namespace
}  // namespace halvex::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace halvex;
  if (size == 0) {
    return 0;
  }
  const std::string_view keys(reinterpret_cast<const char*>(data + 1), size - 1);
  const int width = 2 + data[0] % 120;
  const std::size_t piece = 1 + data[0] % 7;
  std::vector<std::string> reads;
  for (std::size_t at = 0; at < keys.size(); at += piece) {
    if (keys[at] == '\xfe') {
      reads.emplace_back();
    }
    reads.emplace_back(keys.substr(at, piece));
  }

  testing::FakeTerminal terminal(reads, width);
  static const auto root = testing::makeToolTree();
  editor::LineEditor editor(terminal,
                            [](std::string_view before) { return completeWord(root, before); });
  std::vector<std::string> lines;
  while (std::optional<std::string> line = editor.readLine("(/halvextool)>> ")) {
    fuzz::check(!terminal.raw, "raw mode ends with the line");
    lines.push_back(std::move(*line));
  }
  fuzz::check(!terminal.raw && !terminal.drewOutsideRaw, "drawing only in raw mode");

  if (fuzz::onlyPrintableAndReturns(keys)) {
    // Each CR enters what came before it; a last line without one is never entered.
    std::vector<std::string> entered;
    std::size_t start = 0;
    for (std::size_t end; (end = keys.find('\r', start)) != std::string_view::npos;
         start = end + 1) {
      entered.emplace_back(keys.substr(start, end - start));
    }
    fuzz::check(lines == entered, "typed lines come back as typed");
  }
  return 0;
}
