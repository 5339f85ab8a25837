// The performance-event log's entries: level and plain English text of a
// rule's change.

#ifndef KOVA_DAEMONS_PERFEVENTD_EVENT_TEXT_H_
#define KOVA_DAEMONS_PERFEVENTD_EVENT_TEXT_H_

#include <cstdint>
#include <string>

#include "perfeventd/rule.h"

namespace perfeventd {

// The rule change behind an entry, for what follows the log (alerts). An
// entry read back from the waiting-events file has none: an empty rule id.
struct EventOrigin {
  std::string rule_id;
  std::string object;    // ObjectLabel of the rule
  int32_t resource = 0;  // a KOVAPERFEVENT_RESOURCE
  bool raised = false;

  bool operator==(const EventOrigin&) const = default;
};

// One entry to write into the performance-event log.
struct Event {
  int64_t time = 0;   // seconds since the epoch, when it was decided
  std::string level;  // "Warning", "Critical" or "Info"
  std::string text;
  EventOrigin origin = {};

  bool operator==(const Event&) const = default;
};

// `text` with tabs and line breaks made blanks, as the log and the state file
// take it: one line, no field separator.
std::string OneLine(std::string text);

// The resource as labels and the state file name it: "cpu", "memory",
// "io_rate", "io_latency"; "resource<N>" for one no rule can watch.
std::string ResourceLabel(int32_t resource);

// The rule's object as labels and the state file name it: "system" for a
// system rule, else `object_name` (the display name of the event text) with
// tabs and line breaks made blanks.
std::string ObjectLabel(const Rule& rule, const std::string& object_name);

// What a rule watches, as texts name it: `CPU use of service "Web server"`.
std::string RuleSubject(const Rule& rule, const std::string& object_name);

// The entry for a rule that has been above its threshold for a whole window
// (`raised`) or back at or below it for a whole window (not `raised`), with
// `average` the mean of the window's samples and `object_name` the display
// name of the rule's object. A raise is logged at the rule's severity, a
// recovery at "Info".
Event DescribeChange(const Rule& rule, const std::string& object_name, bool raised, double average,
                     int64_t time);

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_EVENT_TEXT_H_
