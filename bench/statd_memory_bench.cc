// Resident memory of kovastatd holding a full two-hour ring of every series of
// a recorded machine of 16 CPUs, 8 disks, 4 interfaces, 100 services and 1,000
// processes (target under 32 MB), against the same daemon holding a full
// 15-minute ring first, in the same run. The daemon runs on a clock 200 times
// as fast (--time-scale 0.005), while the recorded counters grow as they would.
//
//   statd_memory_bench

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <string>
#include <thread>

#include "test_support/collector_client.h"
#include "test_support/host_call.h"
#include "test_support/recorded_proc.h"
#include "test_support/temp_root.h"

namespace {

using kova_test::AskCollector;
using kova_test::AskCollectorUntil;

constexpr size_t kShortRing = 15 * 60;
constexpr size_t kRingSeconds = 120 * 60;

// A line of /proc/<pid>/status ("VmRSS:") in MiB, -1 when absent.
double StatusMiB(pid_t pid, const char* key) {
  FILE* status = fopen(("/proc/" + std::to_string(pid) + "/status").c_str(), "r");
  if (status == nullptr) return -1;
  char line[256];
  double kib = -1;
  while (fgets(line, sizeof(line), status) != nullptr) {
    if (std::string(line).rfind(key, 0) == 0) kib = atof(line + strlen(key));
  }
  fclose(status);
  return kib / 1024;
}

}  // namespace

int main() {
  const kova_test::TempRoot root;
  const kova_test::RecordedMachine shape;
  kova_test::WriteRecordedMachine(root.path(), shape);
  const std::string settings = root.path() + "/etc/kovainfo.conf";
  kova_test::WriteFile(settings, "resourcemonitor_realtime_max=\"15\"\n");
  const pid_t daemon = fork();
  if (daemon == 0) {
    const std::string proc = root.path() + "/proc";
    const std::string sys = root.path() + "/sys";
    const std::string database = "host=" + root.path() + "/nowhere dbname=none";
    execl(KOVASTATD_PATH, KOVASTATD_PATH, "--proc", proc.c_str(), "--sys", sys.c_str(),
          "--time-scale", "0.005", "--database", database.c_str(), nullptr);
    _exit(127);
  }
  std::atomic<bool> done{false};
  std::thread counters([&] {
    for (uint64_t pass = 2; !done; ++pass) {
      kova_test::WriteMachineCounters(root.path(), shape, pass);
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
  });

  // A level, which has a value from the first pass on.
  const std::string ask = R"({"request":"realtime","series":["mem.used"]})";
  const auto holding = [](size_t samples) {
    return [samples](const Json::Value& reply) {
      return reply["data"]["series"][0]["times"].size() >= samples;
    };
  };
  const Json::Value short_ring =
      AskCollectorUntil(ask, holding(kShortRing), std::chrono::seconds(60));
  const double baseline = StatusMiB(daemon, "VmRSS:");
  kova_test::WriteFile(settings, "resourcemonitor_realtime_max=\"120\"\n");
  const bool reloaded = AskCollector(R"({"request":"reload"})")["success"].asBool();
  const Json::Value ring = AskCollectorUntil(ask, holding(kRingSeconds), std::chrono::seconds(300));
  const double resident = StatusMiB(daemon, "VmRSS:");
  const double peak = StatusMiB(daemon, "VmHWM:");
  const Json::Value catalog = AskCollector(R"({"request":"catalog"})");
  done = true;
  counters.join();
  kill(daemon, SIGTERM);
  waitpid(daemon, nullptr, 0);

  const size_t series = catalog["data"]["series"].size();
  const size_t samples = ring["data"]["series"][0]["times"].size();
  const size_t expected = shape.Series();
  if (!reloaded || short_ring["data"]["series"][0]["times"].size() != kShortRing ||
      series != expected || samples != kRingSeconds || baseline <= 0) {
    fprintf(stderr, "statd_memory_bench: expected %zu series of %zu samples, got %zu of %zu\n",
            expected, kRingSeconds, series, samples);
    return 1;
  }
  const double values = static_cast<double>(series) * kRingSeconds * sizeof(float) / (1 << 20);
  printf("kovastatd: %zu series, %zu samples each (120 min at 1 Hz)\n", series, samples);
  printf("resident with a full 15-minute ring (baseline)  %6.1f MiB\n", baseline);
  printf(
      "resident with a full 120-minute ring            %6.1f MiB (peak %.1f MiB; target 32 MB)\n",
      resident, peak);
  printf("growth %.1f MiB for %.1f MiB more values (4 bytes each); 120 : 15 minutes = %.2f\n",
         resident - baseline, values * 7 / 8, resident / baseline);
  return 0;
}
