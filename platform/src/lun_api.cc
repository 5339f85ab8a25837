#include "src/lun_api.h"

#include "kova/webapi.h"
#include "src/lun_registry.h"

namespace kova {
namespace {

void lun_get_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  const Json::Value uuid = request->GetParam("uuid", Json::Value());
  if (!uuid.isString() || uuid.asString().empty()) {
    return response->SetError(KOVA::kAPIErrorBadParameter, Json::Value());
  }
  Lun lun;
  const int found = FindLun(uuid.asString(), lun);
  if (found < 0) return response->SetError(KOVA::kAPIErrorUnknown, Json::Value());
  if (found > 0) {
    Json::Value data;
    data["lun"] = LunToJson(lun);
    return response->SetSuccess(data);
  }
  response->SetError(kLunErrorNotFound, Json::Value());
}

const APITableEntry kTable[] = {
    {kLunApi, 1, "get", lun_get_v1},
    {nullptr, 0, nullptr, nullptr},
};

// Registers the API when the library is loaded and removes it when unloaded.
struct Registration {
  Registration() { KOVA::APIRunner::Register(kTable, nullptr); }
  ~Registration() { KOVA::APIRunner::Unregister(kTable); }
} registration;

}  // namespace
}  // namespace kova
