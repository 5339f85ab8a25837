#include "common/rule_record.h"

#include <cstring>

namespace kova {

bool IsStorableRule(const KOVAPERFEVENT_CONF_SETTING& rule) {
  return strnlen(rule.service, sizeof(rule.service)) < sizeof(rule.service) &&
         (rule.enable == 0 || rule.enable == 1) && rule.preset_a > 0 && rule.preset_b >= 0;
}

bool SameRuleKey(const KOVAPERFEVENT_CONF_SETTING& a, const KOVAPERFEVENT_CONF_SETTING& b) {
  return a.type == b.type && a.resource == b.resource && a.severity == b.severity &&
         strncmp(a.service, b.service, sizeof(a.service)) == 0;
}

}  // namespace kova
