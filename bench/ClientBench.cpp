// SPDX-License-Identifier: MIT
// Latency of one command through the client framework against a bare sd_bus_call of the same
// method on the same bus. Needs DBUS_SYSTEM_BUS_ADDRESS and a running halvex-sim; see
// run-client-bench.sh. After the runs it prints how much each framework path costs relative to
// the bare call.
#include <benchmark/benchmark.h>
#include <systemd/sd-bus.h>

#include <condition_variable>
#include <cstdio>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/Mutex.h"
#include "platform/RunLoop.h"
#include "platform/ServerClient.h"
#include "platform/linux/BusProtocol.h"
#include "platform/linux/MessageCodec.h"

namespace {

using namespace halvex;

// The simulator answers a command it has no entry for at once with an empty dictionary.
constexpr char kCommand[] = "BenchEcho";
constexpr double kTargetRatio = 1.5;

MessageDict sampleRequest() {
  MessageDict request;
  request.set("TraceAction", MessageValue::string("CollectTelephonyLogs"));
  request.set("TraceDumpStatePerformCompression", MessageValue::boolean(true));
  request.set("Attempt", MessageValue::int64(1));
  return request;
}

void BM_BareCall(benchmark::State& state) {
  sd_bus* bus = nullptr;
  if (sd_bus_open_system(&bus) < 0) {
    state.SkipWithError("no system bus");
    return;
  }
  const MessageDict request = sampleRequest();
  for (auto _ : state) {
    sd_bus_message* call = nullptr;
    sd_bus_message* reply = nullptr;
    sd_bus_error error = SD_BUS_ERROR_NULL;
    int r = sd_bus_message_new_method_call(bus, &call, bus::kServerName, bus::kServerPath,
                                           bus::kServerInterface, bus::kServerPerformCommand);
    r = r < 0 ? r : sd_bus_message_append(call, "ss", "bench", kCommand);
    r = r < 0 ? r : bus::appendDict(call, request);
    r = r < 0 ? r : sd_bus_call(bus, call, 0, &error, &reply);
    std::int32_t code = -1;
    const char* message = nullptr;
    MessageValue value;
    r = r < 0 ? r : sd_bus_message_read(reply, "is", &code, &message);
    r = r < 0 ? r : bus::readVariant(reply, value);
    sd_bus_error_free(&error);
    sd_bus_message_unref(reply);
    sd_bus_message_unref(call);
    if (r < 0 || code != 0) {
      state.SkipWithError("the bare call failed");
      break;
    }
    benchmark::DoNotOptimize(value);
  }
  sd_bus_flush_close_unref(bus);
}

void BM_SyncPerform(benchmark::State& state) {
  auto manager = client::CreateManager("bench", WorkQueue::create("bench.queue"));
  const MessageDict request = sampleRequest();
  for (auto _ : state) {
    MessageValue reply;
    Result result = client::PerformCommand(manager, kCommand, request, reply);
    if (!result.ok()) {
      state.SkipWithError(result.message.c_str());
      return;
    }
    benchmark::DoNotOptimize(reply);
  }
}

void BM_AsyncPerform(benchmark::State& state) {
  auto manager = client::CreateManager("bench", WorkQueue::create("bench.queue"));
  const MessageDict request = sampleRequest();
  // Shared with the completion, which may still be notifying when the last iteration's wait ends.
  struct Handoff {
    Mutex mutex;
    std::condition_variable done;
    bool finished GUARDED_BY(mutex) = false;
    Result last GUARDED_BY(mutex);
  };
  auto handoff = std::make_shared<Handoff>();
  for (auto _ : state) {
    client::PerformCommand(
        manager, kCommand,
        [handoff](Result result, const MessageValue&) {
          {
            MutexLock lock(handoff->mutex);
            handoff->last = std::move(result);
            handoff->finished = true;
          }
          // Outside the lock, so the woken thread does not block on it again: the harness's own
          // hand-off should cost as little as it can.
          handoff->done.notify_one();
        },
        request);
    MutexLock lock(handoff->mutex);
    while (!handoff->finished) {
      lock.wait(handoff->done);
    }
    handoff->finished = false;
    if (!handoff->last.ok()) {
      state.SkipWithError(handoff->last.message.c_str());
      return;
    }
  }
}

// The machine is shared, so each path runs several short times, interleaved with the others (see
// main), and is compared by its median: a burst of load then spoils one repetition, not a path.
BENCHMARK(BM_BareCall)->UseRealTime()->MinTime(0.5)->Repetitions(7)->ReportAggregatesOnly(true);
BENCHMARK(BM_SyncPerform)->UseRealTime()->MinTime(0.5)->Repetitions(7)->ReportAggregatesOnly(true);
BENCHMARK(BM_AsyncPerform)->UseRealTime()->MinTime(0.5)->Repetitions(7)->ReportAggregatesOnly(true);

// Keeps each benchmark's median time per iteration for the comparison at the end.
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& run : runs) {
      if (!run.error_occurred && run.run_type == Run::RT_Aggregate &&
          run.aggregate_name == "median") {
        times_[run.run_name.function_name] = run.GetAdjustedRealTime();
      }
    }
    ConsoleReporter::ReportRuns(runs);
  }

  // Prints the ratios against the target; false when a path could not be measured.
  bool summarize() const {
    auto bare = times_.find("BM_BareCall");
    if (bare == times_.end() || bare->second <= 0) {
      std::printf("no bare-call measurement to compare with\n");
      return false;
    }
    bool ok = true;
    for (const char* name : {"BM_SyncPerform", "BM_AsyncPerform"}) {
      auto it = times_.find(name);
      if (it == times_.end()) {
        std::printf("%s: no measurement\n", name);
        ok = false;
        continue;
      }
      double ratio = it->second / bare->second;
      std::printf("%s / bare sd_bus_call: %.2fx (target %.1fx: %s)\n", name, ratio, kTargetRatio,
                  ratio <= kTargetRatio ? "met" : "missed");
    }
    return ok;
  }

 private:
  std::map<std::string, double> times_;
};

}  // namespace

int main(int argc, char** argv) {
  // As in the tool, a thread of its own serves the bus for the framework; it never returns, and
  // the process ends with it running.
  std::thread(halvex::platform::runMainLoop).detach();
  // Interleaving is on unless the command line says otherwise; later flags win.
  std::vector<char*> args(argv, argv + argc);
  std::string interleave = "--benchmark_enable_random_interleaving=true";
  args.insert(args.begin() + 1, interleave.data());
  int count = static_cast<int>(args.size());
  benchmark::Initialize(&count, args.data());
  if (benchmark::ReportUnrecognizedArguments(count, args.data())) {
    return 2;
  }
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  benchmark::Shutdown();
  return reporter.summarize() ? 0 : 1;
}
