// What a rule store accepts, shared by the platform implementations so that
// they keep and refuse the same records.

#ifndef KOVA_PLATFORM_COMMON_RULE_RECORD_H_
#define KOVA_PLATFORM_COMMON_RULE_RECORD_H_

#include "kova/perfevent.h"

namespace kova {

// Whether `rule` is a record the store can keep: its object text ends within
// its field, `enable` is 0 or 1, `preset_a` at least 1 and `preset_b` at least
// 0. Type, object, resource, severity and threshold are kept as they come; the
// daemon skips a rule it can't measure.
bool IsStorableRule(const KOVAPERFEVENT_CONF_SETTING& rule);

// Whether two rules watch the same object and resource at the same severity,
// which the store allows only once.
bool SameRuleKey(const KOVAPERFEVENT_CONF_SETTING& a, const KOVAPERFEVENT_CONF_SETTING& b);

}  // namespace kova

#endif  // KOVA_PLATFORM_COMMON_RULE_RECORD_H_
