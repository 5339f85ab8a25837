#include "sampling/proc_reader.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string_view>

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

// The "cpu" line: user nice system idle iowait irq softirq steal; guest time is
// part of user time already.
bool ParseCpuLine(const char* text, CpuTimes& cpu) {
  unsigned long long v[8] = {};
  if (strncmp(text, "cpu ", 4) != 0) return false;
  const int got = sscanf(text + 4, "%llu %llu %llu %llu %llu %llu %llu %llu", &v[0], &v[1], &v[2],
                         &v[3], &v[4], &v[5], &v[6], &v[7]);
  if (got < 4) return false;
  cpu.total = 0;
  for (unsigned long long value : v) cpu.total += value;
  cpu.busy = cpu.total - v[3] - v[4];
  return true;
}

// The value in kiB of the meminfo key `key` ("MemTotal:"), 0 when absent.
uint64_t MemInfoValue(const char* text, const char* key) {
  const char* at = strstr(text, key);
  return at != nullptr ? strtoull(at + strlen(key), nullptr, 10) : 0;
}

// A mount point of mountinfo with its octal escapes (\040 for a blank) undone.
std::string Unescape(std::string_view text) {
  std::string out;
  for (size_t i = 0; i < text.size(); ++i) {
    const auto octal = [&](size_t at) { return text[at] >= '0' && text[at] <= '7'; };
    if (text[i] == '\\' && i + 3 < text.size() && text[i + 1] <= '3' && octal(i + 1) &&
        octal(i + 2) && octal(i + 3)) {
      out += static_cast<char>((text[i + 1] - '0') * 64 + (text[i + 2] - '0') * 8 +
                               (text[i + 3] - '0'));
      i += 3;
    } else {
      out += text[i];
    }
  }
  return out;
}

double MonotonicSeconds() {
  timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

}  // namespace

bool ParseProcessStat(const char* text, ProcessSample& sample) {
  // The command name may hold blanks and parentheses; the fields after it don't.
  const char* p = strrchr(text, ')');
  if (p == nullptr) return false;
  char* end = nullptr;
  sample.pid = static_cast<pid_t>(strtol(text, &end, 10));
  if (end == text || sample.pid <= 0) return false;
  ++p;
  // Fields from the 3rd (state) on; the wanted ones are 4, 14, 15, 22 and 24.
  for (int field = 3; field <= 24; ++field) {
    while (*p == ' ') ++p;
    if (*p == '\0' || *p == '\n') return false;
    if (field == 4 || field == 14 || field == 15 || field == 22 || field == 24) {
      const long long value = strtoll(p, &end, 10);
      if (end == p) return false;
      switch (field) {
        case 4:
          sample.ppid = static_cast<pid_t>(value);
          break;
        case 14:
          sample.ticks = static_cast<uint64_t>(value);
          break;
        case 15:
          sample.ticks += static_cast<uint64_t>(value);
          break;
        case 22:
          sample.start_time = static_cast<uint64_t>(value);
          break;
        default:
          sample.rss_pages = value > 0 ? static_cast<uint64_t>(value) : 0;
          break;
      }
      p = end;
    } else {
      while (*p != ' ' && *p != '\0') ++p;
    }
  }
  return true;
}

ProcReader::ProcReader(std::string proc_dir, std::string sys_dir)
    : proc_(std::move(proc_dir)), sys_(std::move(sys_dir)) {}

Snapshot ProcReader::Read(const SampleNeeds& needs) const {
  Snapshot snapshot;
  snapshot.seconds = MonotonicSeconds();
  char buffer[8192];
  const std::string stat = proc_ + "/stat";
  CpuTimes cpu;
  if (ReadSmall(AT_FDCWD, stat.c_str(), buffer, sizeof(buffer)) > 0 && ParseCpuLine(buffer, cpu)) {
    snapshot.cpu = cpu;
  } else {
    snapshot.unreadable.push_back(stat);
  }
  const std::string meminfo = proc_ + "/meminfo";
  if (ReadSmall(AT_FDCWD, meminfo.c_str(), buffer, sizeof(buffer)) > 0 &&
      (snapshot.memory_total_kib = MemInfoValue(buffer, "MemTotal:")) > 0) {
    snapshot.memory_available_kib = MemInfoValue(buffer, "MemAvailable:");
    if (strstr(buffer, "MemAvailable:") == nullptr) {  // kernels before 3.14
      snapshot.memory_available_kib = MemInfoValue(buffer, "MemFree:") +
                                      MemInfoValue(buffer, "Buffers:") +
                                      MemInfoValue(buffer, "Cached:");
    }
  } else {
    snapshot.memory_total_kib = 0;
    snapshot.unreadable.push_back(meminfo);
  }
  if (needs.processes) ReadProcesses(snapshot);
  if (needs.disks) ReadDisks(snapshot, needs.whole_disks);
  if (needs.mounts) ReadMounts(snapshot);
  return snapshot;
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

void ProcReader::ReadDisks(Snapshot& snapshot, bool whole_disks) const {
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
    const std::string line = text.substr(start, end - start);
    start = end + 1;
    DiskSample disk;
    char name[128];
    unsigned long long reads, read_sectors, read_ms, writes, write_sectors, write_ms;
    if (sscanf(line.c_str(), "%u %u %127s %llu %*u %llu %llu %llu %*u %llu %llu", &disk.major,
               &disk.minor, name, &reads, &read_sectors, &read_ms, &writes, &write_sectors,
               &write_ms) != 9) {
      continue;
    }
    disk.name = name;
    disk.ios = reads + writes;
    disk.sectors = read_sectors + write_sectors;
    disk.io_ms = read_ms + write_ms;
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
    std::string_view line(text.data() + start, end - start);
    start = end + 1;
    // id parent major:minor root mount-point ...
    std::string_view fields[5];
    size_t at = 0;
    int count = 0;
    while (count < 5 && at < line.size()) {
      size_t blank = line.find(' ', at);
      if (blank == std::string_view::npos) blank = line.size();
      fields[count++] = line.substr(at, blank - at);
      at = blank + 1;
    }
    MountPoint mount;
    if (count < 5 ||
        sscanf(std::string(fields[2]).c_str(), "%u:%u", &mount.major, &mount.minor) != 2) {
      continue;
    }
    mount.path = Unescape(fields[4]);
    snapshot.mounts.push_back(std::move(mount));
  }
  snapshot.mounts_read = true;
}

}  // namespace sampling
