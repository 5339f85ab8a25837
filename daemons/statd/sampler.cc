#include "statd/sampler.h"

#include <unistd.h>

#include <iterator>
#include <optional>
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

class SystemSampler : public Sampler {
 public:
  explicit SystemSampler(const SamplerOptions& options)
      : timeout_(options.volume_timeout),
        clock_(options.clock),
        reader_(options.proc_dir, options.sys_dir),
        measurements_(static_cast<uint64_t>(sysconf(_SC_PAGESIZE)) / 1024),
        processes_(directory_),
        volumes_(options.statvfs) {}

  std::vector<SeriesValue> Cycle() override;
  const std::vector<std::string>& Unreadable() const override { return unreadable_; }

 private:
  struct DisplayName {
    std::string text;
    double read_at = 0;  // monotonic seconds
  };

  // The services' values: CPU and resident memory of those running.
  void AddServices(const std::vector<std::string>& services, std::vector<SeriesValue>& out);
  // The LUNs' values: I/O rate and latency of the device under each one's volume.
  void AddLuns(std::vector<SeriesValue>& out);
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
  needs.mounts = !directory_.luns().empty();
  needs.disks = needs.whole_disks = needs.disk_detail = true;
  needs.cpu_states = needs.load = needs.memory_detail = needs.net = true;
  sampling::Snapshot snapshot = reader_.Read(needs);
  if (clock_) snapshot.seconds = clock_();
  measurements_.Advance(std::move(snapshot));
  unreadable_ = measurements_.current().unreadable;

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
  }
}

void SystemSampler::KeepOnly(const std::vector<std::string>& services) {
  const std::unordered_set<std::string> names(services.begin(), services.end());
  processes_.KeepOnly(names);
  std::erase_if(display_names_, [&](const auto& entry) { return !names.count(entry.first); });
  services_ = services;
}

}  // namespace

std::unique_ptr<Sampler> MakeSystemSampler(const SamplerOptions& options) {
  return std::make_unique<SystemSampler>(options);
}

}  // namespace statd
