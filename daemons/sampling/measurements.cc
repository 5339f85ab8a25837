#include "sampling/measurements.h"

#include <algorithm>

#include "kova/perfevent.h"

namespace sampling {
namespace {

constexpr char kNoCpu[] = "the CPU counters can't be read";
constexpr char kNoMemory[] = "the memory counters can't be read";
constexpr char kNoProcesses[] = "the processes can't be listed";
constexpr char kNoDisks[] = "the disk counters can't be read";

Measured Of(double amount, double base) { return Measured{Reading{amount, base}, ""}; }
Measured Problem(const char* text) { return Measured{std::nullopt, text}; }

const DiskSample* FindDisk(const Snapshot& snapshot, uint32_t major, uint32_t minor) {
  for (const DiskSample& disk : snapshot.disks) {
    if (disk.major == major && disk.minor == minor) return &disk;
  }
  return nullptr;
}

}  // namespace

Measurements::Measurements(uint64_t page_kib) : page_kib_(page_kib) {}

void Measurements::Advance(Snapshot now) {
  have_previous_ = true;
  ++passes_;
  previous_ = std::move(current_);
  current_ = std::move(now);
  const std::vector<ProcessSample>& processes = current_.processes;
  const size_t count = processes.size();
  first_child_.assign(count, -1);
  seen_.assign(count, 0);
  generation_ = 0;
  next_sibling_.assign(count, -1);
  // Children in reverse, so that each list comes out in pid order.
  for (size_t i = count; i-- > 0;) {
    const int parent = IndexOf(processes[i].ppid);
    if (parent >= 0 && static_cast<size_t>(parent) != i) {
      next_sibling_[i] = first_child_[parent];
      first_child_[parent] = static_cast<int>(i);
    }
  }
  // Both passes are sorted by pid: one merge gives each process's CPU time
  // since the pass before. A process new since then used all of its time since.
  deltas_ = previous_.processes_read && current_.processes_read;
  delta_ticks_.assign(count, 0);
  if (!deltas_) return;
  auto before = previous_.processes.begin();
  for (size_t i = 0; i < count; ++i) {
    const ProcessSample& process = processes[i];
    while (before != previous_.processes.end() && before->pid < process.pid) ++before;
    const bool same = before != previous_.processes.end() && before->pid == process.pid &&
                      before->start_time == process.start_time && before->ticks <= process.ticks;
    delta_ticks_[i] = same ? process.ticks - before->ticks : process.ticks;
  }
}

int Measurements::IndexOf(pid_t pid) const {
  const auto& processes = current_.processes;
  auto it = std::lower_bound(processes.begin(), processes.end(), pid,
                             [](const ProcessSample& p, pid_t wanted) { return p.pid < wanted; });
  return it != processes.end() && it->pid == pid ? static_cast<int>(it - processes.begin()) : -1;
}

bool Measurements::HasProcess(pid_t pid, uint64_t start_time) const {
  const int index = IndexOf(pid);
  return index >= 0 && current_.processes[index].start_time == start_time;
}

Measured Measurements::System(int32_t resource) const {
  switch (resource) {
    case PERFEVENT_RESOURCE_CPU: {
      if (!current_.cpu) return Problem(kNoCpu);
      if (!have_previous_ || !previous_.cpu) return {};
      const CpuTimes& now = *current_.cpu;
      const CpuTimes& before = *previous_.cpu;
      if (now.total < before.total || now.busy < before.busy) return {};  // counters reset
      return Of(100.0 * static_cast<double>(now.busy - before.busy),
                static_cast<double>(now.total - before.total));
    }
    case PERFEVENT_RESOURCE_MEMORY: {
      if (current_.memory_total_kib == 0) return Problem(kNoMemory);
      const uint64_t total = current_.memory_total_kib;
      const uint64_t used = total - std::min(total, current_.memory_available_kib);
      return Of(100.0 * static_cast<double>(used) / static_cast<double>(total), 1);
    }
    default: {
      if (!current_.disks_read) return Problem(kNoDisks);
      if (!have_previous_ || !previous_.disks_read) return {};
      std::vector<const DiskSample*> now;
      std::vector<const DiskSample*> before;
      for (const DiskSample& disk : current_.disks) {
        if (!disk.whole_disk) continue;
        const DiskSample* earlier = FindDisk(previous_, disk.major, disk.minor);
        if (earlier == nullptr) continue;  // a disk that just appeared counts from the next pass
        now.push_back(&disk);
        before.push_back(earlier);
      }
      if (now.empty() && std::none_of(current_.disks.begin(), current_.disks.end(),
                                      [](const DiskSample& disk) { return disk.whole_disk; })) {
        return Problem("no physical disk is found");
      }
      return Disks(now, before, resource);
    }
  }
}

int Measurements::Find(pid_t pid, uint64_t start_time, const char** problem) const {
  if (!current_.processes_read) {
    *problem = kNoProcesses;
    return -1;
  }
  const int index = IndexOf(pid);
  if (index < 0 || current_.processes[index].start_time != start_time) {
    *problem = "its process is gone";
    return -1;
  }
  return index;
}

uint64_t Measurements::SumTree(int root, bool cpu) const {
  // The process and its descendants, depth first, each once: in a broken
  // recording parents may go round in a circle.
  if (++generation_ == 0) {  // wrapped round: the marks start afresh
    std::fill(seen_.begin(), seen_.end(), 0);
    generation_ = 1;
  }
  uint64_t sum = 0;
  std::vector<int> stack = {root};
  while (!stack.empty()) {
    const int at = stack.back();
    stack.pop_back();
    if (seen_[at] == generation_) continue;
    seen_[at] = generation_;
    sum += cpu ? delta_ticks_[at] : current_.processes[at].rss_pages;
    for (int child = first_child_[at]; child >= 0; child = next_sibling_[child]) {
      stack.push_back(child);
    }
  }
  return sum;
}

Measured Measurements::Processes(pid_t pid, uint64_t start_time, int32_t resource) const {
  const char* problem = nullptr;
  const int root = Find(pid, start_time, &problem);
  if (root < 0) return Problem(problem);
  const bool cpu = resource == PERFEVENT_RESOURCE_CPU;
  if (cpu && !current_.cpu) return Problem(kNoCpu);
  if (!cpu && current_.memory_total_kib == 0) return Problem(kNoMemory);
  if (cpu && (!deltas_ || !previous_.cpu || previous_.cpu->total > current_.cpu->total)) return {};
  const uint64_t sum = SumTree(root, cpu);
  if (cpu) {
    return Of(100.0 * static_cast<double>(sum),
              static_cast<double>(current_.cpu->total - previous_.cpu->total));
  }
  return Of(
      100.0 * static_cast<double>(sum * page_kib_) / static_cast<double>(current_.memory_total_kib),
      1);
}

Measured Measurements::Resident(pid_t pid, uint64_t start_time) const {
  const char* problem = nullptr;
  const int root = Find(pid, start_time, &problem);
  if (root < 0) return Problem(problem);
  return Of(static_cast<double>(SumTree(root, false) * page_kib_), 1);
}

Measured Measurements::Device(uint32_t major, uint32_t minor, int32_t resource) const {
  if (!current_.disks_read) return Problem(kNoDisks);
  const DiskSample* now = FindDisk(current_, major, minor);
  if (now == nullptr) return Problem("its block device has no disk counters");
  const DiskSample* before = have_previous_ ? FindDisk(previous_, major, minor) : nullptr;
  if (before == nullptr) return {};
  return Disks({now}, {before}, resource);
}

Measured Measurements::Disks(const std::vector<const DiskSample*>& now,
                             const std::vector<const DiskSample*>& before, int32_t resource) const {
  uint64_t ios = 0;
  uint64_t sectors = 0;
  uint64_t io_ms = 0;
  for (size_t i = 0; i < now.size(); ++i) {
    // Counters that went back belong to a device that was replaced.
    if (now[i]->ios < before[i]->ios || now[i]->sectors < before[i]->sectors ||
        now[i]->io_ms < before[i]->io_ms) {
      return {};
    }
    ios += now[i]->ios - before[i]->ios;
    sectors += now[i]->sectors - before[i]->sectors;
    io_ms += now[i]->io_ms - before[i]->io_ms;
  }
  if (resource == PERFEVENT_RESOURCE_IO_RATE) {
    const double seconds = current_.seconds - previous_.seconds;
    return Of(static_cast<double>(sectors) / 2, seconds > 0 ? seconds : 0);
  }
  return Of(static_cast<double>(io_ms), static_cast<double>(ios));
}

}  // namespace sampling
