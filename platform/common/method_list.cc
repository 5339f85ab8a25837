#include "common/method_list.h"

#include "kova/webapi.h"

namespace kova {

int FindInMethodList(const Json::Value& methods, const std::string& api, int version,
                     const std::string& method) {
  bool api_known = false;
  bool version_known = false;
  for (const Json::Value& row : methods) {
    if (row["api"].asString() != api) continue;
    api_known = true;
    if (row["version"].asInt() != version) continue;
    version_known = true;
    if (row["method"].asString() == method) return 0;
  }
  if (!api_known) return KOVA::kAPIErrorNoSuchAPI;
  return version_known ? KOVA::kAPIErrorNoSuchMethod : KOVA::kAPIErrorBadVersion;
}

}  // namespace kova
