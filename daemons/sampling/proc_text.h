// The texts of /proc files, parsed. Each function takes text as the kernel
// writes it (NUL-terminated) and fills what it holds; false when the text is
// not in the file's form, the output then being unspecified.

#ifndef KOVA_DAEMONS_SAMPLING_PROC_TEXT_H_
#define KOVA_DAEMONS_SAMPLING_PROC_TEXT_H_

#include <cstdint>
#include <string_view>
#include <vector>

#include "sampling/proc_reader.h"

namespace sampling {

// The "cpu" line, the first of stat.
bool ParseCpuLine(const char* text, CpuTimes& cpu);

// Every cpu line of stat, the line of all CPUs first; false without that one.
bool ParseCpuStates(const char* text, std::vector<CpuStates>& cpus);

// The "btime" line of stat: the boot time in Unix seconds; 0 without one.
uint64_t ParseBootTime(const char* text);

// MemTotal and MemAvailable of meminfo; before kernel 3.14, which doesn't
// write MemAvailable, MemFree + Buffers + Cached stands for it. False without
// a MemTotal.
bool ParseMemoryTotals(const char* text, uint64_t& total_kib, uint64_t& available_kib);

// The rest of meminfo; false when it holds none of those lines.
bool ParseMemoryDetail(const char* text, MemoryDetail& detail);

bool ParseLoadAverage(const char* text, LoadAverage& load);

// The interfaces of net/dev, in its order; a line not in its form is left out.
void ParseNetDev(const char* text, std::vector<NetSample>& interfaces);

// A line of diskstats; with `detail`, reads and writes apart and the busy time too.
bool ParseDiskLine(const char* line, bool detail, DiskSample& disk);

// A line of mountinfo, its mount point's and source's octal escapes (\040 for
// a blank) undone; the type and source are empty when the line lacks them.
bool ParseMountLine(std::string_view line, MountPoint& mount);

// A <pid>/stat file.
bool ParseProcessStat(const char* text, ProcessSample& sample);

}  // namespace sampling

#endif  // KOVA_DAEMONS_SAMPLING_PROC_TEXT_H_
