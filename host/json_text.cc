#include "host/json_text.h"

#include <json/reader.h>
#include <json/writer.h>

#include <map>
#include <memory>
#include <sstream>

#include "common/answer_envelope.h"

namespace kova_host {

std::string ToJson(const Json::Value& value) {
  thread_local const std::unique_ptr<Json::StreamWriter> writer = [] {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    builder["emitUTF8"] = true;
    // 15 significant digits give 12.3 back as 12.3; 17 would show binary noise.
    builder["precision"] = 15;
    return std::unique_ptr<Json::StreamWriter>(builder.newStreamWriter());
  }();
  std::ostringstream out;
  writer->write(value, &out);
  return out.str();
}

JsonParse ParseJsonText(std::string_view text, Json::Value& value, int max_depth) {
  // One reader per depth and thread: making one is dear, and readers aren't shared.
  thread_local std::map<int, std::unique_ptr<Json::CharReader>> readers;
  std::unique_ptr<Json::CharReader>& reader = readers[max_depth];
  if (!reader) {
    Json::CharReaderBuilder builder;
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["strictRoot"] = false;
    builder["stackLimit"] = max_depth;
    reader.reset(builder.newCharReader());
  }
  if (text.empty()) return JsonParse::kNotJson;
  std::string errors;
  try {
    return reader->parse(text.data(), text.data() + text.size(), &value, &errors)
               ? JsonParse::kOk
               : JsonParse::kNotJson;
  } catch (const Json::Exception&) {  // nested deeper than the limit
    return JsonParse::kTooDeep;
  }
}

bool FromJson(std::string_view text, Json::Value& value) {
  return ParseJsonText(text, value, kMaxJsonDepth) == JsonParse::kOk;
}

Json::Value ErrorReason(int code, const std::string& reason) {
  Json::Value errors;
  errors["reason"] = reason;
  return kova::ErrorEnvelope(code, errors);
}

}  // namespace kova_host
