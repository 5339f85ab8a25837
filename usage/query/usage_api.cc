#include "query/usage_api.h"

#include <optional>
#include <string>

#include "api/usage_error.h"
#include "query/collector_exchange.h"
#include "query/query_params.h"

namespace {

// Answers the call of `method`; nothing it raises leaves the module, the host
// being told 100 instead.
void Serve(const char* method, KOVA::APIRequest* request, KOVA::APIResponse* response) noexcept {
  try {
    std::string refused;
    const std::optional<Json::Value> collector_request =
        BuildCollectorRequest(method, *request, refused);
    if (!collector_request) return AnswerRefusedParam(response, refused);
    AnswerFromCollector(*collector_request, response);
  } catch (...) {
    response->SetError(KOVA::kAPIErrorUnknown, Json::Value());  // copies no data: can't throw
  }
}

}  // namespace

void usage_catalog_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  Serve("catalog", request, response);
}

void usage_realtime_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  Serve("realtime", request, response);
}

void usage_history_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  Serve("history", request, response);
}
