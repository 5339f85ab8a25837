#include "host/access_log.h"

#include <time.h>
#include <unistd.h>

#include <cstdio>

namespace kova_host {
namespace {

std::string Clean(const std::string& text) {
  if (text.empty()) return "-";
  std::string out;
  for (char c : text.substr(0, 128)) {
    out += static_cast<unsigned char>(c) <= ' ' || c == 0x7f ? '?' : c;
  }
  return out;
}

}  // namespace

AccessRecord& CurrentAccess() {
  thread_local AccessRecord record;
  return record;
}

std::string AccessLine(const std::string& remote, const std::string& http_method,
                       const std::string& path, int status, const AccessRecord& record,
                       std::chrono::steady_clock::time_point end) {
  char stamp[32];
  const time_t now = time(nullptr);
  tm utc{};
  gmtime_r(&now, &utc);
  strftime(stamp, sizeof(stamp), "%Y-%m-%dT%H:%M:%SZ", &utc);
  std::string line = std::string(stamp) + " " + Clean(remote) + " " + Clean(http_method) + " " +
                     Clean(path) + " " + std::to_string(status) + " api=" + Clean(record.api) +
                     " method=" + Clean(record.method) + " user=" + Clean(record.user) +
                     " code=" + (record.code < 0 ? "-" : std::to_string(record.code));
  if (record.start != std::chrono::steady_clock::time_point{}) {
    char ms[32];
    snprintf(ms, sizeof(ms), " ms=%.3f",
             std::chrono::duration<double, std::milli>(end - record.start).count());
    line += ms;
  }
  return line;
}

void LogAccess(const std::string& remote, const std::string& http_method, const std::string& path,
               int status) {
  AccessRecord& record = CurrentAccess();
  const std::string line =
      AccessLine(remote, http_method, path, status, record, std::chrono::steady_clock::now()) +
      "\n";
  [[maybe_unused]] const ssize_t ignored = write(STDERR_FILENO, line.data(), line.size());
  record = AccessRecord();
}

}  // namespace kova_host
