#include "statd/sampler.h"

#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <iterator>
#include <optional>
#include <string_view>
#include <unordered_map>
#include <unordered_set>

#include "kova/perfevent.h"
#include "sampling/measurements.h"
#include "sampling/mounts.h"
#include "sampling/object_directory.h"
#include "sampling/proc_reader.h"
#include "sampling/service_processes.h"
#include "src/services.h"
#include "src/system_root.h"
#include "src/volumes.h"
#include "statd/system_series.h"
#include "statd/volume_probe.h"

namespace statd {
namespace {

// How long a service's display name is taken as read before it is read again.
constexpr double kDisplayNameSeconds = 60;
// The services of packages are "pkgctl-<package>".
constexpr std::string_view kPackagePrefix = "pkgctl-";

const sampling::DiskSample* FindDisk(const sampling::Snapshot& snapshot, uint32_t major,
                                     uint32_t minor) {
  for (const sampling::DiskSample& disk : snapshot.disks) {
    if (disk.major == major && disk.minor == minor) return &disk;
  }
  return nullptr;
}

// The system's counters of `now` for the metrics endpoint.
void FillSystemMetrics(const sampling::Snapshot& now, MetricsSample& metrics) {
  metrics.boot_time = now.boot_time;
  metrics.cpus.clear();
  for (const sampling::CpuStates& cpu : now.cpu_states) {
    if (cpu.cpu >= 0) metrics.cpus.push_back(cpu);
  }
  metrics.memory_total_kib = now.memory_total_kib;
  metrics.memory_available_kib = std::min(now.memory_available_kib, now.memory_total_kib);
  metrics.memory = now.memory_detail;
  metrics.load = now.load;
  metrics.net = now.net;
  metrics.disks.clear();
  for (const sampling::DiskSample& disk : now.disks) {
    if (disk.whole_disk) metrics.disks.push_back(disk);
  }
}

class SystemSampler : public Sampler {
 public:
  explicit SystemSampler(const SamplerOptions& options)
      : timeout_(options.volume_timeout),
        clock_(options.clock),
        reader_(options.proc_dir, options.sys_dir),
        measurements_(static_cast<uint64_t>(sysconf(_SC_PAGESIZE)) / 1024),
        processes_(directory_),
        volumes_(options.statvfs) {
    metrics_.ticks_per_second = static_cast<uint64_t>(sysconf(_SC_CLK_TCK));
  }

  std::vector<SeriesValue> Cycle() override;
  const std::vector<std::string>& Unreadable() const override { return unreadable_; }
  const MetricsSample& Metrics() const override { return metrics_; }

 private:
  struct DisplayName {
    std::string text;
    double read_at = 0;  // monotonic seconds
  };

  // The services' values: CPU and resident memory of those running.
  void AddServices(const std::vector<std::string>& services, std::vector<SeriesValue>& out);
  // The LUNs' values: I/O rate and latency of the device under each one's volume.
  void AddLuns(std::vector<SeriesValue>& out);
  // The mount that holds the system path `path` in the current pass, nullptr when none does.
  const sampling::MountPoint* MountOf(const std::string& path);
  // Forgets what was kept of services that are gone.
  void KeepOnly(const std::vector<std::string>& services);

  std::chrono::milliseconds timeout_;
  std::function<double()> clock_;
  sampling::ProcReader reader_;
  sampling::Measurements measurements_;
  sampling::SystemDirectory directory_;
  sampling::ServiceProcesses processes_;
  VolumeProbe volumes_;
  std::vector<std::string> services_;  // as listed the cycle before
  std::unordered_map<std::string, DisplayName> display_names_;
  std::vector<std::string> unreadable_;
  size_t last_count_ = 0;  // values of the cycle before, to size the next one's
  std::unordered_map<std::string, uint64_t> cpu_ticks_;  // per service, summed over the cycles
  MetricsSample metrics_;
};

std::vector<SeriesValue> SystemSampler::Cycle() {
  // The volumes' calls run while /proc is read.
  const std::vector<std::string> volumes = kova::ListVolumes();
  std::vector<std::string> paths;
  paths.reserve(volumes.size());
  for (const std::string& volume : volumes) paths.push_back(kova::RootPath(volume));
  const auto deadline = std::chrono::steady_clock::now() + timeout_;
  volumes_.Start(paths);

  const std::vector<std::string> services = kova::ListKnownServices();
  if (services != services_) KeepOnly(services);
  directory_.Refresh();
  sampling::SampleNeeds needs;
  needs.processes = !services.empty();
  needs.mounts = !directory_.luns().empty() || !volumes.empty();
  needs.disks = needs.whole_disks = needs.disk_detail = true;
  needs.cpu_states = needs.load = needs.memory_detail = needs.net = true;
  sampling::Snapshot snapshot = reader_.Read(needs);
  if (clock_) snapshot.seconds = clock_();
  measurements_.Advance(std::move(snapshot));
  unreadable_ = measurements_.current().unreadable;
  FillSystemMetrics(measurements_.current(), metrics_);
  metrics_.services.clear();
  metrics_.packages.clear();
  metrics_.luns.clear();
  metrics_.filesystems.clear();

  std::vector<SeriesValue> out;
  out.reserve(last_count_);
  AddSystemValues(measurements_.previous(), measurements_.current(), out);
  std::vector<SeriesValue> objects;  // the services' and LUNs', which follow the volumes'
  AddServices(services, objects);
  AddLuns(objects);
  const std::vector<std::optional<VolumeSpace>> spaces = volumes_.Collect(deadline);
  for (size_t i = 0; i < volumes.size(); ++i) {
    if (!spaces[i]) {
      unreadable_.push_back(paths[i]);
      continue;
    }
    const Labels labels = {{"volume", volumes[i]}};
    AddValue(out, "volume.size", "B", volumes[i], labels, static_cast<double>(spaces[i]->size));
    AddValue(out, "volume.used", "B", volumes[i], labels, static_cast<double>(spaces[i]->used));
    AddValue(out, "volume.free", "B", volumes[i], labels, static_cast<double>(spaces[i]->free));
    FilesystemSpace& space = metrics_.filesystems.emplace_back();
    space.mountpoint = volumes[i];
    if (const sampling::MountPoint* mount = MountOf(volumes[i])) {
      space.device = mount->source;
      space.fstype = mount->fstype;
    }
    space.size = spaces[i]->size;
    space.free = spaces[i]->size - std::min(spaces[i]->used, spaces[i]->size);
    space.avail = spaces[i]->free;
  }
  out.insert(out.end(), std::make_move_iterator(objects.begin()),
             std::make_move_iterator(objects.end()));
  last_count_ = out.size();
  return out;
}

void SystemSampler::AddServices(const std::vector<std::string>& services,
                                std::vector<SeriesValue>& out) {
  const double now = measurements_.current().seconds;
  for (const std::string& name : services) {
    const std::optional<sampling::RecordedProcess> process = processes_.Find(name, measurements_);
    if (!process) continue;  // not running
    const sampling::Measured cpu =
        measurements_.Processes(process->pid, process->start_time, PERFEVENT_RESOURCE_CPU);
    const sampling::Measured memory = measurements_.Resident(process->pid, process->start_time);
    if (!cpu.reading && !memory.reading) continue;
    DisplayName& display = display_names_[name];
    if (display.text.empty() || now - display.read_at >= kDisplayNameSeconds) {
      display = DisplayName{kova::ServiceDisplayName(name), now};
    }
    // The reading's amount is 100 times the ticks the processes took in this cycle.
    uint64_t& ticks = cpu_ticks_[name];
    if (cpu.reading) ticks += static_cast<uint64_t>(std::llround(cpu.reading->amount / 100));
    const bool package = name.compare(0, kPackagePrefix.size(), kPackagePrefix) == 0;
    ServiceUsage& usage = (package ? metrics_.packages : metrics_.services).emplace_back();
    usage.name = package ? name.substr(kPackagePrefix.size()) : name;
    usage.display_name = display.text;
    usage.cpu_seconds = static_cast<double>(ticks) / static_cast<double>(metrics_.ticks_per_second);
    if (memory.reading) usage.resident_bytes = static_cast<uint64_t>(memory.reading->amount) * 1024;
    const Labels labels = {{"service", name}, {"display_name", display.text}};
    // No CPU share when no CPU time passed at all.
    if (cpu.reading && cpu.reading->base > 0) {
      AddValue(out, "service.cpu", "%", name, labels, cpu.reading->value());
    }
    if (memory.reading) {
      AddValue(out, "service.memory", "B", name, labels, memory.reading->amount * 1024);
    }
  }
}

void SystemSampler::AddLuns(std::vector<SeriesValue>& out) {
  for (const kova::Lun& lun : directory_.luns()) {
    const Labels labels = {{"lun", lun.uuid}, {"name", lun.name}};
    const sampling::Measured rate =
        sampling::MeasureLun(directory_, measurements_, lun.uuid, PERFEVENT_RESOURCE_IO_RATE);
    if (rate.reading && rate.reading->base > 0) {
      AddValue(out, "lun.io", "B/s", lun.uuid, labels, rate.reading->value() * 1024);  // KiB/s
    }
    // No latency in a second without I/O, as for disks.
    const sampling::Measured latency =
        sampling::MeasureLun(directory_, measurements_, lun.uuid, PERFEVENT_RESOURCE_IO_LATENCY);
    if (latency.reading && latency.reading->base > 0) {
      AddValue(out, "lun.latency", "ms", lun.uuid, labels, latency.reading->value());
    }
    const std::optional<std::string> volume = directory_.LunVolume(lun.uuid);
    const sampling::MountPoint* mount = volume && !volume->empty() ? MountOf(*volume) : nullptr;
    const sampling::DiskSample* disk =
        mount != nullptr ? FindDisk(measurements_.current(), mount->major, mount->minor) : nullptr;
    if (disk == nullptr) continue;
    metrics_.luns.push_back({lun.uuid, lun.name, disk->read_sectors * 512,
                             disk->write_sectors * 512, disk->ios, disk->io_ms});
  }
}

const sampling::MountPoint* SystemSampler::MountOf(const std::string& path) {
  const sampling::Snapshot& now = measurements_.current();
  return now.mounts_read ? sampling::MountHolding(now.mounts, directory_.RealPath(path)) : nullptr;
}

void SystemSampler::KeepOnly(const std::vector<std::string>& services) {
  const std::unordered_set<std::string> names(services.begin(), services.end());
  processes_.KeepOnly(names);
  std::erase_if(display_names_, [&](const auto& entry) { return !names.count(entry.first); });
  std::erase_if(cpu_ticks_, [&](const auto& entry) { return !names.count(entry.first); });
  services_ = services;
}

}  // namespace

std::unique_ptr<Sampler> MakeSystemSampler(const SamplerOptions& options) {
  return std::make_unique<SystemSampler>(options);
}

}  // namespace statd
