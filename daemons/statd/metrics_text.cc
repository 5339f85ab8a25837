#include "statd/metrics_text.h"

#include <charconv>
#include <cmath>
#include <cstdint>
#include <initializer_list>
#include <utility>

namespace statd {

using sampling::CpuStates;
using sampling::DiskSample;
using sampling::MemoryDetail;
using sampling::NetSample;
namespace {

using Label = std::pair<const char*, std::string_view>;

// node_cpu_seconds_total's modes, as /proc/stat counts them.
struct CpuMode {
  const char* mode;
  uint64_t CpuStates::*ticks;
};
constexpr CpuMode kCpuModes[] = {
    {"idle", &CpuStates::idle},     {"iowait", &CpuStates::iowait},   {"irq", &CpuStates::irq},
    {"nice", &CpuStates::nice},     {"softirq", &CpuStates::softirq}, {"steal", &CpuStates::steal},
    {"system", &CpuStates::system}, {"user", &CpuStates::user},       {nullptr, nullptr},
};

// The lines of meminfo besides MemTotal and MemAvailable, in KiB.
struct MemoryGauge {
  const char* name;
  const char* help;
  uint64_t MemoryDetail::*kib;
};
constexpr MemoryGauge kMemoryGauges[] = {
    {"node_memory_Buffers_bytes", "Memory information field Buffers_bytes.",
     &MemoryDetail::buffers_kib},
    {"node_memory_Cached_bytes", "Memory information field Cached_bytes.",
     &MemoryDetail::cached_kib},
    {"node_memory_SReclaimable_bytes", "Memory information field SReclaimable_bytes.",
     &MemoryDetail::reclaimable_kib},
    {"node_memory_SwapTotal_bytes", "Memory information field SwapTotal_bytes.",
     &MemoryDetail::swap_total_kib},
    {"node_memory_SwapFree_bytes", "Memory information field SwapFree_bytes.",
     &MemoryDetail::swap_free_kib},
    {nullptr, nullptr, nullptr},
};

// An interface's counters; names without "_total".
struct NetCounter {
  const char* name;
  const char* help;
  uint64_t NetSample::*counter;
};
constexpr NetCounter kNetCounters[] = {
    {"node_network_receive_bytes", "Network device statistic receive_bytes.", &NetSample::rx_bytes},
    {"node_network_receive_packets", "Network device statistic receive_packets.",
     &NetSample::rx_packets},
    {"node_network_receive_errs", "Network device statistic receive_errs.", &NetSample::rx_errors},
    {"node_network_transmit_bytes", "Network device statistic transmit_bytes.",
     &NetSample::tx_bytes},
    {"node_network_transmit_packets", "Network device statistic transmit_packets.",
     &NetSample::tx_packets},
    {"node_network_transmit_errs", "Network device statistic transmit_errs.",
     &NetSample::tx_errors},
    {nullptr, nullptr, nullptr},
};

// A disk's counters, `divisor` counts per unit; names without "_total".
struct DiskCounter {
  const char* name;
  const char* help;
  uint64_t DiskSample::*counter;
  double divisor;
};
constexpr DiskCounter kDiskCounters[] = {
    {"node_disk_reads_completed", "The total number of reads completed successfully.",
     &DiskSample::reads, 1},
    {"node_disk_writes_completed", "The total number of writes completed successfully.",
     &DiskSample::writes, 1},
    {"node_disk_read_bytes", "The total number of bytes read successfully.",
     &DiskSample::read_sectors, 1.0 / 512},
    {"node_disk_written_bytes", "The total number of bytes written successfully.",
     &DiskSample::write_sectors, 1.0 / 512},
    {"node_disk_read_time_seconds", "The total number of seconds spent by all reads.",
     &DiskSample::read_ms, 1000},
    {"node_disk_write_time_seconds", "This is the total number of seconds spent by all writes.",
     &DiskSample::write_ms, 1000},
    {"node_disk_io_time_seconds", "Total seconds spent doing I/Os.", &DiskSample::io_ticks, 1000},
    {nullptr, nullptr, nullptr, 0},
};

// A LUN's counters; names without "_total".
struct LunCounter {
  const char* name;
  const char* help;
  uint64_t LunCounters::*counter;
  double divisor;
};
constexpr LunCounter kLunCounters[] = {
    {"kova_lun_read_bytes", "Bytes read from the block device that holds the LUN's volume.",
     &LunCounters::read_bytes, 1},
    {"kova_lun_written_bytes", "Bytes written to the block device that holds the LUN's volume.",
     &LunCounters::written_bytes, 1},
    {"kova_lun_ios_completed", "Reads and writes completed on the LUN's block device.",
     &LunCounters::ios, 1},
    {"kova_lun_io_time_seconds",
     "Seconds spent on reads and writes on the LUN's block device; over ios_completed, the "
     "latency.",
     &LunCounters::io_ms, 1000},
    {nullptr, nullptr, nullptr, 0},
};

// Writes families one after the other: a family's HELP and TYPE lines come
// with its first sample, so that a family without one leaves no trace.
class Writer {
 public:
  Writer(MetricsFormat format, std::string& out)
      : open_(format == MetricsFormat::kOpenMetrics), out_(out) {}

  // Starts the family `name` of `type`; a counter's `name` is without "_total",
  // which its samples get.
  void Family(const char* name, const char* type, const char* help) {
    name_ = name;
    counter_ = std::string_view(type) == "counter";
    type_ = type;
    help_ = help;
    headed_ = false;
  }

  void Sample(std::initializer_list<Label> labels, double value) {
    Head();
    out_ += name_;
    if (counter_) out_ += "_total";
    if (labels.size() > 0) {
      out_ += '{';
      bool first = true;
      for (const Label& label : labels) {
        if (!first) out_ += ',';
        first = false;
        out_ += label.first;
        out_ += "=\"";
        Escape(label.second);
        out_ += '"';
      }
      out_ += '}';
    }
    out_ += ' ';
    Number(value);
    out_ += '\n';
  }

  void End() {
    if (open_) out_ += "# EOF\n";
  }

 private:
  void Head() {
    if (headed_) return;
    headed_ = true;
    // The text format names a counter's family with "_total", OpenMetrics without.
    const char* suffix = counter_ && !open_ ? "_total" : "";
    out_.append("# HELP ").append(name_).append(suffix).append(" ").append(help_).append("\n");
    out_.append("# TYPE ").append(name_).append(suffix).append(" ").append(type_).append("\n");
  }

  // A label value with backslash, double quote and line feed escaped.
  void Escape(std::string_view value) {
    for (char c : value) {
      if (c == '\\') {
        out_ += "\\\\";
      } else if (c == '"') {
        out_ += "\\\"";
      } else if (c == '\n') {
        out_ += "\\n";
      } else {
        out_ += c;
      }
    }
  }

  void Number(double value) {
    if (std::isnan(value)) {
      out_ += "NaN";
      return;
    }
    if (std::isinf(value)) {
      out_ += value > 0 ? "+Inf" : "-Inf";
      return;
    }
    char buffer[32];
    // Whole numbers exactly as integers; the rest in the shortest form that reads back.
    const bool whole = value == std::floor(value) && std::fabs(value) < 1e15;
    const auto result =
        whole ? std::to_chars(buffer, buffer + sizeof(buffer), static_cast<int64_t>(value))
              : std::to_chars(buffer, buffer + sizeof(buffer), value);
    out_.append(buffer, result.ptr);
  }

  bool open_;
  std::string& out_;
  const char* name_ = "";
  const char* type_ = "";
  const char* help_ = "";
  bool counter_ = false;
  bool headed_ = false;
};

double Bytes(uint64_t kib) { return static_cast<double>(kib) * 1024; }

void WriteCpus(const MetricsSample& s, Writer& w) {
  w.Family("node_cpu_seconds", "counter", "Seconds the CPUs spent in each mode.");
  // Divided rather than multiplied by the tick, which gives 280.84 for 28084 ticks, not
  // 280.84000000000003.
  const double ticks = static_cast<double>(s.ticks_per_second);
  for (const CpuStates& cpu : s.cpus) {
    const std::string number = std::to_string(cpu.cpu);
    for (const CpuMode* row = kCpuModes; row->mode != nullptr; ++row) {
      w.Sample({{"cpu", number}, {"mode", row->mode}},
               static_cast<double>(cpu.*row->ticks) / ticks);
    }
  }
}

void WriteLoadAndMemory(const MetricsSample& s, Writer& w) {
  if (s.load) {
    const std::pair<const char*, double> loads[] = {{"node_load1", s.load->one},
                                                    {"node_load5", s.load->five},
                                                    {"node_load15", s.load->fifteen}};
    for (const auto& [name, value] : loads) {
      w.Family(name, "gauge", "Load average.");  // node_exporter's names end in the minutes
      w.Sample({}, value);
    }
  }
  if (s.memory_total_kib > 0) {
    w.Family("node_memory_MemTotal_bytes", "gauge", "Memory information field MemTotal_bytes.");
    w.Sample({}, Bytes(s.memory_total_kib));
    w.Family("node_memory_MemAvailable_bytes", "gauge",
             "Memory information field MemAvailable_bytes.");
    w.Sample({}, Bytes(s.memory_available_kib));
  }
  if (s.memory) {
    for (const MemoryGauge* row = kMemoryGauges; row->name != nullptr; ++row) {
      w.Family(row->name, "gauge", row->help);
      w.Sample({}, Bytes(*s.memory.*row->kib));
    }
  }
}

void WriteDevices(const MetricsSample& s, Writer& w) {
  for (const NetCounter* row = kNetCounters; row->name != nullptr; ++row) {
    w.Family(row->name, "counter", row->help);
    for (const NetSample& net : s.net) {
      w.Sample({{"device", net.name}}, static_cast<double>(net.*row->counter));
    }
  }
  for (const DiskCounter* row = kDiskCounters; row->name != nullptr; ++row) {
    w.Family(row->name, "counter", row->help);
    for (const DiskSample& disk : s.disks) {
      w.Sample({{"device", disk.name}}, static_cast<double>(disk.*row->counter) / row->divisor);
    }
  }
  const std::pair<const char*, uint64_t FilesystemSpace::*> spaces[] = {
      {"node_filesystem_size_bytes", &FilesystemSpace::size},
      {"node_filesystem_free_bytes", &FilesystemSpace::free},
      {"node_filesystem_avail_bytes", &FilesystemSpace::avail},
  };
  for (const auto& [name, field] : spaces) {
    w.Family(name, "gauge", "Filesystem space in bytes: size, free, available to non-root users.");
    for (const FilesystemSpace& fs : s.filesystems) {
      w.Sample({{"device", fs.device}, {"fstype", fs.fstype}, {"mountpoint", fs.mountpoint}},
               static_cast<double>(fs.*field));
    }
  }
}

// kova_service_* or kova_package_*, labelled by `key` and the display name.
void WriteUsage(const std::vector<ServiceUsage>& usage, const char* cpu, const char* resident,
                const char* key, Writer& w) {
  w.Family(cpu, "counter", "CPU seconds of the processes, counted while the collector runs.");
  for (const ServiceUsage& u : usage) {
    w.Sample({{key, u.name}, {"display_name", u.display_name}}, u.cpu_seconds);
  }
  w.Family(resident, "gauge", "Resident memory of the processes in bytes.");
  for (const ServiceUsage& u : usage) {
    if (u.resident_bytes) {
      w.Sample({{key, u.name}, {"display_name", u.display_name}},
               static_cast<double>(*u.resident_bytes));
    }
  }
}

void WriteSystem(const MetricsSample& s, Writer& w) {
  WriteUsage(s.services, "kova_service_cpu_seconds", "kova_service_resident_bytes", "service", w);
  WriteUsage(s.packages, "kova_package_cpu_seconds", "kova_package_resident_bytes", "package", w);
  for (const LunCounter* row = kLunCounters; row->name != nullptr; ++row) {
    w.Family(row->name, "counter", row->help);
    for (const LunCounters& lun : s.luns) {
      w.Sample({{"lun", lun.uuid}, {"name", lun.name}},
               static_cast<double>(lun.*row->counter) / row->divisor);
    }
  }
  if (!s.perf) return;
  w.Family("kova_perf_events", "counter", "Events kovaperfeventd logged since it started.");
  for (size_t level = 0; level < std::size(kPerfLevels); ++level) {
    w.Sample({{"level", kPerfLevels[level]}}, static_cast<double>(s.perf->events[level]));
  }
  w.Family("kova_perf_event_rule_firing", "gauge", "1 for each performance-event rule firing now.");
  for (const FiringRule& rule : s.perf->firing) {
    w.Sample({{"rule", rule.rule}, {"object", rule.object}, {"resource", rule.resource}}, 1);
  }
}

}  // namespace

MetricsFormat FormatFor(std::string_view accept) {
  return accept.find("application/openmetrics-text") != std::string_view::npos
             ? MetricsFormat::kOpenMetrics
             : MetricsFormat::kPrometheus;
}

std::string RenderMetrics(const MetricsSample& sample, MetricsFormat format) {
  std::string out;
  out.reserve(16384 + 600 * (sample.services.size() + sample.packages.size() + sample.cpus.size()));
  Writer w(format, out);
  if (sample.boot_time > 0) {
    w.Family("node_boot_time_seconds", "gauge", "Node boot time, in unixtime.");
    w.Sample({}, static_cast<double>(sample.boot_time));
  }
  w.Family("node_time_seconds", "gauge", "System time in seconds since epoch (1970).");
  w.Sample({}, sample.time);
  w.Family("kova_statd_sample_delay_seconds", "gauge",
           "Seconds from the sample's planned time to the end of its pass.");
  w.Sample({}, sample.delay);
  WriteCpus(sample, w);
  WriteLoadAndMemory(sample, w);
  WriteDevices(sample, w);
  WriteSystem(sample, w);
  w.End();
  return out;
}

}  // namespace statd
