#include "statd/perf_state.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace statd {
namespace {

// Splits `line` at tabs into `fields`; false unless there are exactly `count`.
bool Fields(std::string_view line, std::string_view* fields, size_t count) {
  size_t found = 0;
  for (;;) {
    if (found == count) return false;
    const size_t tab = line.find('\t');
    fields[found++] = line.substr(0, tab);
    if (tab == std::string_view::npos) break;
    line.remove_prefix(tab + 1);
  }
  return found == count;
}

bool Count(std::string_view text, uint64_t& count) {
  if (text.empty() || text.size() > 19) return false;
  count = 0;
  for (char c : text) {
    if (c < '0' || c > '9') return false;
    count = count * 10 + static_cast<uint64_t>(c - '0');
  }
  return true;
}

}  // namespace

PerfState ParsePerfState(std::string_view text) {
  PerfState state;
  while (!text.empty()) {
    const size_t end = text.find('\n');
    const std::string_view line = text.substr(0, end);
    text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
    std::string_view f[4];
    if (Fields(line, f, 3) && f[0] == "events_total") {
      for (size_t level = 0; level < std::size(kPerfLevels); ++level) {
        uint64_t count = 0;
        if (f[1] == kPerfLevels[level] && Count(f[2], count)) state.events[level] = count;
      }
    } else if (Fields(line, f, 4) && f[0] == "firing" && !f[1].empty()) {
      state.firing.push_back({std::string(f[1]), std::string(f[2]), std::string(f[3])});
    }
  }
  return state;
}

std::optional<PerfState> ReadPerfState(const std::string& path, std::string& error) {
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    if (errno != ENOENT) error = "can't read " + path + ": " + strerror(errno);
    return std::nullopt;
  }
  std::string text;
  char buffer[8192];
  ssize_t got = 0;
  while ((got = read(fd, buffer, sizeof(buffer))) > 0 || (got < 0 && errno == EINTR)) {
    if (got > 0) text.append(buffer, static_cast<size_t>(got));
  }
  const int read_error = errno;
  close(fd);
  if (got < 0) {
    error = "can't read " + path + ": " + strerror(read_error);
    return std::nullopt;
  }
  return ParsePerfState(text);
}

}  // namespace statd
