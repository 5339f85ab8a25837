// CPU time of one cycle of kovastatd's sampler (Sampler::Cycle), over this
// machine's /proc and over a recorded machine of 16 CPUs, 8 disks, 4
// interfaces, 100 services (half of them packages'), 4 LUNs, 2 volumes and
// 1,000 processes, against the floor of any sampler measured in the same run:
// reading the same /proc files whole without parsing them. Prints both, their
// ratio and the share of the budget: 1 % of a core at one cycle a second, that
// is 10 ms a cycle. Process CPU time, so that the volumes' threads count too.
//
//   statd_sampler_bench [benchmark flags]

#include <benchmark/benchmark.h>
#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "sampling/proc_reader.h"
#include "sampling/proc_text.h"
#include "statd/sampler.h"
#include "test_support/recorded_proc.h"
#include "test_support/temp_root.h"

namespace statd {
namespace {

using kova_test::TempRoot;

constexpr double kBudgetMicroseconds = 10000;  // 1 % of a core at 1 Hz
const kova_test::RecordedMachine kShape;       // the defaults: 16 CPUs, 8 disks...

// Reads the file `path` whole into a scratch buffer; false when it can't.
bool ReadWhole(int dir, const char* path) {
  static char buffer[1 << 16];
  const int fd = openat(dir, path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  ssize_t got = 0;
  while ((got = read(fd, buffer, sizeof(buffer))) > 0) {
  }
  close(fd);
  return got == 0;
}

// The floor: the /proc files a cycle reads, each read whole, unparsed: the
// system's files, the listing of /proc and every process's stat.
size_t ReadFloor(const std::string& proc, bool mounts) {
  size_t files = 0;
  for (const char* file :
       {"stat", "meminfo", "loadavg", "net/dev", "diskstats", "self/mountinfo"}) {
    if (strcmp(file, "self/mountinfo") == 0 && !mounts) continue;
    files += ReadWhole(AT_FDCWD, (proc + "/" + file).c_str());
  }
  DIR* dir = opendir(proc.c_str());
  if (dir == nullptr) return files;
  std::string path;
  while (const dirent* entry = readdir(dir)) {
    if (entry->d_name[0] < '1' || entry->d_name[0] > '9') continue;
    path.assign(entry->d_name).append("/stat");
    files += ReadWhole(dirfd(dir), path.c_str());
  }
  closedir(dir);
  return files;
}

void BM_Cycle_Recorded(benchmark::State& state) {
  TempRoot root;
  kova_test::WriteRecordedMachine(root.path(), kShape);
  SamplerOptions options;
  options.proc_dir = root.path() + "/proc";
  options.sys_dir = root.path() + "/sys";
  const std::unique_ptr<Sampler> sampler = MakeSystemSampler(options);
  sampler->Cycle();  // the first has levels only
  uint64_t pass = 1;
  size_t series = 0;
  for (auto _ : state) {
    state.PauseTiming();  // the counters grow between cycles, as they would in a second
    kova_test::WriteMachineCounters(root.path(), kShape, ++pass);
    state.ResumeTiming();
    series = sampler->Cycle().size();
  }
  if (series != kShape.Series()) {
    state.SkipWithError(
        ("expected " + std::to_string(kShape.Series()) + " series, got " + std::to_string(series))
            .c_str());
  }
  state.counters["series"] = static_cast<double>(series);
}
BENCHMARK(BM_Cycle_Recorded)->MeasureProcessCPUTime()->Unit(benchmark::kMicrosecond);

void BM_Floor_Recorded(benchmark::State& state) {
  TempRoot root;
  kova_test::WriteRecordedMachine(root.path(), kShape);
  size_t files = 0;
  for (auto _ : state) files = ReadFloor(root.path() + "/proc", true);
  if (files != 6 + static_cast<size_t>(kShape.processes)) state.SkipWithError("files missing");
  state.counters["files"] = static_cast<double>(files);
}
BENCHMARK(BM_Floor_Recorded)->MeasureProcessCPUTime()->Unit(benchmark::kMicrosecond);

// This machine, with one service: this process.
void BM_Cycle_Live(benchmark::State& state) {
  TempRoot root;
  char text[1024] = "";
  FILE* self = fopen("/proc/self/stat", "r");
  const bool read = self != nullptr && fgets(text, sizeof(text), self) != nullptr;
  if (self != nullptr) fclose(self);
  sampling::ProcessSample me;
  if (!read || !sampling::ParseProcessStat(text, me)) state.SkipWithError("no /proc/self/stat");
  kova_test::WriteFile(root.path() + "/etc/kova/services/bench.conf", "display_name=\"Bench\"\n");
  kova_test::WriteFile(root.path() + "/run/kova/bench.pid",
                       std::to_string(me.pid) + " " + std::to_string(me.start_time) + "\n");
  // What this machine has: its CPUs, interfaces and physical disks.
  sampling::SampleNeeds needs;
  needs.disks = needs.whole_disks = needs.cpu_states = needs.net = true;
  const sampling::Snapshot machine = sampling::ProcReader("/proc", "/sys").Read(needs);
  const size_t cpus = machine.cpu_states.size();
  const size_t interfaces = std::count_if(machine.net.begin(), machine.net.end(),
                                          [](const auto& n) { return n.name != "lo"; });
  const size_t disks = std::count_if(machine.disks.begin(), machine.disks.end(),
                                     [](const auto& d) { return d.whole_disk; });
  // Levels, interfaces, disks' rates and the service's memory always; CPU
  // shares only when a clock tick passed between two cycles, a disk's time
  // per I/O only when it did I/O.
  const size_t least = 3 + 5 + 6 * interfaces + 5 * disks + 1;
  const size_t most = least + 5 * cpus + disks + 1;

  SamplerOptions options;
  const std::unique_ptr<Sampler> sampler = MakeSystemSampler(options);
  sampler->Cycle();
  size_t series = 0;
  for (auto _ : state) {
    series = sampler->Cycle().size();
    if (series < least || series > most) {
      state.SkipWithError(("expected " + std::to_string(least) + " to " + std::to_string(most) +
                           " series, got " + std::to_string(series))
                              .c_str());
      break;
    }
  }
  state.counters["series"] = static_cast<double>(series);
}
BENCHMARK(BM_Cycle_Live)->MeasureProcessCPUTime()->Unit(benchmark::kMicrosecond);

void BM_Floor_Live(benchmark::State& state) {
  size_t files = 0;
  for (auto _ : state) files = ReadFloor("/proc", false);
  state.counters["files"] = static_cast<double>(files);
}
BENCHMARK(BM_Floor_Live)->MeasureProcessCPUTime()->Unit(benchmark::kMicrosecond);

// Keeps each benchmark's CPU time (the median when repeated) for the summary.
class SummaryReporter : public benchmark::ConsoleReporter {
 public:
  SummaryReporter() : ConsoleReporter(isatty(STDOUT_FILENO) ? OO_ColorTabular : OO_Tabular) {}

  void ReportRuns(const std::vector<Run>& runs) override {
    ConsoleReporter::ReportRuns(runs);
    for (const Run& run : runs) {
      if (run.error_occurred) continue;
      const std::string name = run.run_name.function_name;
      const bool median = run.run_type == Run::RT_Aggregate && run.aggregate_name == "median";
      if (median || (run.run_type == Run::RT_Iteration && !medians_.count(name))) {
        cpu_us_[name] = run.GetAdjustedCPUTime();
        if (median) medians_[name] = true;
      }
    }
  }
  void PrintSummary() const {
    for (const char* tree : {"Recorded", "Live"}) {
      const auto cycle = cpu_us_.find(std::string("BM_Cycle_") + tree);
      const auto floor = cpu_us_.find(std::string("BM_Floor_") + tree);
      if (cycle == cpu_us_.end() || floor == cpu_us_.end() || floor->second <= 0) continue;
      printf(
          "%-8s cycle %8.1f us CPU, floor (the same files read whole) %8.1f us: ratio %.2f; "
          "%.1f %% of the budget of %.0f us a cycle (1 %% of a core at 1 Hz)\n",
          tree, cycle->second, floor->second, cycle->second / floor->second,
          100 * cycle->second / kBudgetMicroseconds, kBudgetMicroseconds);
    }
  }

 private:
  std::map<std::string, double> cpu_us_;
  std::map<std::string, bool> medians_;
};

}  // namespace
}  // namespace statd

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  statd::SummaryReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  reporter.PrintSummary();
  benchmark::Shutdown();
  return 0;
}
