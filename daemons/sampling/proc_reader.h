// One pass over /proc (and /sys) per cycle: the counters the daemons measure
// with, read from the directories given (the live ones, or recorded snapshots
// in tests and benchmarks). A pass reads only what its caller needs.

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

  bool operator==(const DiskSample&) const = default;
};

// A line of self/mountinfo: the device mounted at `path`.
struct MountPoint {
  uint32_t major = 0;
  uint32_t minor = 0;
  std::string path;
};

// What a pass reads besides stat and meminfo, which it always reads.
struct SampleNeeds {
  bool processes = false;    // every <pid>/stat
  bool disks = false;        // diskstats
  bool mounts = false;       // self/mountinfo
  bool whole_disks = false;  // which disks are physical, from /sys/block
};

struct Snapshot {
  double seconds = 0;  // monotonic time of the pass
  std::optional<CpuTimes> cpu;
  uint64_t memory_total_kib = 0;  // 0 when meminfo couldn't be read
  uint64_t memory_available_kib = 0;
  bool processes_read = false;
  std::vector<ProcessSample> processes;  // sorted by pid
  bool disks_read = false;
  std::vector<DiskSample> disks;
  bool mounts_read = false;
  std::vector<MountPoint> mounts;
  std::vector<std::string> unreadable;  // the files of this pass that couldn't be read
};

class ProcReader {
 public:
  ProcReader(std::string proc_dir, std::string sys_dir);

  // One pass; what fails to read is named in `unreadable` and left out.
  Snapshot Read(const SampleNeeds& needs) const;

 private:
  void ReadProcesses(Snapshot& snapshot) const;
  void ReadDisks(Snapshot& snapshot, bool whole_disks) const;
  void ReadMounts(Snapshot& snapshot) const;

  std::string proc_;
  std::string sys_;
};

// Parses the text of a <pid>/stat file; false when it is not one.
bool ParseProcessStat(const char* text, ProcessSample& sample);

}  // namespace sampling

#endif  // KOVA_DAEMONS_SAMPLING_PROC_READER_H_
