#include "host/params.h"

#include "host/json_text.h"

namespace kova_host {
namespace {

int HexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace

bool PercentDecode(std::string_view text, bool plus_is_blank, std::string& out) {
  out.clear();
  out.reserve(text.size());
  for (size_t i = 0; i < text.size(); ++i) {
    if (plus_is_blank && text[i] == '+') {
      out += ' ';
    } else if (text[i] != '%') {
      out += text[i];
    } else {
      const int high = i + 2 < text.size() ? HexDigit(text[i + 1]) : -1;
      const int low = high >= 0 ? HexDigit(text[i + 2]) : -1;
      if (low < 0) return false;
      out += static_cast<char>(high * 16 + low);
      i += 2;
    }
  }
  return true;
}

bool DecodeForm(std::string_view text, FormFields& fields, std::string& error) {
  while (!text.empty()) {
    const size_t end = text.find('&');
    const std::string_view field = text.substr(0, end);
    text = end == std::string_view::npos ? std::string_view() : text.substr(end + 1);
    if (field.empty()) continue;
    const size_t equals = field.find('=');
    std::string name, value;
    if (!PercentDecode(field.substr(0, equals), true, name) ||
        (equals != std::string_view::npos &&
         !PercentDecode(field.substr(equals + 1), true, value))) {
      error = "broken percent-encoding in the parameters";
      return false;
    }
    if (name.empty()) {
      error = "a parameter without a name";
      return false;
    }
    fields.emplace_back(std::move(name), std::move(value));
  }
  return true;
}

bool ParamValue(const std::string& text, Json::Value& value) {
  switch (ParseJsonText(text, value, kMaxParamDepth)) {
    case JsonParse::kOk:
      return true;
    case JsonParse::kNotJson:
      value = text;
      return true;
    default:
      return false;
  }
}

}  // namespace kova_host
