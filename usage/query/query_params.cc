#include "query/query_params.h"

#include <cstddef>

#include "kova/statistics.h"

namespace {

constexpr Json::Int64 kLatestTime = kStatisticsLatestTime;
constexpr Json::Int64 kMaxSeries = kStatisticsMaxSeries;

// One parameter of a method. A series list counts its ids between `min` and
// `max`; a number must lie between them and, when `above` names an earlier
// parameter, be greater than it.
struct ParamRule {
  const char* name;
  bool series;
  bool required;
  Json::Int64 min;
  Json::Int64 max;
  Json::Int64 fallback;
  const char* above;
};

constexpr ParamRule kNoParams[] = {
    {nullptr, false, false, 0, 0, 0, nullptr},
};
constexpr ParamRule kRealtimeParams[] = {
    {"series", true, true, 1, kMaxSeries, 0, nullptr},
    {"since", false, false, 0, kLatestTime, 0, nullptr},
    {nullptr, false, false, 0, 0, 0, nullptr},
};
constexpr ParamRule kHistoryParams[] = {
    {"series", true, true, 1, kMaxSeries, 0, nullptr},
    {"from", false, true, 0, kLatestTime, 0, nullptr},
    {"to", false, true, 0, kLatestTime, 0, "from"},  // after "from"
    {"points", false, false, 1, kStatisticsMaxPoints, kStatisticsDefaultPoints, nullptr},
    {nullptr, false, false, 0, 0, 0, nullptr},
};

struct MethodRow {
  const char* method;
  const ParamRule* params;
};

constexpr MethodRow kMethods[] = {
    {"catalog", kNoParams},
    {"realtime", kRealtimeParams},
    {"history", kHistoryParams},
    {nullptr, nullptr},
};

// The ids of `value` as a new array, or nullopt when it is no array of
// `rule.min` to `rule.max` ids, each one the collector takes (IsSeriesId).
std::optional<Json::Value> ReadSeries(const Json::Value& value, const ParamRule& rule) {
  if (!value.isArray()) return std::nullopt;
  const auto count = static_cast<Json::Int64>(value.size());
  if (count < rule.min || count > rule.max) return std::nullopt;
  Json::Value ids(Json::arrayValue);
  for (const Json::Value& id : value) {
    if (!id.isString() || !IsSeriesId(id.asString())) return std::nullopt;
    ids.append(id);
  }
  return ids;
}

// `value` as a whole number between `rule.min` and `rule.max`, or nullopt.
std::optional<Json::Int64> ReadWholeNumber(const Json::Value& value, const ParamRule& rule) {
  if (!value.isInt64()) return std::nullopt;  // also false for booleans and text
  const Json::Int64 number = value.asInt64();
  if (number < rule.min || number > rule.max) return std::nullopt;
  return number;
}

// Adds the parameter of `rule` to `request`; false when it is refused.
bool AddParam(const ParamRule& rule, const KOVA::APIRequest& call, Json::Value& request) {
  if (!call.HasParam(rule.name)) {
    if (rule.required) return false;
    request[rule.name] = rule.fallback;
    return true;
  }
  const Json::Value value = call.GetParam(rule.name, Json::Value());
  if (rule.series) {
    std::optional<Json::Value> ids = ReadSeries(value, rule);
    if (!ids) return false;
    request[rule.name] = std::move(*ids);
    return true;
  }
  const std::optional<Json::Int64> number = ReadWholeNumber(value, rule);
  if (!number) return false;
  if (rule.above != nullptr && *number <= request[rule.above].asInt64()) return false;
  request[rule.name] = *number;
  return true;
}

}  // namespace

std::optional<Json::Value> BuildCollectorRequest(const std::string& method,
                                                 const KOVA::APIRequest& call,
                                                 std::string& refused) {
  const MethodRow* row = kMethods;
  while (row->method != nullptr && method != row->method) ++row;
  if (row->method == nullptr) {
    refused = "method";
    return std::nullopt;
  }
  Json::Value request(Json::objectValue);
  request["request"] = row->method;
  for (const ParamRule* rule = row->params; rule->name != nullptr; ++rule) {
    if (!AddParam(*rule, call, request)) {
      refused = rule->name;
      return std::nullopt;
    }
  }
  return request;
}
