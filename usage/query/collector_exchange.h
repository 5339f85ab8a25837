// One exchange with kovastatd, the statistics collector, and the answer made
// of its reply.

#ifndef USAGE_QUERY_COLLECTOR_EXCHANGE_H_
#define USAGE_QUERY_COLLECTOR_EXCHANGE_H_

#include <json/value.h>

#include "kova/webapi.h"

// Sends `request` to the collector of this machine and answers the call with
// the reply's "data", unchanged (null when the reply has none). On failure
// answers the module's error: 6201 when the collector can't be reached, sends
// no reply, or replies with anything but an object with a boolean "success";
// for {"success": false}, the error that the reply's "error"."code" maps onto
// (6204 when it has none), with "error"."message" as the reason when it is text.
void AnswerFromCollector(const Json::Value& request, KOVA::APIResponse* response);

#endif  // USAGE_QUERY_COLLECTOR_EXCHANGE_H_
