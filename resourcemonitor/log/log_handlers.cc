#include "log/log_handlers.h"

#include <climits>

#include "api/critical_section.h"
#include "api/error_report.h"
#include "api/page.h"
#include "kova/log.h"
#include "log/log_reader.h"

namespace {

constexpr char kSource[] = "log";

// A page bound as the JSON library reads a number, cut to the int range: an
// offset past any log gives an empty page, a limit past any log gives all of
// it. False for a text, an array or an object.
bool ReadPageBound(const Json::Value& value, int& bound) {
  if (value.isNull() || value.isBool() || value.isInt()) {
    bound = value.asInt();
    return true;
  }
  if (!value.isDouble()) return false;
  const double number = value.asDouble();
  bound = number >= INT_MAX ? INT_MAX : number <= INT_MIN ? INT_MIN : static_cast<int>(number);
  return true;
}

// Reads "offset", "limit" and "filter" into `filter`. False when one of them
// can't be read as what it stands for, or the filter's level is not acceptable.
bool ParseListRequest(const KOVA::APIRequest& request, LogFilter& filter) {
  int offset = 0;
  int limit = -1;
  if (!ReadPageBound(request.GetParam("offset", Json::Value(0)), offset) ||
      !ReadPageBound(request.GetParam("limit", Json::Value(-1)), limit)) {
    return false;
  }
  return ParseLogFilter(request.GetParam("filter", Json::Value()), offset, limit, filter);
}

}  // namespace

void log_list_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  LogFilter filter;
  if (!ParseListRequest(*request, filter)) {
    return response->SetError(kErrorBadParameter, Json::Value());
  }
  // Only the page is turned into JSON.
  LogRecords records;
  const bool read = ProcessLogRecords(filter, records);
  Json::Value reply;
  reply["total"] = static_cast<Json::UInt>(records.size());
  reply["logs"] = Page(records.size(), filter.offset, filter.limit,
                       [&records](size_t i) { return records.Entry(i); });
  // An unreadable log is answered with the error record as it stands, beside
  // the empty page.
  if (!read) return SetErrorFromReport(response, reply);
  response->SetSuccess(reply);
}

void log_clear_v1(KOVA::APIRequest*, KOVA::APIResponse* response) {
  CriticalSection section;
  ENTERCriticalSection(section, kSource, __LINE__);
  KOVALogClean(kLogTypePerfEvent);  // the clear reports success whatever the library says
  LEAVECriticalSection(section, kSource, __LINE__);
  response->SetSuccess(Json::Value());
}
