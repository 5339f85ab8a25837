// The registry of in-process web APIs and the in-process call.

#include <map>
#include <mutex>
#include <string>
#include <tuple>

#include "common/answer_envelope.h"
#include "common/method_list.h"
#include "kova/webapi.h"

namespace KOVA {
namespace {

using MethodKey = std::tuple<std::string, int, std::string>;

struct Method {
  APIHandler handler = nullptr;
  APICheck check = nullptr;
};

struct Registry {
  std::mutex mutex;
  std::map<MethodKey, Method> methods;
};

Registry& TheRegistry() {
  static Registry registry;
  return registry;
}

// Every method of `methods` as {"api", "version", "method"}, in their order.
Json::Value ListOf(const std::map<MethodKey, Method>& methods) {
  Json::Value list(Json::arrayValue);
  for (const auto& [key, unused] : methods) {
    Json::Value row;
    row["api"] = std::get<0>(key);
    row["version"] = std::get<1>(key);
    row["method"] = std::get<2>(key);
    list.append(row);
  }
  return list;
}

// The registered method, or the host error that says why there is none.
int Find(const MethodKey& key, Method& found) {
  Registry& registry = TheRegistry();
  std::lock_guard lock(registry.mutex);
  auto it = registry.methods.find(key);
  if (it != registry.methods.end()) {
    found = it->second;
    return 0;
  }
  const auto& [api, version, method] = key;
  return kova::FindInMethodList(ListOf(registry.methods), api, version, method);
}

Json::Value Answer(const APIResponse& response) {
  if (!response.IsOutputEnabled() || response.GetState() == APIResponse::State::kUnset) {
    return kova::ErrorEnvelope(kAPIErrorUnknown, Json::Value());
  }
  if (response.GetState() == APIResponse::State::kError) {
    return kova::ErrorEnvelope(response.GetErrorCode(), response.GetData());
  }
  return kova::SuccessEnvelope(response.GetData());
}

}  // namespace

int APIRunner::Call(const char* api, int version, const char* method, APIRequest& request,
                    APIResponse& response) {
  Method found;
  const int missing = Find({api ? api : "", version, method ? method : ""}, found);
  if (missing != 0) return missing;
  if (found.check != nullptr && found.check(&request) == 0) return kAPIErrorNotPermitted;
  found.handler(&request, &response);
  return 0;
}

int APIRunner::Exec(Json::Value& out, const char* api, int version, const char* method,
                    const Json::Value& params, const char* user) {
  APIRequest request(params, user ? user : "", "enu");
  APIResponse response;
  try {
    const int refused = Call(api, version, method, request, response);
    if (refused == kAPIErrorNotPermitted) {
      out = kova::ErrorEnvelope(refused, Json::Value());
      return 0;
    }
    if (refused != 0) {
      out = kova::ErrorEnvelope(refused, Json::Value());
      return -1;
    }
    out = Answer(response);
  } catch (...) {
    out = kova::ErrorEnvelope(kAPIErrorUnknown, Json::Value());
  }
  return 0;
}

Json::Value APIRunner::List() {
  Registry& registry = TheRegistry();
  std::lock_guard lock(registry.mutex);
  return ListOf(registry.methods);
}

int APIRunner::Register(const APITableEntry* table, const APICheckEntry* checks) {
  std::map<MethodKey, Method> added;
  for (const APITableEntry* row = table; row != nullptr && row->api != nullptr; ++row) {
    if (row->handler == nullptr || row->method == nullptr) return -1;
    MethodKey key{row->api, static_cast<int>(row->version), row->method};
    if (!added.emplace(key, Method{row->handler, nullptr}).second) return -1;
  }
  for (const APICheckEntry* row = checks; row != nullptr && row->api != nullptr; ++row) {
    auto it =
        added.find({row->api, static_cast<int>(row->version), row->method ? row->method : ""});
    if (it != added.end()) it->second.check = row->check;
  }
  Registry& registry = TheRegistry();
  std::lock_guard lock(registry.mutex);
  for (const auto& [key, unused] : added) {
    if (registry.methods.count(key) != 0) return -1;
  }
  const int count = static_cast<int>(added.size());
  registry.methods.merge(added);
  return count;
}

void APIRunner::Unregister(const APITableEntry* table) {
  Registry& registry = TheRegistry();
  std::lock_guard lock(registry.mutex);
  for (const APITableEntry* row = table; row != nullptr && row->api != nullptr; ++row) {
    registry.methods.erase(
        {row->api, static_cast<int>(row->version), row->method ? row->method : ""});
  }
}

}  // namespace KOVA
