// The errors of "KOVA.ResourceMonitor.Usage" and the answers that carry them.
//
// Every error but a refused parameter answers
// {"err_msg": TEXT, "err_session": "usage", "err_key": KEY}, TEXT being the
// key's text in the system's language, plus "reason", the statistics service's
// own English message, when it gave one.

#ifndef USAGE_API_USAGE_ERROR_H_
#define USAGE_API_USAGE_ERROR_H_

#include <string>

#include "kova/webapi.h"

enum UsageError : int {
  kUsageCollectorUnavailable = 6201,  // the collector isn't running, or its reply is no answer
  kUsageHistoryOff = 6202,            // the collector keeps no history
  kUsageDatabaseUnavailable = 6203,   // the collector can't reach the history database
  kUsageCollectorFailed = 6204,       // the collector refused or failed the request
};

// The module's error for an error code of the statistics service, such as
// "history_off"; kUsageCollectorFailed for a code it doesn't name.
UsageError ErrorOfServiceCode(const std::string& service_code);

// Answers the call with `error` and its members; "reason" is added when
// `reason` is not empty.
void AnswerUsageError(KOVA::APIResponse* response, UsageError error, const std::string& reason);

// Answers the call with 101 and {"param": param}, the parameter refused.
void AnswerRefusedParam(KOVA::APIResponse* response, const std::string& param);

#endif  // USAGE_API_USAGE_ERROR_H_
