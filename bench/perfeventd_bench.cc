// CPU time of one cycle of kovaperfeventd (the pass over /proc, the
// measurements and the rules' windows) with 10, 100 and 1000 rules over a
// recorded /proc of 300 processes, and the resident memory of the daemon
// itself running 1000 rules.
//
//   perfeventd_bench [benchmark flags]

#include <benchmark/benchmark.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "kova/perfevent.h"
#include "perfeventd/monitor.h"
#include "sampling/measurements.h"
#include "sampling/object_directory.h"
#include "sampling/proc_reader.h"
#include "test_support/recorded_proc.h"
#include "test_support/temp_root.h"

namespace perfeventd {

using kova_test::WriteFile;
using kova_test::WriteProcess;
using kova_test::WriteSystem;
using sampling::Measurements;
using sampling::ProcReader;
using sampling::SystemDirectory;
namespace {

constexpr int kServices = 250;  // each one process; the first 50 have a child too
constexpr int kLuns = 25;

// A system root holding a recorded /proc and /sys, the services' records and
// the LUN registry; KOVA_ROOT names it while it lives.
class BenchRoot {
 public:
  BenchRoot() {
    const std::string proc = Proc();
    WriteSystem(proc, 3000, 10000, 8000000, 3000000);
    pid_t pid = 1000;
    for (int i = 0; i < kServices; ++i, ++pid) {
      WriteProcess(proc, {pid, 1, 5000u + i, 100u + i, 2000, "svc"});
      WriteFile(path_ + "/run/kova/svc-" + std::to_string(i) + ".pid",
                std::to_string(pid) + " " + std::to_string(5000 + i) + "\n");
      if (i < 50) WriteProcess(proc, {pid + 2000, pid, 9000, 50, 1000, "svc-child"});
    }
    std::string luns = "{\"luns\": [";
    for (int i = 0; i < kLuns; ++i) {
      luns += std::string(i ? ", " : "") + "{\"uuid\": \"lun-" + std::to_string(i) +
              "\", \"name\": \"LUN " + std::to_string(i) + "\", \"location\": \"/volume1\"}";
    }
    WriteFile(path_ + "/etc/kova/iscsi/luns.json", luns + "]}\n");
    WriteFile(proc + "/diskstats",
              "   8       0 sda 1000 0 80000 3000 500 0 40000 2000 0 0 0 0 0 0 0\n"
              "   8      16 sdb 2000 0 90000 4000 700 0 50000 3000 0 0 0 0 0 0 0\n"
              "   8      17 sdb1 1900 0 85000 3900 600 0 45000 2900 0 0 0 0 0 0 0\n");
    WriteFile(proc + "/self/mountinfo", "22 1 8:1 / / rw - ext4 /dev/sda1 rw\n40 22 8:17 / " +
                                            path_ + "/volume1 rw - ext4 /dev/sdb1 rw\n");
    for (const char* disk : {"sda", "sdb"}) WriteFile(Sys() + "/block/" + disk + "/device/x", "");
  }
  std::string Proc() const { return path_ + "/proc"; }
  std::string Sys() const { return path_ + "/sys"; }

 private:
  kova_test::TempRoot root_{"/tmp/perfeventd_bench"};
  const std::string path_ = root_.path();
};

// `count` distinct rules: one in ten on the system, one in ten on a LUN, the
// rest on services; thresholds high enough that none is raised.
std::vector<Rule> MakeRules(int count) {
  std::vector<Rule> rules;
  for (int i = 0; i < count; ++i) {
    const int k = i / 4;
    const int severity = (i % 4) / 2 + 1;
    const int pick = i % 2;
    Rule rule{std::to_string(i + 1), PERFEVENT_TYPE_SERVICE, "", 1 + pick, severity, 100, 5, 30};
    if (k % 10 == 0) {
      rule.type = PERFEVENT_TYPE_SYSTEM;
      rule.object = "sys-" + std::to_string(k);
      rule.resource = 1 + (k / 10 + pick) % 4;
      rule.threshold = 100000;
    } else if (k % 10 == 1) {
      rule.type = PERFEVENT_TYPE_ISCSI_LUN;
      rule.object = "lun-" + std::to_string(k / 10 % kLuns);
      rule.resource = 3 + pick;
      rule.threshold = 100000;
    } else {
      rule.object = "svc-" + std::to_string(k % kServices);
    }
    rules.push_back(rule);
  }
  return rules;
}

void BM_Cycle(benchmark::State& state) {
  BenchRoot root;
  SystemDirectory directory;
  Monitor monitor(directory, [](int, const std::string&) {});
  monitor.SetRules(MakeRules(static_cast<int>(state.range(0))));
  ProcReader reader(root.Proc(), root.Sys());
  Measurements measurements(4);
  size_t events = 0;
  for (auto _ : state) {
    measurements.Advance(reader.Read(monitor.Needs()));
    events += monitor.Cycle(measurements, 0).size();
  }
  if (events > 0) state.SkipWithError("a rule was raised");
  state.counters["processes"] = static_cast<double>(measurements.current().processes.size());
}
BENCHMARK(BM_Cycle)->ArgName("rules")->Arg(10)->Arg(100)->Arg(1000)->Unit(benchmark::kMicrosecond);

// The pass over this machine's own /proc with every kind of rule.
void BM_LivePass(benchmark::State& state) {
  ProcReader reader("/proc", "/sys");
  size_t processes = 0;
  for (auto _ : state) processes = reader.Read({true, true, true, true}).processes.size();
  state.counters["processes"] = static_cast<double>(processes);
}
BENCHMARK(BM_LivePass)->Unit(benchmark::kMicrosecond);

// kovaperfeventd with 1000 stored rules over the recorded /proc, a cycle every
// 5 ms: its peak and current resident memory after about a second.
void BM_DaemonResidentMemory(benchmark::State& state) {
  BenchRoot root;
  for (Rule& rule : MakeRules(1000)) {
    KOVAPERFEVENT_CONF_SETTING record{};
    record.type = static_cast<KOVAPERFEVENT_EVENT_TYPE>(rule.type);
    snprintf(record.service, sizeof(record.service), "%s", rule.object.c_str());
    record.resource = rule.resource;
    record.severity = rule.severity;
    record.threshold = rule.resource <= 2 ? 100 : rule.threshold;
    record.preset_a = rule.period;
    record.preset_b = rule.duration;
    record.enable = 1;
    if (KOVAPerfEventConfAdd(&record) != 0) state.SkipWithError("can't store a rule");
  }
  double peak_kib = 0;
  double resident_kib = 0;
  for (auto _ : state) {
    const pid_t pid = fork();
    if (pid == 0) {
      execl(KOVAPERFEVENTD_PATH, KOVAPERFEVENTD_PATH, "--proc", root.Proc().c_str(), "--sys",
            root.Sys().c_str(), "--time-scale", "0.001", static_cast<char*>(nullptr));
      _exit(127);
    }
    std::this_thread::sleep_for(std::chrono::seconds(1));
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(status, line);) {
      if (line.rfind("VmHWM:", 0) == 0) peak_kib = strtod(line.c_str() + 6, nullptr);
      if (line.rfind("VmRSS:", 0) == 0) resident_kib = strtod(line.c_str() + 6, nullptr);
    }
    kill(pid, SIGTERM);
    waitpid(pid, nullptr, 0);
  }
  state.counters["peak_MiB"] = peak_kib / 1024;
  state.counters["resident_MiB"] = resident_kib / 1024;
}
BENCHMARK(BM_DaemonResidentMemory)->Iterations(1)->Unit(benchmark::kSecond);

}  // namespace
}  // namespace perfeventd

BENCHMARK_MAIN();
