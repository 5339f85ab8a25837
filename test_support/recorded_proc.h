// For tests and benchmarks: recorded /proc and /sys files written into a
// directory, one file at a time or as a whole machine under a system root.

#ifndef KOVA_TEST_SUPPORT_RECORDED_PROC_H_
#define KOVA_TEST_SUPPORT_RECORDED_PROC_H_

#include <sys/types.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "sampling/proc_reader.h"

namespace kova_test {

struct FakeProcess {
  pid_t pid = 0;
  pid_t ppid = 1;
  uint64_t start_time = 100;
  uint64_t ticks = 0;  // written as user time, with system time 0
  uint64_t rss_pages = 0;
  std::string name = "worker";
};

inline void WriteFile(const std::string& path, const std::string& content) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path, std::ios::trunc) << content;
}

// <dir>/<pid>/stat as the kernel writes it.
inline void WriteProcess(const std::string& dir, const FakeProcess& p) {
  WriteFile(dir + "/" + std::to_string(p.pid) + "/stat",
            std::to_string(p.pid) + " (" + p.name + ") S " + std::to_string(p.ppid) +
                " 7 7 0 -1 4194560 1200 0 3 0 " + std::to_string(p.ticks) + " 0 0 0 20 0 1 0 " +
                std::to_string(p.start_time) + " 123456789 " + std::to_string(p.rss_pages) +
                " 18446744073709551615 1 1 0 0 0 0 0\n");
}

// <dir>/stat with `busy` of `total` ticks busy, and <dir>/meminfo.
inline void WriteSystem(const std::string& dir, uint64_t busy, uint64_t total,
                        uint64_t memory_total_kib, uint64_t memory_available_kib) {
  const uint64_t idle = total - busy;
  WriteFile(dir + "/stat", "cpu  " + std::to_string(busy) + " 0 0 " + std::to_string(idle) +
                               " 0 0 0 0 0 0\ncpu0 0 0 0 0 0 0 0 0 0 0\nintr 1 2 3\n");
  WriteFile(dir + "/meminfo", "MemTotal:       " + std::to_string(memory_total_kib) +
                                  " kB\nMemFree:          1000 kB\nMemAvailable:   " +
                                  std::to_string(memory_available_kib) + " kB\n");
}

// A cpu line of stat: clock ticks of one CPU, or of all (`cpu` -1), in each
// state, as the reader gives them back.
using FakeCpu = sampling::CpuStates;

// <dir>/stat with these cpu lines, in their order, and the lines that follow them.
inline void WriteCpuStat(const std::string& dir, const std::vector<FakeCpu>& cpus) {
  std::string text;
  for (const FakeCpu& c : cpus) {
    text += "cpu";
    text += c.cpu < 0 ? std::string(" ") : std::to_string(c.cpu);
    for (uint64_t ticks : {c.user, c.nice, c.system, c.idle, c.iowait, c.irq, c.softirq, c.steal}) {
      text.append(" ").append(std::to_string(ticks));
    }
    text += " 0 0\n";
  }
  WriteFile(dir + "/stat", text + "intr 1 2 3\nctxt 100\nbtime 1700000000\nprocesses 500\n");
}

// Memory as meminfo says it, in KiB.
struct FakeMemory {
  uint64_t total = 0;
  uint64_t free = 0;
  uint64_t available = 0;
  uint64_t buffers = 0;
  uint64_t cached = 0;
  uint64_t reclaimable = 0;
  uint64_t swap_total = 0;
  uint64_t swap_free = 0;
};

// <dir>/meminfo in the kernel's order, with lines the sampler must not take
// for the ones it reads (SwapCached beside Cached, SUnreclaim beside SReclaimable).
inline void WriteMemInfo(const std::string& dir, const FakeMemory& m) {
  const auto line = [](const char* key, uint64_t kib) {
    char text[64];
    snprintf(text, sizeof(text), "%-16s%8llu kB\n", key, static_cast<unsigned long long>(kib));
    return std::string(text);
  };
  WriteFile(dir + "/meminfo", line("MemTotal:", m.total) + line("MemFree:", m.free) +
                                  line("MemAvailable:", m.available) + line("Buffers:", m.buffers) +
                                  line("Cached:", m.cached) + line("SwapCached:", 999) +
                                  line("Active:", 1234) + line("SwapTotal:", m.swap_total) +
                                  line("SwapFree:", m.swap_free) + line("Slab:", 5000) +
                                  line("SReclaimable:", m.reclaimable) + line("SUnreclaim:", 777));
}

inline void WriteLoadAvg(const std::string& dir, double one, double five, double fifteen) {
  char text[96];
  snprintf(text, sizeof(text), "%.2f %.2f %.2f 2/345 6789\n", one, five, fifteen);
  WriteFile(dir + "/loadavg", text);
}

// A network interface's counters, as the reader gives them back.
using FakeInterface = sampling::NetSample;

// <dir>/net/dev with these interfaces, as the kernel writes it.
inline void WriteNetDev(const std::string& dir, const std::vector<FakeInterface>& interfaces) {
  std::string text =
      "Inter-|   Receive                                                |  Transmit\n"
      " face |bytes    packets errs drop fifo frame compressed multicast|bytes    packets errs "
      "drop fifo colls carrier compressed\n";
  for (const FakeInterface& i : interfaces) {
    char line[512];
    snprintf(
        line, sizeof(line),
        "%6s: %7llu %7llu %4llu    0    0     0          0         0 %8llu %7llu %4llu    0"
        "    0     0       0          0\n",
        i.name.c_str(), static_cast<unsigned long long>(i.rx_bytes),
        static_cast<unsigned long long>(i.rx_packets), static_cast<unsigned long long>(i.rx_errors),
        static_cast<unsigned long long>(i.tx_bytes), static_cast<unsigned long long>(i.tx_packets),
        static_cast<unsigned long long>(i.tx_errors));
    text += line;
  }
  WriteFile(dir + "/net/dev", text);
}

// A block device's counters; a physical one has a device under /sys/block.
struct FakeDisk {
  uint32_t major = 8;
  uint32_t minor = 0;
  std::string name;
  uint64_t reads = 0;
  uint64_t read_sectors = 0;
  uint64_t read_ms = 0;
  uint64_t writes = 0;
  uint64_t write_sectors = 0;
  uint64_t write_ms = 0;
  uint64_t io_ticks = 0;
  bool physical = true;
};

// <proc>/diskstats with these devices, and <sys>/block/<name>/device of the
// physical ones.
inline void WriteDiskStats(const std::string& proc, const std::string& sys,
                           const std::vector<FakeDisk>& disks) {
  std::string text;
  for (const FakeDisk& d : disks) {
    char line[512];
    snprintf(
        line, sizeof(line), "%4u %7u %s %llu 0 %llu %llu %llu 0 %llu %llu 0 %llu %llu 0 0 0 0\n",
        d.major, d.minor, d.name.c_str(), static_cast<unsigned long long>(d.reads),
        static_cast<unsigned long long>(d.read_sectors), static_cast<unsigned long long>(d.read_ms),
        static_cast<unsigned long long>(d.writes), static_cast<unsigned long long>(d.write_sectors),
        static_cast<unsigned long long>(d.write_ms), static_cast<unsigned long long>(d.io_ticks),
        static_cast<unsigned long long>(d.read_ms + d.write_ms));
    text += line;
    if (d.physical) std::filesystem::create_directories(sys + "/block/" + d.name + "/device");
  }
  WriteFile(proc + "/diskstats", text);
}

// The shape of a whole recorded machine (WriteRecordedMachine).
struct RecordedMachine {
  int cpus = 16;
  int disks = 8;         // physical, sda, sdb...; each with a partition
  int interfaces = 4;    // eth0...; besides lo
  int services = 100;    // every other one a package's; each a process with a child
  int processes = 1000;  // in all, the services' included
  int volumes = 2;       // /volume1...; volume N mounted from the Nth disk's partition
  int luns = 4;          // lun-0...; on the volumes in turn

  // The series kovastatd keeps of such a machine once its counters grow: CPU
  // (all and each), load, memory, interfaces, disks, volumes, services, LUNs.
  size_t Series() const {
    return static_cast<size_t>(5 * (cpus + 1) + 3 + 5 + 6 * interfaces + 6 * disks + 3 * volumes +
                               2 * services + 2 * luns);
  }
};

// The counters of `shape` after `pass` seconds: stat, diskstats and net/dev
// under <root>/proc (and /sys/block), every counter grown since the pass before.
inline void WriteMachineCounters(const std::string& root, const RecordedMachine& shape,
                                 uint64_t pass) {
  const std::string proc = root + "/proc";
  std::vector<FakeCpu> cpus;
  const uint64_t n = static_cast<uint64_t>(shape.cpus);
  cpus.push_back({-1, 30 * n * pass, n * pass, 10 * n * pass, 55 * n * pass, 2 * n * pass, n * pass,
                  n * pass, 0});
  for (int i = 0; i < shape.cpus; ++i) {
    cpus.push_back({i, 30 * pass, pass, 10 * pass, 55 * pass, 2 * pass, pass, pass, 0});
  }
  WriteCpuStat(proc, cpus);
  std::vector<FakeDisk> disks;
  for (int i = 0; i < shape.disks; ++i) {
    const std::string name = std::string("sd") + static_cast<char>('a' + i % 26) +
                             (i >= 26 ? std::to_string(i / 26) : "");
    const uint32_t minor = static_cast<uint32_t>(16 * i);
    disks.push_back({8, minor, name, 100 * pass, 800 * pass, 300 * pass, 50 * pass, 400 * pass,
                     200 * pass, 400 * pass, true});
    disks.push_back({8, minor + 1, name + "1", 90 * pass, 700 * pass, 250 * pass, 40 * pass,
                     300 * pass, 150 * pass, 350 * pass, false});
  }
  WriteDiskStats(proc, root + "/sys", disks);
  std::vector<FakeInterface> interfaces = {
      {"lo", 5000 * pass, 50 * pass, 0, 5000 * pass, 50 * pass, 0}};
  for (int i = 0; i < shape.interfaces; ++i) {
    interfaces.push_back({std::string("eth").append(std::to_string(i)), 125000 * pass, 100 * pass,
                          0, 62500 * pass, 80 * pass, 0});
  }
  WriteNetDev(proc, interfaces);
}

// Writes a whole machine of `shape` under the system root `root`: its
// counters (WriteMachineCounters, pass 1), meminfo, loadavg, mountinfo, the
// processes, the services' descriptions, packages and records, the volumes
// and the LUN registry.
inline void WriteRecordedMachine(const std::string& root, const RecordedMachine& shape) {
  const std::string proc = root + "/proc";
  WriteMachineCounters(root, shape, 1);
  WriteMemInfo(proc, {16000000, 2000000, 9000000, 500000, 6000000, 400000, 4000000, 3000000});
  WriteLoadAvg(proc, 0.5, 0.75, 1.25);
  std::string mounts = "22 1 8:1 / / rw - ext4 /dev/sda1 rw\n";
  for (int i = 1; i <= shape.volumes; ++i) {
    const int disk = (i - 1) % (shape.disks > 0 ? shape.disks : 1);
    mounts += std::to_string(40 + i) + " 22 8:" + std::to_string(16 * disk + 1) + " / " + root +
              "/volume" + std::to_string(i) + " rw - ext4 /dev/sdx1 rw\n";
    std::filesystem::create_directories(root + "/volume" + std::to_string(i));
  }
  WriteFile(proc + "/self/mountinfo", mounts);
  pid_t pid = 1000;
  for (int i = 0; i < shape.services; ++i, pid += 2) {
    const std::string id = std::to_string(i);
    std::string name = "svc-" + id;
    if (i % 2 == 1) {
      name = "pkgctl-Package" + id;
      WriteFile(root + "/var/packages/Package" + id + "/INFO",
                "displayname=\"Package " + id + "\"\n");
    } else {
      WriteFile(root + "/etc/kova/services/" + name + ".conf",
                "command=\"/usr/bin/svc\"\ndisplay_name=\"Service " + id + "\"\n");
    }
    WriteProcess(proc, {pid, 1, 5000u + i, 100u + i, 2000, "svc"});
    WriteProcess(proc, {pid + 1, pid, 6000u + i, 50, 1000, "svc-child"});
    WriteFile(root + "/run/kova/" + name + ".pid",
              std::to_string(pid) + " " + std::to_string(5000 + i) + "\n");
  }
  for (int i = 2 * shape.services; i < shape.processes; ++i, ++pid) {
    WriteProcess(proc, {pid, 1, 7000, static_cast<uint64_t>(i), 300, "other"});
  }
  std::string luns = "{\"luns\": [";
  for (int i = 0; i < shape.luns; ++i) {
    luns += std::string(i > 0 ? ", " : "") + "{\"uuid\": \"lun-" + std::to_string(i) +
            "\", \"name\": \"LUN " + std::to_string(i) + "\", \"size_mb\": 1024" +
            ", \"location\": \"/volume" +
            std::to_string(1 + i % (shape.volumes > 0 ? shape.volumes : 1)) + "\"}";
  }
  WriteFile(root + "/etc/kova/iscsi/luns.json", luns + "]}\n");
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_RECORDED_PROC_H_
