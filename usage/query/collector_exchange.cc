#include "query/collector_exchange.h"

#include <string>

#include "api/usage_error.h"
#include "kova/transmitor.h"

namespace {

// The member `name` of `object` when it is text, else empty.
std::string TextMember(const Json::Value& object, const char* name) {
  if (!object.isObject()) return std::string();
  const Json::Value& member = object[name];
  return member.isString() ? member.asString() : std::string();
}

}  // namespace

void AnswerFromCollector(const Json::Value& request, KOVA::APIResponse* response) {
  Transmitor transmitor("localhost");
  Json::Value reply;
  const bool answered = transmitor.Transmit(request) >= 0 && transmitor.GetDataJson(reply) >= 0;
  const Json::Value& answer = reply;  // read only: a member looked up is never added
  if (!answered || !answer.isObject() || !answer["success"].isBool()) {
    return AnswerUsageError(response, kUsageCollectorUnavailable, std::string());
  }
  if (!answer["success"].asBool()) {
    const Json::Value& error = answer["error"];
    return AnswerUsageError(response, ErrorOfServiceCode(TextMember(error, "code")),
                            TextMember(error, "message"));
  }
  response->SetSuccess(answer["data"]);
}
