// The envelope every web-API answer travels in, built once for the in-process
// call and for the host.

#ifndef KOVA_PLATFORM_COMMON_ANSWER_ENVELOPE_H_
#define KOVA_PLATFORM_COMMON_ANSWER_ENVELOPE_H_

#include <json/value.h>

#include "kova/export.h"

namespace kova {

// {"success": true, "data": DATA}, "data" left out when null.
KOVA_API Json::Value SuccessEnvelope(const Json::Value& data);

// {"success": false, "error": {"code": CODE, "errors": ERRORS}}, "errors" left out when null.
KOVA_API Json::Value ErrorEnvelope(int code, const Json::Value& errors);

}  // namespace kova

#endif  // KOVA_PLATFORM_COMMON_ANSWER_ENVELOPE_H_
