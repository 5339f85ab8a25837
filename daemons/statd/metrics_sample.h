// The raw counters and levels of one sample, as the metrics endpoint exports
// them: what the sampler's pass read (CPU ticks, bytes, I/O counts since boot),
// the space of the volumes, the services' CPU time summed over the daemon's
// samples, and what kovaperfeventd published. Filled by the sampling pass,
// rendered once per sample; a scrape never reads /proc.

#ifndef KOVA_DAEMONS_STATD_METRICS_SAMPLE_H_
#define KOVA_DAEMONS_STATD_METRICS_SAMPLE_H_

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "sampling/proc_reader.h"
#include "statd/perf_state.h"

namespace statd {

// A mounted volume's space in bytes.
struct FilesystemSpace {
  std::string mountpoint;  // the volume's system path, such as /volume1
  std::string device;      // the mount's source; empty when no mount holds it
  std::string fstype;
  uint64_t size = 0;
  uint64_t free = 0;   // free blocks, those kept for root included
  uint64_t avail = 0;  // what an unprivileged user can still take
};

// A service's (or package's) processes: CPU time in seconds summed over the
// samples since the collector started, resident memory now.
struct ServiceUsage {
  std::string name;  // the service's name; for a package, the package's
  std::string display_name;
  double cpu_seconds = 0;
  std::optional<uint64_t> resident_bytes;
};

// A LUN's I/O: the counters of the block device that holds its volume.
struct LunCounters {
  std::string uuid;
  std::string name;
  uint64_t read_bytes = 0;
  uint64_t written_bytes = 0;
  uint64_t ios = 0;    // reads and writes completed
  uint64_t io_ms = 0;  // milliseconds spent on them
};

struct MetricsSample {
  double time = 0;   // the sample's Unix time
  double delay = 0;  // seconds from that time to the end of the sample's pass
  uint64_t ticks_per_second = 100;
  uint64_t boot_time = 0;                 // 0: unknown
  std::vector<sampling::CpuStates> cpus;  // each CPU's line, not the sum
  uint64_t memory_total_kib = 0;          // 0: meminfo not read
  uint64_t memory_available_kib = 0;
  std::optional<sampling::MemoryDetail> memory;
  std::optional<sampling::LoadAverage> load;
  std::vector<sampling::NetSample> net;
  std::vector<sampling::DiskSample> disks;  // physical disks only
  std::vector<FilesystemSpace> filesystems;
  std::vector<ServiceUsage> services;
  std::vector<ServiceUsage> packages;
  std::vector<LunCounters> luns;
  std::optional<PerfState> perf;  // none while kovaperfeventd isn't running
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_METRICS_SAMPLE_H_
