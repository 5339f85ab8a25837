#include "perfeventd/event_text.h"

#include <cstdio>

#include "kova/log.h"
#include "kova/perfevent.h"

namespace perfeventd {
namespace {

// A resource no rule can watch is named by its number, as the store holds it.
std::string ResourceName(int32_t resource) {
  switch (resource) {
    case PERFEVENT_RESOURCE_CPU:
      return "CPU use";
    case PERFEVENT_RESOURCE_MEMORY:
      return "Memory use";
    case PERFEVENT_RESOURCE_IO_RATE:
      return "I/O rate";
    case PERFEVENT_RESOURCE_IO_LATENCY:
      return "I/O latency";
    default:
      return "resource " + std::to_string(resource);
  }
}

// The unit as it follows a number: "80%", "5000 KiB/s", "20 ms".
const char* Unit(int32_t resource) {
  switch (resource) {
    case PERFEVENT_RESOURCE_CPU:
    case PERFEVENT_RESOURCE_MEMORY:
      return "%";
    case PERFEVENT_RESOURCE_IO_RATE:
      return " KiB/s";
    default:
      return " ms";
  }
}

std::string ObjectPhrase(const Rule& rule, const std::string& name) {
  switch (rule.type) {
    case PERFEVENT_TYPE_SERVICE:
      return "service \"" + name + "\"";
    case PERFEVENT_TYPE_ISCSI_LUN:
      return "LUN \"" + name + "\"";
    case PERFEVENT_TYPE_SYSTEM:
      return name.empty() ? "the system" : "the system \"" + name + "\"";
    default:
      return "object \"" + name + "\" of type " + std::to_string(rule.type);
  }
}

}  // namespace

std::string ResourceLabel(int32_t resource) {
  switch (resource) {
    case PERFEVENT_RESOURCE_CPU:
      return "cpu";
    case PERFEVENT_RESOURCE_MEMORY:
      return "memory";
    case PERFEVENT_RESOURCE_IO_RATE:
      return "io_rate";
    case PERFEVENT_RESOURCE_IO_LATENCY:
      return "io_latency";
    default:
      return "resource" + std::to_string(resource);
  }
}

std::string OneLine(std::string text) {
  for (char& c : text) {
    if (c == '\t' || c == '\n' || c == '\r') c = ' ';
  }
  return text;
}

std::string ObjectLabel(const Rule& rule, const std::string& object_name) {
  return rule.type == PERFEVENT_TYPE_SYSTEM ? "system" : OneLine(object_name);
}

std::string RuleSubject(const Rule& rule, const std::string& object_name) {
  return ResourceName(rule.resource) + " of " + ObjectPhrase(rule, object_name);
}

Event DescribeChange(const Rule& rule, const std::string& object_name, bool raised, double average,
                     int64_t time) {
  const int64_t seconds = WindowSeconds(rule);
  const char* unit = Unit(rule.resource);
  char tail[160];
  snprintf(tail, sizeof(tail), " %d%s for %lld second%s (average %.1f%s).", rule.threshold, unit,
           static_cast<long long>(seconds), seconds == 1 ? "" : "s", average, unit);
  Event event;
  event.time = time;
  event.text = RuleSubject(rule, object_name) +
               (raised ? " has been above" : " has been back at or below") + tail;
  if (!raised) {
    event.level = kLogLevelInfo;
  } else {
    event.level =
        rule.severity == PERFEVENT_SEVERITY_CRITICAL ? kLogLevelCritical : kLogLevelWarning;
  }
  return event;
}

}  // namespace perfeventd
