// kovastatd's sampler: once a second, one pass over /proc, /sys and the
// volumes gives the value of every series the collector keeps (the catalog in
// protocol.md). Rates are worked out from the pass before.

#ifndef KOVA_DAEMONS_STATD_SAMPLER_H_
#define KOVA_DAEMONS_STATD_SAMPLER_H_

#include <sys/statvfs.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "statd/metrics_sample.h"

namespace statd {

// A series' labels, in the order the catalog shows them.
using Labels = std::vector<std::pair<std::string, std::string>>;

// What the catalog says of a series.
struct SeriesInfo {
  std::string id;      // "net.rx_bytes@eth0": the metric, and "@" and the object for one object
  std::string metric;  // "net.rx_bytes"
  std::string unit;    // "B/s"
  Labels labels;       // {{"interface", "eth0"}}

  bool operator==(const SeriesInfo&) const = default;
};

// One series' value in one cycle.
struct SeriesValue {
  SeriesInfo info;
  double value = 0;
};

struct SamplerOptions {
  std::string proc_dir = "/proc";  // or a recorded tree
  std::string sys_dir = "/sys";
  // How long a volume's statvfs may take before the cycle goes on without
  // that volume; a volume whose last call hasn't come back is skipped.
  std::chrono::milliseconds volume_timeout{200};
  // The call that reads a volume's space, statvfs(2) when empty; tests put one
  // that hangs. Called on helper threads, possibly after the sampler is gone.
  std::function<int(const char* path, struct statvfs* out)> statvfs;
  // Monotonic seconds, over which rates are worked out: the time of each pass
  // over /proc when empty; tests put their own.
  std::function<double()> clock;
};

class Sampler {
 public:
  virtual ~Sampler() = default;

  // One pass. Returns the value of every series that has one in this cycle, in
  // the catalog's order (CPU, load, memory, interfaces, disks, volumes,
  // services, LUNs; each object's metrics together, objects in the order their
  // files list them, services by name): a rate needs the pass before (so the
  // first cycle gives only levels), and a counter that went back (wrapped or
  // reset), an object that vanished or a file that can't be read gives no
  // value. An interface, disk or CPU that appears, or a CPU back online, has
  // values from its second pass on. disk.await and lun.latency have no value
  // in a cycle without I/O, so that idle seconds don't pull an average down.
  // Never blocks longer than the volume timeout on a hung mount.
  virtual std::vector<SeriesValue> Cycle() = 0;

  // The files and volumes (real paths) that couldn't be read in the last
  // cycle, a volume also while its statvfs hangs, so that the daemon can say
  // each once.
  virtual const std::vector<std::string>& Unreadable() const = 0;

  // The raw counters of the last cycle for the metrics endpoint: everything
  // but the time and kovaperfeventd's state, which the daemon adds. Services'
  // CPU seconds add up the time measured in each cycle since the first.
  virtual const MetricsSample& Metrics() const = 0;
};

// The sampler of the system under the system root (KOVA_ROOT): its services
// (packages included), LUNs and volumes, measured from `options`' directories.
std::unique_ptr<Sampler> MakeSystemSampler(const SamplerOptions& options);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_SAMPLER_H_
