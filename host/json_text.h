// JSON text in and out, and the error envelope that carries a reason.

#ifndef KOVA_HOST_JSON_TEXT_H_
#define KOVA_HOST_JSON_TEXT_H_

#include <json/value.h>

#include <string>
#include <string_view>

namespace kova_host {

// `value` as compact JSON text, UTF-8 left as it is.
std::string ToJson(const Json::Value& value);

// How deep JSON text may nest: the front-end's messages to the runner, and a
// call's parameter values, which such a message holds two levels down.
inline constexpr int kMaxJsonDepth = 64;
inline constexpr int kMaxParamDepth = kMaxJsonDepth - 4;

enum class JsonParse { kOk, kNotJson, kTooDeep };

// Parses `text` as one JSON value of any type (a number or a string too), the
// whole text and nothing after it, nested at most `max_depth` deep.
JsonParse ParseJsonText(std::string_view text, Json::Value& value, int max_depth);

// ParseJsonText at kMaxJsonDepth; false when `text` is no such value.
bool FromJson(std::string_view text, Json::Value& value);

// An error envelope whose "errors" is {"reason": reason}.
Json::Value ErrorReason(int code, const std::string& reason);

}  // namespace kova_host

#endif  // KOVA_HOST_JSON_TEXT_H_
