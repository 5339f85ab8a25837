#include "statd/protocol.h"

#include <json/reader.h>
#include <json/writer.h>

#include <cmath>
#include <cstdint>
#include <exception>
#include <memory>
#include <optional>
#include <sstream>
#include <vector>

#include "statd/json_out.h"

namespace statd {
namespace {

// What a request came to: data (as a value, or as JSON text already written),
// or an error code and its message.
struct Outcome {
  const char* error = nullptr;
  std::string message;
  Json::Value data;
  std::string text;

  bool Fail(const char* code, std::string text) {
    error = code;
    message = std::move(text);
    return false;
  }
};

std::string Write(const Json::Value& value) {
  thread_local const std::unique_ptr<Json::StreamWriter> writer = [] {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    builder["emitUTF8"] = true;
    builder["precision"] = 15;  // values are no finer than that; 17 shows binary noise
    return std::unique_ptr<Json::StreamWriter>(builder.newStreamWriter());
  }();
  std::ostringstream out;
  writer->write(value, &out);
  return out.str();
}

// "series": 1 to 64 ids.
bool ReadSeries(const Json::Value& request, std::vector<std::string>& ids, Outcome& outcome) {
  const Json::Value& series = request["series"];
  if (!series.isArray() || series.empty() || series.size() > kStatisticsMaxSeries) {
    return outcome.Fail("bad_request", "\"series\" must be a list of 1 to 64 series ids");
  }
  for (const Json::Value& id : series) {
    if (!id.isString() || !IsSeriesId(id.asString())) {
      return outcome.Fail("bad_request",
                          "every id of \"series\" must be a text of 1 to 256 bytes of UTF-8 "
                          "without control characters");
    }
    ids.push_back(id.asString());
  }
  return true;
}

// The whole number `name` from `low` to `high`; `fallback` when absent, and
// when there is none, the member is required.
bool ReadWhole(const Json::Value& request, const char* name, std::optional<int64_t> fallback,
               int64_t low, int64_t high, int64_t& number, Outcome& outcome) {
  const Json::Value& value = request[name];
  if (value.isNull() && fallback) {
    number = *fallback;
    return true;
  }
  const std::string range = std::to_string(low) + " to " + std::to_string(high);
  if (!value.isNumeric() || !std::isfinite(value.asDouble()) || !value.isIntegral() ||
      value.asDouble() < static_cast<double>(low) || value.asDouble() > static_cast<double>(high)) {
    return outcome.Fail("bad_request",
                        std::string("\"") + name + "\" must be a whole number from " + range);
  }
  number = value.asInt64();
  return true;
}

bool Reload(const Json::Value&, Collector& collector, Outcome& outcome) {
  std::string error;
  return collector.Reload(error) ||
         outcome.Fail("internal", "the settings can't be read: " + error);
}

const char* StateName(HistoryState state) {
  switch (state) {
    case HistoryState::kWriting:
      return "writing";
    case HistoryState::kWaiting:
      return "waiting";
    default:
      return "off";
  }
}

bool Catalog(const Json::Value&, Collector& collector, Outcome& outcome) {
  const CatalogAnswer catalog = collector.Catalog();
  Json::Value& data = outcome.data;
  data["interval"] = catalog.interval;
  data["realtime_minutes"] = catalog.realtime_minutes;
  data["history"]["enabled"] = catalog.history_enabled;
  data["history"]["state"] = StateName(catalog.history_state);
  data["utc_offset"] = catalog.utc_offset;
  Json::Value& list = data["series"] = Json::arrayValue;
  for (const SeriesInfo& info : catalog.series) {
    Json::Value series;
    series["id"] = info.id;
    series["metric"] = info.metric;
    series["unit"] = info.unit;
    Json::Value& labels = series["labels"] = Json::objectValue;
    for (const auto& [name, value] : info.labels) labels[name] = value;
    list.append(std::move(series));
  }
  return true;
}

bool Realtime(const Json::Value& request, Collector& collector, Outcome& outcome) {
  std::vector<std::string> ids;
  int64_t since = 0;
  if (!ReadSeries(request, ids, outcome) ||
      !ReadWhole(request, "since", 0, 0, kStatisticsLatestTime, since, outcome)) {
    return false;
  }
  std::vector<RealtimeSeries> found;
  std::vector<std::string> unknown;
  int64_t now = 0;
  collector.Realtime(ids, since, found, unknown, now);
  JsonOut data(outcome.text);
  data.BeginObject();
  data.Key("interval").Number(int64_t{collector.interval()});
  data.Key("now").Number(now);
  data.Key("series").BeginArray();
  for (const RealtimeSeries& series : found) {
    data.BeginObject().Key("id").Text(series.id);
    data.Key("times").Array(series.times);
    data.Key("values").Array(series.values);
    data.EndObject();
  }
  data.EndArray();
  data.Key("unknown").Array(unknown);
  data.EndObject();
  return true;
}

bool History(const Json::Value& request, Collector& collector, Outcome& outcome) {
  std::vector<std::string> ids;
  int64_t from = 0;
  int64_t to = 0;
  int64_t points = 0;
  if (!ReadSeries(request, ids, outcome) ||
      !ReadWhole(request, "from", std::nullopt, 0, kStatisticsLatestTime, from, outcome) ||
      !ReadWhole(request, "to", std::nullopt, 0, kStatisticsLatestTime, to, outcome) ||
      !ReadWhole(request, "points", kStatisticsDefaultPoints, 1, kStatisticsMaxPoints, points,
                 outcome)) {
    return false;
  }
  if (from >= to) return outcome.Fail("bad_request", "\"from\" must be before \"to\"");
  if (!collector.HistoryEnabled()) return outcome.Fail("history_off", "history is switched off");
  HistoryAnswer answer;
  std::string error;
  if (!collector.history().Query(ids, from, to, static_cast<int>(points), answer, error)) {
    return outcome.Fail("database_unavailable", error);
  }
  JsonOut data(outcome.text);
  data.BeginObject();
  data.Key("from").Number(from);
  data.Key("to").Number(to);
  data.Key("step").Number(answer.step);
  data.Key("source").Text(answer.source);
  data.Key("series").BeginArray();
  for (const HistorySeries& series : answer.series) {
    data.BeginObject().Key("id").Text(series.id);
    data.Key("times").Array(series.times);
    data.Key("avg").Array(series.avg);
    data.Key("min").Array(series.min);
    data.Key("max").Array(series.max);
    data.EndObject();
  }
  data.EndArray().EndObject();
  return true;
}

// The requests, one row each.
const struct {
  const char* name;
  bool (*handle)(const Json::Value& request, Collector& collector, Outcome& outcome);
} kRequests[] = {
    {"reload", Reload},   {"catalog", Catalog}, {"realtime", Realtime},
    {"history", History}, {nullptr, nullptr},
};

bool Parse(std::string_view line, Json::Value& request) {
  thread_local const std::unique_ptr<Json::CharReader> reader = [] {
    Json::CharReaderBuilder builder;
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["stackLimit"] = 32;
    return std::unique_ptr<Json::CharReader>(builder.newCharReader());
  }();
  std::string errors;
  try {
    return reader->parse(line.data(), line.data() + line.size(), &request, &errors) &&
           request.isObject();
  } catch (const Json::Exception&) {  // nested deeper than the limit
    return false;
  }
}

std::string AnswerOf(std::string_view line, Collector& collector) {
  if (line.size() > kStatisticsMaxRequest)
    return ErrorAnswer("too_large", "the request is over 64 KiB");
  Json::Value request;
  if (!Parse(line, request)) return ErrorAnswer("bad_request", "the request is not a JSON object");
  const Json::Value& name = request["request"];
  if (!name.isString()) return ErrorAnswer("bad_request", "the request names no \"request\"");
  for (const auto* row = kRequests; row->name != nullptr; ++row) {
    if (name.asString() != row->name) continue;
    Outcome outcome;
    if (!row->handle(request, collector, outcome))
      return ErrorAnswer(outcome.error, outcome.message);
    std::string text;
    if (!outcome.text.empty()) {
      text = "{\"success\":true,\"data\":" + outcome.text + "}";
    } else {
      Json::Value answer;
      answer["success"] = true;
      if (!outcome.data.isNull()) answer["data"] = std::move(outcome.data);
      text = Write(answer);
    }
    if (text.size() > kStatisticsMaxAnswer) {
      return ErrorAnswer("too_large", "the answer would be over 16 MiB; ask for less");
    }
    return text;
  }
  return ErrorAnswer("bad_request", "unknown request \"" + name.asString() + "\"");
}

}  // namespace

std::string ErrorAnswer(const char* code, const std::string& message) {
  Json::Value answer;
  answer["success"] = false;
  answer["error"]["code"] = code;
  answer["error"]["message"] = message;
  return Write(answer);
}

std::string Answer(std::string_view line, Collector& collector) {
  try {
    return AnswerOf(line, collector);
  } catch (const std::exception& failure) {  // deep nesting, no memory
    return ErrorAnswer("internal", std::string("the request failed: ") + failure.what());
  }
}

}  // namespace statd
