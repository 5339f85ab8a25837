#include "sampling/proc_text.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

namespace sampling {
namespace {

// The value in kiB of the meminfo key `key` ("MemTotal:"), 0 when absent.
uint64_t MemInfoValue(const char* text, const char* key) {
  const char* at = strstr(text, key);
  return at != nullptr ? strtoull(at + strlen(key), nullptr, 10) : 0;
}

// The lines of meminfo that MemoryDetail holds; keys are matched at the start
// of a line, so that "Cached:" is not found in "SwapCached:".
struct MemoryKey {
  const char* key;
  uint64_t MemoryDetail::*field;
};
constexpr MemoryKey kMemoryKeys[] = {
    {"Buffers:", &MemoryDetail::buffers_kib},
    {"Cached:", &MemoryDetail::cached_kib},
    {"SReclaimable:", &MemoryDetail::reclaimable_kib},
    {"SwapTotal:", &MemoryDetail::swap_total_kib},
    {"SwapFree:", &MemoryDetail::swap_free_kib},
    {nullptr, nullptr},
};

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

// The start of the line after the one at `line`, or its terminating NUL.
const char* NextLine(const char* line) {
  const char* end = strchr(line, '\n');
  return end != nullptr ? end + 1 : line + strlen(line);
}

}  // namespace

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

uint64_t ParseBootTime(const char* text) {
  for (const char* line = text; *line != '\0'; line = NextLine(line)) {
    if (strncmp(line, "btime ", 6) == 0) return strtoull(line + 6, nullptr, 10);
  }
  return 0;
}

bool ParseCpuStates(const char* text, std::vector<CpuStates>& cpus) {
  cpus.clear();
  // The cpu lines come first, the line of all CPUs ahead of the others.
  for (const char* line = text; strncmp(line, "cpu", 3) == 0; line = NextLine(line)) {
    CpuStates states;
    const char* values = line + 3;
    if (*values != ' ') {
      char* end = nullptr;
      const long number = strtol(values, &end, 10);
      if (end == values || *end != ' ' || number < 0 || number > 1 << 20) return false;
      states.cpu = static_cast<int>(number);
      values = end;
    }
    if ((states.cpu < 0) != cpus.empty()) return false;
    unsigned long long v[8] = {};
    if (sscanf(values, "%llu %llu %llu %llu %llu %llu %llu %llu", &v[0], &v[1], &v[2], &v[3], &v[4],
               &v[5], &v[6], &v[7]) < 4) {
      return false;
    }
    states.user = v[0];
    states.nice = v[1];
    states.system = v[2];
    states.idle = v[3];
    states.iowait = v[4];
    states.irq = v[5];
    states.softirq = v[6];
    states.steal = v[7];
    cpus.push_back(states);
  }
  return !cpus.empty();
}

bool ParseMemoryTotals(const char* text, uint64_t& total_kib, uint64_t& available_kib) {
  total_kib = MemInfoValue(text, "MemTotal:");
  if (total_kib == 0) return false;
  available_kib = MemInfoValue(text, "MemAvailable:");
  if (strstr(text, "MemAvailable:") == nullptr) {  // kernels before 3.14
    available_kib = MemInfoValue(text, "MemFree:") + MemInfoValue(text, "Buffers:") +
                    MemInfoValue(text, "Cached:");
  }
  return true;
}

bool ParseMemoryDetail(const char* text, MemoryDetail& detail) {
  detail = MemoryDetail{};
  bool found = false;
  for (const char* line = text; *line != '\0'; line = NextLine(line)) {
    for (const MemoryKey* row = kMemoryKeys; row->key != nullptr; ++row) {
      const size_t length = strlen(row->key);
      if (strncmp(line, row->key, length) == 0) {
        detail.*row->field = strtoull(line + length, nullptr, 10);
        found = true;
        break;
      }
    }
  }
  return found;
}

bool ParseLoadAverage(const char* text, LoadAverage& load) {
  return sscanf(text, "%lf %lf %lf", &load.one, &load.five, &load.fifteen) == 3 && load.one >= 0 &&
         load.five >= 0 && load.fifteen >= 0;
}

void ParseNetDev(const char* text, std::vector<NetSample>& interfaces) {
  interfaces.clear();
  // "  eth0: rx bytes packets errs drop fifo frame compressed multicast, tx
  // bytes packets errs drop fifo colls carrier compressed"; two heading lines.
  for (const char* line = text; *line != '\0'; line = NextLine(line)) {
    const char* end = strchr(line, '\n');
    if (end == nullptr) end = line + strlen(line);
    const char* colon = static_cast<const char*>(memchr(line, ':', end - line));
    if (colon == nullptr) continue;
    const char* name = line;
    while (name < colon && *name == ' ') ++name;
    if (name == colon) continue;
    uint64_t v[16];
    int count = 0;
    for (const char* p = colon + 1; count < 16; ++count) {
      char* stop = nullptr;
      v[count] = strtoull(p, &stop, 10);
      if (stop == p || stop > end) break;
      p = stop;
    }
    if (count < 11) continue;
    interfaces.push_back(NetSample{std::string(name, colon), v[0], v[1], v[2], v[8], v[9], v[10]});
  }
}

bool ParseDiskLine(const char* line, bool detail, DiskSample& disk) {
  char name[128];
  unsigned long long reads, read_sectors, read_ms, writes, write_sectors, write_ms, io_ticks = 0;
  const int got = sscanf(line, "%u %u %127s %llu %*u %llu %llu %llu %*u %llu %llu %*u %llu",
                         &disk.major, &disk.minor, name, &reads, &read_sectors, &read_ms, &writes,
                         &write_sectors, &write_ms, &io_ticks);
  if (got < 9) return false;
  disk.name = name;
  disk.ios = reads + writes;
  disk.sectors = read_sectors + write_sectors;
  disk.io_ms = read_ms + write_ms;
  if (detail) {
    disk.reads = reads;
    disk.read_sectors = read_sectors;
    disk.read_ms = read_ms;
    disk.writes = writes;
    disk.write_sectors = write_sectors;
    disk.write_ms = write_ms;
    disk.io_ticks = io_ticks;
  }
  return true;
}

bool ParseMountLine(std::string_view line, MountPoint& mount) {
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
  if (count < 5 ||
      sscanf(std::string(fields[2]).c_str(), "%u:%u", &mount.major, &mount.minor) != 2) {
    return false;
  }
  mount.path = Unescape(fields[4]);
  // Optional fields come next, up to a lone "-"; then the type and source.
  const size_t separator = line.find(" - ", at > 0 ? at - 1 : 0);
  if (separator != std::string_view::npos) {
    std::string_view rest = line.substr(separator + 3);
    const size_t blank = rest.find(' ');
    mount.fstype = std::string(rest.substr(0, blank));
    if (blank != std::string_view::npos) {
      rest.remove_prefix(blank + 1);
      mount.source = Unescape(rest.substr(0, rest.find(' ')));
    }
  }
  return true;
}

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

}  // namespace sampling
