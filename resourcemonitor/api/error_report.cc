#include "api/error_report.h"

ErrorReport& ErrorReport::getInstance() {
  static ErrorReport ErrorReport_instance;
  return ErrorReport_instance;
}

ErrorReport::~ErrorReport() = default;

bool Fail(const FailurePoint& point) {
  if (point.msg != nullptr) {
    ErrorReport::getInstance().line = point.line;
    ErrorReport::getInstance().msg = point.msg;
  }
  if (point.session != nullptr) {
    ErrorReport::getInstance().session = point.session;
    ErrorReport::getInstance().key = point.key;
  }
  if (point.code != 0) ErrorReport::getInstance().code = point.code;
  return false;
}

void AddErrorMembers(Json::Value& data) {
  const ErrorReport& report = ErrorReport::getInstance();
  data["err_line"] = report.line;
  data["err_msg"] = report.msg;
  data["err_session"] = report.session;
  data["err_key"] = report.key;
}

void SetErrorFromReport(KOVA::APIResponse* response, Json::Value data) {
  AddErrorMembers(data);
  response->SetError(ErrorReport::getInstance().code, data);
}

void AnswerFailure(KOVA::APIResponse* response, const FailurePoint& point) {
  Fail(point);
  SetErrorFromReport(response);
}
