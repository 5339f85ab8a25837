// A rule as the daemon evaluates it: the fields of a stored rule record that
// decide what is measured and when an event is raised.

#ifndef KOVA_DAEMONS_PERFEVENTD_RULE_H_
#define KOVA_DAEMONS_PERFEVENTD_RULE_H_

#include <cstdint>
#include <string>

namespace perfeventd {

struct Rule {
  std::string id;
  int32_t type = 0;       // a KOVAPERFEVENT_EVENT_TYPE
  std::string object;     // service name, LUN uuid or free text
  int32_t resource = 0;   // a KOVAPERFEVENT_RESOURCE
  int32_t severity = 0;   // a KOVAPERFEVENT_SEVERITY
  int32_t threshold = 0;  // in the resource's unit
  int32_t period = 5;     // seconds between two samples
  int32_t duration = 30;  // seconds the resource must stay above the threshold

  bool operator==(const Rule&) const = default;
};

// Why the daemon can't evaluate `rule` whatever the system's state (an unknown
// type, resource or severity, a resource that doesn't fit the type, a service
// or LUN rule without its object, a period below one second); empty when it can.
std::string RuleProblem(const Rule& rule);

// How many samples in a row make a window: enough to cover the duration, at
// least one.
int SamplesPerWindow(const Rule& rule);

// The seconds that a window covers: SamplesPerWindow periods.
int64_t WindowSeconds(const Rule& rule);

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_RULE_H_
