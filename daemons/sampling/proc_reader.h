// One pass over /proc (and /sys) per cycle: the counters the daemons measure
// with, read from the directories given (the live ones, or recorded snapshots
// in tests and benchmarks). A pass reads only what its caller needs, so that
// kovaperfeventd's rules cost no more than their own files.

#ifndef KOVA_DAEMONS_SAMPLING_PROC_READER_H_
#define KOVA_DAEMONS_SAMPLING_PROC_READER_H_

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace sampling {

// The "cpu" line of stat, in clock ticks summed over all CPUs.
struct CpuTimes {
  uint64_t busy = 0;   // every state but idle and iowait
  uint64_t total = 0;  // all states
};

// A "cpu" or "cpuN" line of stat: clock ticks in each state.
struct CpuStates {
  int cpu = -1;       // N, or -1 for the line of all CPUs
  uint64_t user = 0;  // guest time is part of it already
  uint64_t nice = 0;
  uint64_t system = 0;
  uint64_t idle = 0;
  uint64_t iowait = 0;
  uint64_t irq = 0;
  uint64_t softirq = 0;
  uint64_t steal = 0;

  bool operator==(const CpuStates&) const = default;
};

// loadavg: the run queue averaged over 1, 5 and 15 minutes.
struct LoadAverage {
  double one = 0;
  double five = 0;
  double fifteen = 0;
};

// The lines of meminfo besides MemTotal and MemAvailable, in KiB; a line the
// kernel doesn't write counts 0.
struct MemoryDetail {
  uint64_t buffers_kib = 0;
  uint64_t cached_kib = 0;
  uint64_t reclaimable_kib = 0;  // SReclaimable
  uint64_t swap_total_kib = 0;
  uint64_t swap_free_kib = 0;

  bool operator==(const MemoryDetail&) const = default;
};

// A line of net/dev: one interface's counters since it came up.
struct NetSample {
  std::string name;
  uint64_t rx_bytes = 0;
  uint64_t rx_packets = 0;
  uint64_t rx_errors = 0;
  uint64_t tx_bytes = 0;
  uint64_t tx_packets = 0;
  uint64_t tx_errors = 0;

  bool operator==(const NetSample&) const = default;
};

// From <pid>/stat.
struct ProcessSample {
  pid_t pid = 0;
  pid_t ppid = 0;
  uint64_t start_time = 0;  // clock ticks since boot
  uint64_t ticks = 0;       // user and system time, clock ticks
  uint64_t rss_pages = 0;

  bool operator==(const ProcessSample&) const = default;
};

// A line of diskstats.
struct DiskSample {
  uint32_t major = 0;
  uint32_t minor = 0;
  std::string name;
  uint64_t ios = 0;         // reads and writes completed
  uint64_t sectors = 0;     // 512-byte sectors read and written
  uint64_t io_ms = 0;       // milliseconds spent reading and writing
  bool whole_disk = false;  // a physical disk, not a partition or a virtual device
  // Reads and writes apart, and the time the device was busy; 0 unless the
  // pass was asked for them (SampleNeeds::disk_detail).
  uint64_t reads = 0;
  uint64_t read_sectors = 0;
  uint64_t read_ms = 0;
  uint64_t writes = 0;
  uint64_t write_sectors = 0;
  uint64_t write_ms = 0;
  uint64_t io_ticks = 0;  // milliseconds with I/O in flight

  bool operator==(const DiskSample&) const = default;
};

// A line of self/mountinfo: the device mounted at `path`.
struct MountPoint {
  uint32_t major = 0;
  uint32_t minor = 0;
  std::string path;
  // Given defaults, so that a mount written as {major, minor, path} needs no more.
  std::string source = {};  // the mount source after " - ", such as /dev/sda1
  std::string fstype = {};  // the file system's type, such as ext4
};

// What a pass reads besides the "cpu" line of stat and MemTotal and
// MemAvailable of meminfo, which it always reads.
struct SampleNeeds {
  bool processes = false;      // every <pid>/stat
  bool disks = false;          // diskstats
  bool mounts = false;         // self/mountinfo
  bool whole_disks = false;    // which disks are physical, from /sys/block
  bool cpu_states = false;     // every cpu line of stat, state by state
  bool load = false;           // loadavg
  bool memory_detail = false;  // the rest of meminfo
  bool net = false;            // net/dev
  bool disk_detail = false;    // with `disks`: reads and writes apart, busy time
};

struct Snapshot {
  double seconds = 0;  // monotonic time of the pass
  std::optional<CpuTimes> cpu;
  std::vector<CpuStates> cpu_states;  // the line of all CPUs, then each online CPU's
  uint64_t boot_time = 0;             // btime of stat, read with cpu_states; 0 when absent
  uint64_t memory_total_kib = 0;      // 0 when meminfo couldn't be read
  uint64_t memory_available_kib = 0;
  std::optional<MemoryDetail> memory_detail;
  std::optional<LoadAverage> load;
  bool processes_read = false;
  std::vector<ProcessSample> processes;  // sorted by pid
  bool disks_read = false;
  std::vector<DiskSample> disks;
  bool mounts_read = false;
  std::vector<MountPoint> mounts;
  bool net_read = false;
  std::vector<NetSample> net;
  std::vector<std::string> unreadable;  // the files of this pass that couldn't be read
};

class ProcReader {
 public:
  ProcReader(std::string proc_dir, std::string sys_dir);

  // One pass; what fails to read is named in `unreadable` and left out.
  Snapshot Read(const SampleNeeds& needs) const;

 private:
  void ReadStat(Snapshot& snapshot, bool cpu_states) const;
  void ReadMemory(Snapshot& snapshot, bool detail) const;
  void ReadLoad(Snapshot& snapshot) const;
  void ReadProcesses(Snapshot& snapshot) const;
  void ReadDisks(Snapshot& snapshot, bool whole_disks, bool detail) const;
  void ReadMounts(Snapshot& snapshot) const;
  void ReadNet(Snapshot& snapshot) const;

  std::string proc_;
  std::string sys_;
};

}  // namespace sampling

#endif  // KOVA_DAEMONS_SAMPLING_PROC_READER_H_
