// Which part of a web-API method is missing from a list of methods, decided
// once for the in-process call and for the host's front-end.

#ifndef KOVA_PLATFORM_COMMON_METHOD_LIST_H_
#define KOVA_PLATFORM_COMMON_METHOD_LIST_H_

#include <json/value.h>

#include <string>

#include "kova/export.h"

namespace kova {

// 0 when (api, version, method) is in `methods`, a list of {"api", "version",
// "method"} as APIRunner::List gives; otherwise the host error of what is
// missing first: the API (102), its version (104) or the method (103).
KOVA_API int FindInMethodList(const Json::Value& methods, const std::string& api, int version,
                              const std::string& method);

}  // namespace kova

#endif  // KOVA_PLATFORM_COMMON_METHOD_LIST_H_
