#include "sampling/proc_reader.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <ctime>
#include <string_view>

#include "sampling/proc_text.h"

namespace sampling {
namespace {

// Reads at most size - 1 bytes of the file `path` (relative to `dir_fd`) into
// `buffer`, NUL-terminated. The length read, or -1 when it can't be read.
// With `one_read`, for a file that the kernel hands out whole in one read (a
// process's stat), a single read is made: a quarter fewer calls per process.
ssize_t ReadSmall(int dir_fd, const char* path, char* buffer, size_t size, bool one_read = false) {
  const int fd = openat(dir_fd, path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return -1;
  size_t used = 0;
  while (used + 1 < size) {
    const ssize_t got = read(fd, buffer + used, size - 1 - used);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) {
      close(fd);
      return -1;
    }
    if (got == 0) break;
    used += static_cast<size_t>(got);
    if (one_read) break;
  }
  close(fd);
  buffer[used] = '\0';
  return static_cast<ssize_t>(used);
}

// Reads a whole file of any length; false when it can't be read.
bool ReadAll(const std::string& path, std::string& text) {
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  text.clear();
  char chunk[8192];
  for (;;) {
    const ssize_t got = read(fd, chunk, sizeof(chunk));
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) {
      close(fd);
      return got == 0;
    }
    text.append(chunk, static_cast<size_t>(got));
  }
}

double MonotonicSeconds() {
  timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

}  // namespace

ProcReader::ProcReader(std::string proc_dir, std::string sys_dir)
    : proc_(std::move(proc_dir)), sys_(std::move(sys_dir)) {}

Snapshot ProcReader::Read(const SampleNeeds& needs) const {
  Snapshot snapshot;
  snapshot.seconds = MonotonicSeconds();
  ReadStat(snapshot, needs.cpu_states);
  ReadMemory(snapshot, needs.memory_detail);
  if (needs.load) ReadLoad(snapshot);
  if (needs.processes) ReadProcesses(snapshot);
  if (needs.disks) ReadDisks(snapshot, needs.whole_disks, needs.disk_detail);
  if (needs.mounts) ReadMounts(snapshot);
  if (needs.net) ReadNet(snapshot);
  return snapshot;
}

void ProcReader::ReadStat(Snapshot& snapshot, bool cpu_states) const {
  const std::string path = proc_ + "/stat";
  CpuTimes cpu;
  if (cpu_states) {
    // The whole file: with many CPUs their lines outgrow a small buffer.
    std::string text;
    if (ReadAll(path, text) && ParseCpuLine(text.c_str(), cpu) &&
        ParseCpuStates(text.c_str(), snapshot.cpu_states)) {
      snapshot.cpu = cpu;
      snapshot.boot_time = ParseBootTime(text.c_str());
      return;
    }
    snapshot.cpu_states.clear();
  } else {
    char buffer[8192];
    if (ReadSmall(AT_FDCWD, path.c_str(), buffer, sizeof(buffer)) > 0 &&
        ParseCpuLine(buffer, cpu)) {
      snapshot.cpu = cpu;
      return;
    }
  }
  snapshot.unreadable.push_back(path);
}

void ProcReader::ReadMemory(Snapshot& snapshot, bool detail) const {
  const std::string path = proc_ + "/meminfo";
  char buffer[8192];
  if (ReadSmall(AT_FDCWD, path.c_str(), buffer, sizeof(buffer)) > 0 &&
      ParseMemoryTotals(buffer, snapshot.memory_total_kib, snapshot.memory_available_kib)) {
    MemoryDetail memory;
    if (detail && ParseMemoryDetail(buffer, memory)) snapshot.memory_detail = memory;
    return;
  }
  snapshot.memory_total_kib = 0;
  snapshot.memory_available_kib = 0;
  snapshot.unreadable.push_back(path);
}

void ProcReader::ReadLoad(Snapshot& snapshot) const {
  const std::string path = proc_ + "/loadavg";
  char buffer[256];
  LoadAverage load;
  if (ReadSmall(AT_FDCWD, path.c_str(), buffer, sizeof(buffer)) > 0 &&
      ParseLoadAverage(buffer, load)) {
    snapshot.load = load;
  } else {
    snapshot.unreadable.push_back(path);
  }
}

void ProcReader::ReadProcesses(Snapshot& snapshot) const {
  DIR* dir = opendir(proc_.c_str());
  if (dir == nullptr) {
    snapshot.unreadable.push_back(proc_);
    return;
  }
  const int fd = dirfd(dir);
  char path[64];
  char text[1024];
  while (const dirent* entry = readdir(dir)) {
    const char* name = entry->d_name;
    const size_t length = strlen(name);
    if (name[0] < '1' || name[0] > '9' || length > 20) continue;
    memcpy(path, name, length);
    memcpy(path + length, "/stat", sizeof("/stat"));
    ProcessSample sample;
    // A process that ends during the pass is simply left out.
    if (ReadSmall(fd, path, text, sizeof(text), true) > 0 && ParseProcessStat(text, sample)) {
      snapshot.processes.push_back(sample);
    }
  }
  closedir(dir);
  std::sort(snapshot.processes.begin(), snapshot.processes.end(),
            [](const ProcessSample& a, const ProcessSample& b) { return a.pid < b.pid; });
  snapshot.processes_read = true;
}

void ProcReader::ReadDisks(Snapshot& snapshot, bool whole_disks, bool detail) const {
  const std::string path = proc_ + "/diskstats";
  std::string text;
  if (!ReadAll(path, text)) {
    snapshot.unreadable.push_back(path);
    return;
  }
  const int block =
      whole_disks ? open((sys_ + "/block").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC) : -1;
  if (whole_disks && block < 0) snapshot.unreadable.push_back(sys_ + "/block");
  for (size_t start = 0; start < text.size();) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) end = text.size();
    text[end] = '\0';  // one line at a time; the terminating NUL stands for the last one's end
    DiskSample disk;
    const bool parsed = ParseDiskLine(text.c_str() + start, detail, disk);
    start = end + 1;
    if (!parsed) continue;
    if (block >= 0) {
      // /sys names a disk with '/' in its name with '!' instead; a physical
      // disk has a device behind it, a partition or a virtual device has none.
      std::string sys_name = disk.name;
      std::replace(sys_name.begin(), sys_name.end(), '/', '!');
      disk.whole_disk = faccessat(block, (sys_name + "/device").c_str(), F_OK, 0) == 0;
    }
    snapshot.disks.push_back(std::move(disk));
  }
  if (block >= 0) close(block);
  snapshot.disks_read = true;
}

void ProcReader::ReadMounts(Snapshot& snapshot) const {
  const std::string path = proc_ + "/self/mountinfo";
  std::string text;
  if (!ReadAll(path, text)) {
    snapshot.unreadable.push_back(path);
    return;
  }
  for (size_t start = 0; start < text.size();) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) end = text.size();
    MountPoint mount;
    if (ParseMountLine(std::string_view(text.data() + start, end - start), mount)) {
      snapshot.mounts.push_back(std::move(mount));
    }
    start = end + 1;
  }
  snapshot.mounts_read = true;
}

void ProcReader::ReadNet(Snapshot& snapshot) const {
  const std::string path = proc_ + "/net/dev";
  std::string text;
  if (!ReadAll(path, text)) {
    snapshot.unreadable.push_back(path);
    return;
  }
  ParseNetDev(text.c_str(), snapshot.net);
  snapshot.net_read = true;
}

}  // namespace sampling
