// What kovaperfeventd publishes of itself in /run/kova/perfeventd.state: the
// events it logged per level since it started, and the rules that fire now.
// One record a line, fields separated by one tab:
//   events_total<TAB><level><TAB><count>
//   firing<TAB><rule id><TAB><object><TAB><resource>
// Other kinds of lines are left out; so are lines of a known kind not in its form.

#ifndef KOVA_DAEMONS_STATD_PERF_STATE_H_
#define KOVA_DAEMONS_STATD_PERF_STATE_H_

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace statd {

// The levels of events_total, in the order they are exported.
constexpr const char* kPerfLevels[] = {"Info", "Warning", "Critical"};

struct FiringRule {
  std::string rule;
  std::string object;    // the display name of the rule's object
  std::string resource;  // cpu, memory, io_rate or io_latency

  bool operator==(const FiringRule&) const = default;
};

struct PerfState {
  uint64_t events[3] = {0, 0, 0};  // per level of kPerfLevels
  std::vector<FiringRule> firing;

  bool operator==(const PerfState& other) const {
    return events[0] == other.events[0] && events[1] == other.events[1] &&
           events[2] == other.events[2] && firing == other.firing;
  }
};

// The state in `text`, the lines it can't take left out.
PerfState ParsePerfState(std::string_view text);

// The state in the file `path`: nullopt when there is none (the daemon isn't
// running) or it can't be read, `error` then saying why unless it is missing.
std::optional<PerfState> ReadPerfState(const std::string& path, std::string& error);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_PERF_STATE_H_
