// The process-wide record of why an operation failed, and how handlers answer
// with it.
//
// An operation that fails deep inside a request fills the record and returns
// false; its handler then answers with the record's code and an error object
// built from it. The record is never reset: what a failure doesn't overwrite
// keeps the value an earlier failure in the process left.

#ifndef RESOURCEMONITOR_API_ERROR_REPORT_H_
#define RESOURCEMONITOR_API_ERROR_REPORT_H_

#include <json/value.h>

#include <string>

#include "kova/webapi.h"

// Error codes of the module.
enum ResourceMonitorError : int {
  kErrorBadParameter = 101,      // a parameter a handler rejects itself; answered with null data
  kErrorWrongType = 6101,        // a settings parameter of the wrong JSON type
  kErrorConf = 6102,             // configuration, service or rule store failed
  kErrorNoVolume = 6103,         // no volume holds the history database
  kErrorDatabaseDown = 6104,     // the history database service is disabled
  kErrorCollectorReload = 6105,  // the statistics service could not be made to reload
  kErrorRuleDuplicate = 6106,    // the rule store refused a rule as a duplicate
  kErrorRuleNotFound = 6107,     // the rule named for update does not exist
  kErrorUnset = 6199,            // no failure has set a code yet
};

class ErrorReport {
 public:
  // The one record of the process, created on first use.
  static ErrorReport& getInstance();
  ~ErrorReport();

  int line = 0;         // source line of the failure point
  std::string msg;      // English message for developers
  std::string session;  // section of the localised text to show
  std::string key;      // key of that text in the section
  int code = kErrorUnset;

 private:
  ErrorReport() = default;
};

// A failure point and what it records: its line and message when `msg` is set,
// the localised text when `session` is set, the code when it is not 0.
struct FailurePoint {
  int line = 0;
  const char* msg = nullptr;
  const char* session = nullptr;
  const char* key = nullptr;
  int code = 0;
};

// Fills the record as `point` says, in the order where, text, code, and returns
// false, so that an operation can `return Fail(point);`.
bool Fail(const FailurePoint& point);

// Adds "err_line", "err_msg", "err_session" and "err_key" from the record to
// `data`, a null value or an object.
void AddErrorMembers(Json::Value& data);

// Answers the call with the record's code and `data` with the record's members added.
void SetErrorFromReport(KOVA::APIResponse* response, Json::Value data = Json::Value());

// Fills the record as `point` says and answers the call with it.
void AnswerFailure(KOVA::APIResponse* response, const FailurePoint& point);

#endif  // RESOURCEMONITOR_API_ERROR_REPORT_H_
