// The request and response of one web-API call.

#include <utility>

#include "kova/webapi.h"

namespace KOVA {

APIRequest::APIRequest(Json::Value params, std::string user, std::string ui_language)
    : params_(std::move(params)), user_(std::move(user)), ui_language_(std::move(ui_language)) {}

bool APIRequest::HasParam(const std::string& name) const {
  return params_.isObject() && params_.isMember(name);
}

Json::Value APIRequest::GetParam(const std::string& name, const Json::Value& fallback) const {
  return HasParam(name) ? params_[name] : fallback;
}

std::string APIRequest::GetUILanguage() const { return ui_language_; }

const std::string& APIRequest::GetUser() const { return user_; }

void APIResponse::SetSuccess(const Json::Value& data) {
  state_ = State::kSuccess;
  error_code_ = 0;
  data_ = data;
  ++settle_count_;
}

void APIResponse::SetError(int code, const Json::Value& data) {
  state_ = State::kError;
  error_code_ = code;
  data_ = data;
  ++settle_count_;
}

void APIResponse::SetEnableOutput(bool enable) { output_enabled_ = enable; }

APIResponse::State APIResponse::GetState() const { return state_; }

int APIResponse::GetErrorCode() const { return error_code_; }

const Json::Value& APIResponse::GetData() const { return data_; }

bool APIResponse::IsOutputEnabled() const { return output_enabled_; }

int APIResponse::GetSettleCount() const { return settle_count_; }

}  // namespace KOVA
