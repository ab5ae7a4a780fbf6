// SPDX-License-Identifier: MIT
// parseDumpOptions over long runs of option words, as `halvextool logdump tel $(yes nonui | head
// -N) crash1 rest` gives it: the time must grow linearly with N, and 100,000 words must take well
// under a second.
#include <benchmark/benchmark.h>

#include <string>
#include <vector>

#include "Tools/HalvexTool/DumpOptions.h"

namespace {

void BM_ParseDumpOptions(benchmark::State& state) {
  std::vector<std::string> words(static_cast<std::size_t>(state.range(0)), "nonui");
  words.emplace_back("crash1");
  words.emplace_back("rest");
  for (auto _ : state) {
    state.PauseTiming();
    std::vector<std::string> input = words;
    state.ResumeTiming();
    bool compress = true;
    bool nonui = false;
    std::string reason;
    halvex::parseDumpOptions(input, compress, reason, nonui);
    benchmark::DoNotOptimize(input.data());
    benchmark::DoNotOptimize(reason.data());
  }
  state.SetComplexityN(state.range(0));
}
BENCHMARK(BM_ParseDumpOptions)
    ->Arg(20000)
    ->Arg(40000)
    ->Arg(100000)
    ->Unit(benchmark::kMillisecond)
    ->Complexity(benchmark::oN);

}  // namespace

BENCHMARK_MAIN();
