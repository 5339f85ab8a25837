// The "list" method of the performance-event log on the real platform, in the
// system root $KOVA_ROOT, for bench/compare_sort.sh:
//
//   log_bench fill ORDER N         appends N events of about 120 bytes through
//                                  the platform's batch append; ORDER is
//                                  "time" (oldest first), "steps" (the clock
//                                  steps back an hour every 10^4 events) or
//                                  "shuffled" (times in random order)
//   log_bench list RUNS PAGE [KEYWORD]
//                                  calls the list handler RUNS times for a page
//                                  of 50 (with the keyword as filter), prints
//                                  each call's time ("ms <t>") and the peak
//                                  resident memory ("peak_kib <k>"), and writes
//                                  the last page to PAGE as time, level and
//                                  event, tab-separated, one entry a line
//   log_bench export RUNS TYPE OUT calls the export handler RUNS times with
//                                  standard output in the file OUT, printing
//                                  each call's time and the peak memory

#include <fcntl.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include "kova/log.h"
#include "log/log_handlers.h"
#include "src/log_store.h"
#include "test_support/host_call.h"

namespace {

constexpr int64_t kMonthStart = 1793491200;  // 2026-11-01 00:00:00 UTC
constexpr int64_t kMonth = 30 * 86400;
constexpr int kStepEvery = 10000;
constexpr int64_t kStepBack = 3600;
constexpr size_t kBatch = 10000;

// The events' times in the order they are written. The same order and count
// give the same times.
std::vector<int64_t> Times(const std::string& order, int count) {
  std::mt19937 random(count);
  std::vector<int64_t> times(static_cast<size_t>(count));
  for (int64_t& time : times) time = kMonthStart + random() % kMonth;
  std::sort(times.begin(), times.end());
  if (order == "steps") {
    for (size_t i = 0; i < times.size(); ++i) times[i] -= kStepBack * (i / kStepEvery % 2);
  } else if (order == "shuffled") {
    std::shuffle(times.begin(), times.end(), random);
  }
  return times;
}

int Fill(const std::string& order, int count) {
  if (order != "time" && order != "steps" && order != "shuffled") return 2;
  static const char* const kLevels[] = {kLogLevelWarning, kLogLevelCritical, kLogLevelInfo};
  std::mt19937 random(count + 1);
  std::vector<kova::LogRecord> batch;
  char event[256];
  const std::vector<int64_t> times = Times(order, count);
  for (size_t i = 0; i < times.size(); ++i) {
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
    batch.push_back({kLevels[i % 3], times[i], "SYSTEM", "kovaperfeventd", event});
    if (batch.size() == kBatch || i + 1 == times.size()) {
      if (kova::AppendLogRecords(kLogTypePerfEvent, batch) != 0) {
        fprintf(stderr, "log_bench: cannot append to the log\n");
        return 1;
      }
      batch.clear();
    }
  }
  return 0;
}

long PeakResidentKiB() {
  std::ifstream status("/proc/self/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmHWM:", 0) == 0) return strtol(line.c_str() + 6, nullptr, 10);
  }
  return -1;
}

int List(int runs, const char* page_path, const char* keyword) {
  const std::string params =
      keyword != nullptr
          ? std::string(R"({"limit": 50, "filter": {"keyword": ")") + keyword + "\"}}"
          : R"({"limit": 50})";
  Json::Value page;
  for (int run = 0; run < runs; ++run) {
    const auto start = std::chrono::steady_clock::now();
    const KOVA::APIResponse response = kova_test::CallHandler(log_list_v1, params);
    const std::chrono::duration<double, std::milli> took = std::chrono::steady_clock::now() - start;
    if (response.GetErrorCode() != 0) {
      fprintf(stderr, "log_bench: the list failed with error %d\n", response.GetErrorCode());
      return 1;
    }
    page = response.GetData()["logs"];
    printf("ms %.2f\n", took.count());
  }
  printf("peak_kib %ld\n", PeakResidentKiB());
  FILE* out = fopen(page_path, "w");
  if (out == nullptr) return 1;
  for (const Json::Value& entry : page) {
    fprintf(out, "%s\t%s\t%s\n", entry["time"].asCString(), entry["level"].asCString(),
            entry["event"].asCString());
  }
  return fclose(out) == 0 ? 0 : 1;
}

// Runs the export handler RUNS times with standard output in OUT, printing
// each call's time.
int Export(int runs, const char* type, const char* out_path) {
  const std::string params = std::string(R"({"type": ")") + type + "\"}";
  for (int run = 0; run < runs; ++run) {
    fflush(stdout);
    const int saved = dup(STDOUT_FILENO);
    const int out = open(out_path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (saved < 0 || out < 0 || dup2(out, STDOUT_FILENO) < 0) return 1;
    close(out);
    const auto start = std::chrono::steady_clock::now();
    const KOVA::APIResponse response = kova_test::CallHandler(log_export_v1, params);
    fflush(stdout);
    const std::chrono::duration<double, std::milli> took = std::chrono::steady_clock::now() - start;
    dup2(saved, STDOUT_FILENO);
    close(saved);
    if (response.IsOutputEnabled()) {
      fprintf(stderr, "log_bench: the export failed with error %d\n", response.GetErrorCode());
      return 1;
    }
    printf("ms %.2f\n", took.count());
  }
  printf("peak_kib %ld\n", PeakResidentKiB());
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 4 && strcmp(argv[1], "fill") == 0) return Fill(argv[2], atoi(argv[3]));
  if ((argc == 4 || argc == 5) && strcmp(argv[1], "list") == 0) {
    return List(atoi(argv[2]), argv[3], argc == 5 ? argv[4] : nullptr);
  }
  if (argc == 5 && strcmp(argv[1], "export") == 0) return Export(atoi(argv[2]), argv[3], argv[4]);
  fprintf(stderr,
          "usage: log_bench fill time|steps|shuffled N | log_bench list RUNS PAGE [KEYWORD] | "
          "log_bench export RUNS csv|html OUT\n");
  return 2;
}
