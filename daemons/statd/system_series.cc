#include "statd/system_series.h"

#include <algorithm>
#include <cstdint>

namespace statd {

using sampling::CpuStates;
using sampling::DiskSample;
using sampling::NetSample;
using sampling::Snapshot;
namespace {

// The catalog's CPU states: each the share of a CPU's ticks in its parts.
struct CpuMetric {
  const char* metric;
  uint64_t CpuStates::*parts[3];
};
constexpr CpuMetric kCpuMetrics[] = {
    {"cpu.user", {&CpuStates::user, &CpuStates::nice}},
    {"cpu.system", {&CpuStates::system, &CpuStates::irq, &CpuStates::softirq}},
    {"cpu.iowait", {&CpuStates::iowait}},
    {"cpu.steal", {&CpuStates::steal}},
    {"cpu.idle", {&CpuStates::idle}},
    {nullptr, {}},
};
constexpr uint64_t CpuStates::*kCpuFields[] = {
    &CpuStates::user,   &CpuStates::nice, &CpuStates::system,  &CpuStates::idle,
    &CpuStates::iowait, &CpuStates::irq,  &CpuStates::softirq, &CpuStates::steal,
};

// An interface's counters, each a rate per second.
struct NetMetric {
  const char* metric;
  const char* unit;
  uint64_t NetSample::*counter;
};
constexpr NetMetric kNetMetrics[] = {
    {"net.rx_bytes", "B/s", &NetSample::rx_bytes},
    {"net.tx_bytes", "B/s", &NetSample::tx_bytes},
    {"net.rx_packets", "packets/s", &NetSample::rx_packets},
    {"net.tx_packets", "packets/s", &NetSample::tx_packets},
    {"net.rx_errors", "errors/s", &NetSample::rx_errors},
    {"net.tx_errors", "errors/s", &NetSample::tx_errors},
    {nullptr, nullptr, nullptr},
};

// A disk's counters that are rates per second, `scale` units per count.
struct DiskMetric {
  const char* metric;
  const char* unit;
  uint64_t DiskSample::*counter;
  double scale;
};
constexpr DiskMetric kDiskRates[] = {
    {"disk.read_bytes", "B/s", &DiskSample::read_sectors, 512},
    {"disk.write_bytes", "B/s", &DiskSample::write_sectors, 512},
    {"disk.read_iops", "IO/s", &DiskSample::reads, 1},
    {"disk.write_iops", "IO/s", &DiskSample::writes, 1},
    {nullptr, nullptr, nullptr, 0},
};

constexpr double kKiB = 1024;

// `now` less `before` in `delta`; false when the counter went back (it
// wrapped, or its object was reset).
bool Grew(uint64_t before, uint64_t now, double& delta) {
  if (now < before) return false;
  delta = static_cast<double>(now - before);
  return true;
}

void AddCpu(const CpuStates& before, const CpuStates& now, std::vector<SeriesValue>& out) {
  uint64_t total = 0;
  for (uint64_t CpuStates::*field : kCpuFields) {
    if (now.*field < before.*field) return;  // a counter went back: no shares this time
    total += now.*field - before.*field;
  }
  if (total == 0) return;
  const std::string object = now.cpu < 0 ? "" : std::string("cpu").append(std::to_string(now.cpu));
  const Labels labels = now.cpu < 0 ? Labels{} : Labels{{"cpu", std::to_string(now.cpu)}};
  for (const CpuMetric* row = kCpuMetrics; row->metric != nullptr; ++row) {
    uint64_t ticks = 0;
    for (uint64_t CpuStates::*part : row->parts) {
      if (part != nullptr) ticks += now.*part - before.*part;
    }
    AddValue(out, row->metric, "%", object, labels,
             100.0 * static_cast<double>(ticks) / static_cast<double>(total));
  }
}

void AddMemory(const Snapshot& now, std::vector<SeriesValue>& out) {
  if (now.memory_total_kib == 0) return;
  const uint64_t total = now.memory_total_kib;
  const uint64_t available = std::min(now.memory_available_kib, total);
  AddValue(out, "mem.total", "B", "", {}, static_cast<double>(total) * kKiB);
  AddValue(out, "mem.used", "B", "", {}, static_cast<double>(total - available) * kKiB);
  if (now.memory_detail) {
    const sampling::MemoryDetail& m = *now.memory_detail;
    AddValue(out, "mem.cached", "B", "", {},
             static_cast<double>(m.buffers_kib + m.cached_kib + m.reclaimable_kib) * kKiB);
  }
  AddValue(out, "mem.available", "B", "", {}, static_cast<double>(available) * kKiB);
  if (now.memory_detail) {
    const sampling::MemoryDetail& m = *now.memory_detail;
    AddValue(
        out, "swap.used", "B", "", {},
        static_cast<double>(m.swap_total_kib - std::min(m.swap_free_kib, m.swap_total_kib)) * kKiB);
  }
}

void AddInterface(const NetSample& before, const NetSample& now, double seconds,
                  std::vector<SeriesValue>& out) {
  const Labels labels = {{"interface", now.name}};
  for (const NetMetric* row = kNetMetrics; row->metric != nullptr; ++row) {
    double delta = 0;
    if (Grew(before.*row->counter, now.*row->counter, delta)) {
      AddValue(out, row->metric, row->unit, now.name, labels, delta / seconds);
    }
  }
}

void AddDisk(const DiskSample& before, const DiskSample& now, double seconds,
             std::vector<SeriesValue>& out) {
  const Labels labels = {{"device", now.name}};
  for (const DiskMetric* row = kDiskRates; row->metric != nullptr; ++row) {
    double delta = 0;
    if (Grew(before.*row->counter, now.*row->counter, delta)) {
      AddValue(out, row->metric, row->unit, now.name, labels, delta * row->scale / seconds);
    }
  }
  double busy_ms = 0;
  if (Grew(before.io_ticks, now.io_ticks, busy_ms)) {
    AddValue(out, "disk.util", "%", now.name, labels,
             std::min(100.0, busy_ms / (10 * seconds)));  // ms per s, as %
  }
  // The time an I/O took on average: none in a second without I/O.
  double reads = 0;
  double writes = 0;
  double read_ms = 0;
  double write_ms = 0;
  if (Grew(before.reads, now.reads, reads) && Grew(before.writes, now.writes, writes) &&
      Grew(before.read_ms, now.read_ms, read_ms) && Grew(before.write_ms, now.write_ms, write_ms) &&
      reads + writes > 0) {
    AddValue(out, "disk.await", "ms", now.name, labels, (read_ms + write_ms) / (reads + writes));
  }
}

}  // namespace

void AddValue(std::vector<SeriesValue>& out, const char* metric, const char* unit,
              const std::string& object, const Labels& labels, double value) {
  SeriesValue& added = out.emplace_back();
  added.info.id = object.empty() ? std::string(metric) : std::string(metric) + "@" + object;
  added.info.metric = metric;
  added.info.unit = unit;
  added.info.labels = labels;
  added.value = value;
}

void AddSystemValues(const Snapshot* before, const Snapshot& now, std::vector<SeriesValue>& out) {
  // Rates only over time that passed, between passes that both read the file.
  const double seconds = before != nullptr ? now.seconds - before->seconds : 0;
  const bool rates = seconds > 0;
  for (const CpuStates& cpu : now.cpu_states) {
    if (!rates) break;
    // A CPU that was offline in the pass before has no line there.
    const auto earlier = std::find_if(before->cpu_states.begin(), before->cpu_states.end(),
                                      [&](const CpuStates& c) { return c.cpu == cpu.cpu; });
    if (earlier != before->cpu_states.end()) AddCpu(*earlier, cpu, out);
  }
  if (now.load) {
    AddValue(out, "load.1", "load", "", {}, now.load->one);
    AddValue(out, "load.5", "load", "", {}, now.load->five);
    AddValue(out, "load.15", "load", "", {}, now.load->fifteen);
  }
  AddMemory(now, out);
  for (const NetSample& interface : now.net) {
    if (!rates || interface.name == "lo") continue;
    const auto earlier = std::find_if(before->net.begin(), before->net.end(),
                                      [&](const NetSample& n) { return n.name == interface.name; });
    if (earlier != before->net.end()) AddInterface(*earlier, interface, seconds, out);
  }
  for (const DiskSample& disk : now.disks) {
    if (!rates || !disk.whole_disk) continue;
    const auto earlier =
        std::find_if(before->disks.begin(), before->disks.end(), [&](const DiskSample& d) {
          return d.name == disk.name && d.major == disk.major && d.minor == disk.minor;
        });
    if (earlier != before->disks.end()) AddDisk(*earlier, disk, seconds, out);
  }
}

}  // namespace statd
