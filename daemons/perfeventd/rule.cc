#include "perfeventd/rule.h"

#include "kova/perfevent.h"

namespace perfeventd {

std::string RuleProblem(const Rule& rule) {
  const bool usage =
      rule.resource == PERFEVENT_RESOURCE_CPU || rule.resource == PERFEVENT_RESOURCE_MEMORY;
  const bool io =
      rule.resource == PERFEVENT_RESOURCE_IO_RATE || rule.resource == PERFEVENT_RESOURCE_IO_LATENCY;
  if (!usage && !io) return "unknown resource " + std::to_string(rule.resource);
  switch (rule.type) {
    case PERFEVENT_TYPE_SYSTEM:
      break;
    case PERFEVENT_TYPE_SERVICE:
      if (!usage) return "a service's rule can watch only CPU or memory";
      if (rule.object.empty()) return "a service's rule needs the service's name";
      break;
    case PERFEVENT_TYPE_ISCSI_LUN:
      if (!io) return "a LUN's rule can watch only I/O rate or latency";
      if (rule.object.empty()) return "a LUN's rule needs the LUN's uuid";
      break;
    default:
      return "unknown object type " + std::to_string(rule.type);
  }
  if (rule.severity != PERFEVENT_SEVERITY_WARNING && rule.severity != PERFEVENT_SEVERITY_CRITICAL) {
    return "unknown severity " + std::to_string(rule.severity);
  }
  if (rule.period < 1) return "sampling period below one second";
  return "";
}

int SamplesPerWindow(const Rule& rule) {
  if (rule.period < 1 || rule.duration <= rule.period) return 1;
  return static_cast<int>((int64_t{rule.duration} + rule.period - 1) / rule.period);
}

int64_t WindowSeconds(const Rule& rule) {
  return int64_t{SamplesPerWindow(rule)} * (rule.period < 1 ? 1 : rule.period);
}

}  // namespace perfeventd
