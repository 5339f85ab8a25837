// For tests and benchmarks: recorded /proc files written into a directory,
// and the performance-event log read back.

#ifndef KOVA_DAEMONS_PERFEVENTD_TEST_SUPPORT_H_
#define KOVA_DAEMONS_PERFEVENTD_TEST_SUPPORT_H_

#include <sys/types.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "kova/log.h"

namespace perfeventd {

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

// Installs `program` as the platform service "kovaperfeventd" in the system
// root `root` with the script install-service.sh at `script`, run with
// `options` and its system-log lines appended to the file `log`.
inline bool InstallDaemonService(const std::string& script, const std::string& root,
                                 const std::string& program, const std::string& options,
                                 const std::string& log) {
  const std::string command = script + " " + root + " /bin/sh -c \"exec " + program + " " +
                              options + " --log-stderr 2>>" + log + "\"";
  return std::system(command.c_str()) == 0;
}

// The performance-event log's records as KOVALogGet1 prints them, without
// their ids, fetched through the file `scratch`.
inline std::vector<std::string> LogLines(const std::string& scratch) {
  std::vector<std::string> lines;
  if (KOVALogGet1(kLogTypePerfEvent, scratch.c_str(), "enu") != 0) return {"(no log)"};
  std::ifstream in(scratch);
  for (std::string line; std::getline(in, line);) lines.push_back(line.substr(line.find('\t') + 1));
  return lines;
}

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_TEST_SUPPORT_H_
