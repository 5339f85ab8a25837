#include "host/access_log.h"

#include <time.h>
#include <unistd.h>

#include <cstdio>

namespace kova_host {
namespace {

constexpr size_t kMaxField = 128;

std::string Clean(const std::string& text) {
  if (text.empty()) return "-";
  std::string out;
  for (size_t i = 0; i < text.size() && i < kMaxField; ++i) {
    const auto c = static_cast<unsigned char>(text[i]);
    if (c > ' ' && c < 0x7f && c != '"' && c != '\\') {
      out += static_cast<char>(c);
    } else {
      char escaped[5];
      snprintf(escaped, sizeof(escaped), "\\x%02X", c);
      out += escaped;
    }
  }
  return out;
}

}  // namespace

std::string AccessLine(const std::string& remote, const std::string& http_method,
                       const std::string& path, int status, const AccessRecord& record,
                       std::chrono::steady_clock::duration took) {
  char stamp[32];
  const time_t now = time(nullptr);
  tm utc{};
  gmtime_r(&now, &utc);
  strftime(stamp, sizeof(stamp), "%Y-%m-%dT%H:%M:%SZ", &utc);
  char ms[32];
  snprintf(ms, sizeof(ms), " ms=%.3f", std::chrono::duration<double, std::milli>(took).count());
  return std::string(stamp) + " " + Clean(remote) + " " + Clean(http_method) + " " + Clean(path) +
         " " + std::to_string(status) + " api=" + Clean(record.api) +
         " method=" + Clean(record.method) + " user=" + Clean(record.user) +
         " code=" + (record.code < 0 ? "-" : std::to_string(record.code)) + ms;
}

void LogAccess(const std::string& remote, const std::string& http_method, const std::string& path,
               int status, const AccessRecord& record, std::chrono::steady_clock::duration took) {
  const std::string line = AccessLine(remote, http_method, path, status, record, took) + "\n";
  [[maybe_unused]] const ssize_t ignored = write(STDERR_FILENO, line.data(), line.size());
}

}  // namespace kova_host
