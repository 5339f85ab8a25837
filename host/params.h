// Parameters of a web-API call as HTTP carries them: form-encoded in the query
// string or a POST body, each value JSON when its whole text is JSON.

#ifndef KOVA_HOST_PARAMS_H_
#define KOVA_HOST_PARAMS_H_

#include <json/value.h>

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace kova_host {

using FormFields = std::vector<std::pair<std::string, std::string>>;

// Appends the name=value fields of form-encoded `text` ("+" a blank, "%XX" a
// byte) to `fields`; empty fields ("a=1&&b=2") are skipped. False with `error`
// on a broken percent-encoding or an empty name.
bool DecodeForm(std::string_view text, FormFields& fields, std::string& error);

// Decodes "%XX" escapes of `text` into `out`, and "+" as a blank when
// `plus_is_blank` (form fields, not paths). False on a broken escape.
bool PercentDecode(std::string_view text, bool plus_is_blank, std::string& out);

// The value of a parameter: its JSON value when the whole text is valid JSON
// ("10", "true", "[\"a\"]", "{\"k\": 1}"), the text itself otherwise ("csv").
// False for JSON nested deeper than kMaxParamDepth, which no call may carry.
bool ParamValue(const std::string& text, Json::Value& value);

}  // namespace kova_host

#endif  // KOVA_HOST_PARAMS_H_
