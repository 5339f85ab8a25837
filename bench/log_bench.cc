// Speed and memory of reading the performance-event log: ProcessLog and the
// "list" method (a page of 50) over synthetic logs of 10^4 to 10^6 lines, with
// no filter and with a keyword that half of the lines hold.
//
//   log_bench [benchmark flags]   runs the benchmarks
//   log_bench --emit N            prints the synthetic log of N lines, for a
//                                 baseline run over the same text

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include "fake/kova_fake.h"
#include "kova/log.h"
#include "log/log_handlers.h"
#include "log/log_reader.h"
#include "test_support/host_call.h"

namespace {

constexpr char kKeyword[] = "latency";
constexpr int64_t kMonthStart = 1793491200;  // 2026-11-01 00:00:00 UTC
constexpr int64_t kMonth = 30 * 86400;

// `count` lines of about 120 bytes, oldest first, their times spread over a
// month; every other line names the keyword. The same count gives the same text.
std::vector<std::string> SyntheticLog(int count) {
  static const char* const kLevels[] = {"Warning", "Critical", "Info"};
  std::mt19937 random(count);
  std::vector<int64_t> times(static_cast<size_t>(count));
  for (int64_t& time : times) time = kMonthStart + random() % kMonth;
  std::sort(times.begin(), times.end());
  std::vector<std::string> lines;
  lines.reserve(times.size());
  char event[256];
  for (int i = 0; i < count; ++i) {
    const unsigned value = 50 + random() % 50;
    if (i % 2 == 0) {
      snprintf(event, sizeof(event),
               "I/O latency of LUN lun-%04u above 20 ms for 30 s (seen %u ms), rule %u",
               static_cast<unsigned>(random() % 10000), value, value % 16);
    } else {
      snprintf(event, sizeof(event),
               "CPU usage of service smb-%03u above 80%% for 30 s (seen %u%%), rule %u",
               static_cast<unsigned>(random() % 1000), value, value % 16);
    }
    lines.push_back(std::to_string(i + 1) + "\t" + kLevels[i % 3] + "\t" +
                    KOVALogConvertTime1(times[i]) + "\tSYSTEM\tkovaperfeventd\t" + event);
  }
  return lines;
}

// The peak resident memory of the process since the last reset, in MiB.
double PeakResidentMiB() {
  std::ifstream status("/proc/self/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmHWM:", 0) == 0) return strtod(line.c_str() + 6, nullptr) / 1024.0;
  }
  return 0;
}

// Starts a fresh peak of resident memory, where the kernel allows it.
void ResetPeakResident() { std::ofstream("/proc/self/clear_refs") << "5"; }

void Prepare(benchmark::State& state) {
  kova_fake::Reset();
  kova_fake::SetLogLines(SyntheticLog(static_cast<int>(state.range(0))));
  ResetPeakResident();
}

void Report(benchmark::State& state) {
  state.SetItemsProcessed(state.iterations() * state.range(0));
  state.counters["peak_MiB"] = PeakResidentMiB();
  state.SetLabel(state.range(1) ? "keyword" : "no filter");
}

void BM_ProcessLog(benchmark::State& state) {
  Prepare(state);
  LogFilter filter;
  if (state.range(1)) filter.keyword = kKeyword;
  for (auto _ : state) {
    std::vector<Json::Value> entries;
    if (!ProcessLog(filter, entries)) state.SkipWithError("ProcessLog failed");
    benchmark::DoNotOptimize(entries.data());
  }
  Report(state);
}

void BM_LogList(benchmark::State& state) {
  Prepare(state);
  const std::string params =
      state.range(1) ? R"({"limit": 50, "filter": {"keyword": "latency"}})" : R"({"limit": 50})";
  for (auto _ : state) {
    const KOVA::APIResponse response = kova_test::CallHandler(log_list_v1, params);
    if (response.GetData()["logs"].size() != 50) state.SkipWithError("short page");
  }
  Report(state);
}

void Sizes(benchmark::internal::Benchmark* benchmark) {
  benchmark->ArgNames({"lines", "keyword"});
  for (int lines : {10000, 100000, 1000000}) {
    for (int keyword : {0, 1}) benchmark->Args({lines, keyword});
  }
  benchmark->Unit(benchmark::kMillisecond)->UseRealTime();
}

BENCHMARK(BM_ProcessLog)->Apply(Sizes);
BENCHMARK(BM_LogList)->Apply(Sizes);

}  // namespace

int main(int argc, char** argv) {
  if (argc == 3 && strcmp(argv[1], "--emit") == 0) {
    for (const std::string& line : SyntheticLog(atoi(argv[2]))) {
      fputs(line.c_str(), stdout);
      fputc('\n', stdout);
    }
    return 0;
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
