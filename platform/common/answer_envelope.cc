#include "common/answer_envelope.h"

namespace kova {

Json::Value SuccessEnvelope(const Json::Value& data) {
  Json::Value out;
  out["success"] = true;
  if (!data.isNull()) out["data"] = data;
  return out;
}

Json::Value ErrorEnvelope(int code, const Json::Value& errors) {
  Json::Value out;
  out["success"] = false;
  out["error"]["code"] = code;
  if (!errors.isNull()) out["error"]["errors"] = errors;
  return out;
}

}  // namespace kova
