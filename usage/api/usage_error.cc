#include "api/usage_error.h"

#include "api/module.h"

namespace {

constexpr char kSection[] = "usage";

// An error, its text's key, the English text shown when the string tables lack
// the key, and the service's error code that maps onto it (null: none).
struct ErrorRow {
  int code;
  const char* key;
  const char* english;
  const char* service_code;
};

constexpr ErrorRow kErrors[] = {
    {kUsageCollectorUnavailable, "collector_unavailable",
     "The statistics collector is not running or does not answer.", nullptr},
    {kUsageHistoryOff, "history_off", "Usage history is switched off.", "history_off"},
    {kUsageDatabaseUnavailable, "database_unavailable", "The history database can't be reached.",
     "database_unavailable"},
    {kUsageCollectorFailed, "collector_failed",
     "The statistics collector refused or failed the request.", nullptr},
    {0, nullptr, nullptr, nullptr},
};

// The row of `error`; the last one, collector_failed, for a code not in the table.
const ErrorRow& RowOf(UsageError error) {
  const ErrorRow* row = kErrors;
  while (row[1].code != 0 && row->code != error) ++row;
  return *row;
}

}  // namespace

UsageError ErrorOfServiceCode(const std::string& service_code) {
  for (const ErrorRow* row = kErrors; row->code != 0; ++row) {
    if (row->service_code != nullptr && service_code == row->service_code) {
      return static_cast<UsageError>(row->code);
    }
  }
  return kUsageCollectorFailed;
}

void AnswerUsageError(KOVA::APIResponse* response, UsageError error, const std::string& reason) {
  const ErrorRow& row = RowOf(error);
  Json::Value data(Json::objectValue);
  data["err_msg"] = gStringBundle.Text(row.key, row.english);
  data["err_session"] = kSection;
  data["err_key"] = row.key;
  if (!reason.empty()) data["reason"] = reason;
  response->SetError(row.code, data);
}

void AnswerRefusedParam(KOVA::APIResponse* response, const std::string& param) {
  Json::Value data(Json::objectValue);
  data["param"] = param;
  response->SetError(KOVA::kAPIErrorBadParameter, data);
}
