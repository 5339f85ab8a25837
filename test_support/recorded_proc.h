// For tests and benchmarks: recorded /proc files written into a directory.

#ifndef KOVA_TEST_SUPPORT_RECORDED_PROC_H_
#define KOVA_TEST_SUPPORT_RECORDED_PROC_H_

#include <sys/types.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

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

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_RECORDED_PROC_H_
