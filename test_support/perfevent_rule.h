// An enabled performance-event rule record for tests, sampled every 5 s over
// 30 s.

#ifndef KOVA_TEST_SUPPORT_PERFEVENT_RULE_H_
#define KOVA_TEST_SUPPORT_PERFEVENT_RULE_H_

#include <cstdint>
#include <cstdio>

#include "kova/perfevent.h"

namespace kova_test {

inline KOVAPERFEVENT_CONF_SETTING PerfEventRule(KOVAPERFEVENT_EVENT_TYPE type, const char* object,
                                                int32_t resource, int32_t severity,
                                                int32_t threshold = 80) {
  KOVAPERFEVENT_CONF_SETTING rule{};
  rule.type = type;
  snprintf(rule.service, sizeof(rule.service), "%s", object);
  rule.resource = resource;
  rule.severity = severity;
  rule.threshold = threshold;
  rule.preset_a = 5;
  rule.preset_b = 30;
  rule.enable = 1;
  return rule;
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_PERFEVENT_RULE_H_
