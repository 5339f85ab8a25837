// Test helpers that call a web-API handler the way the host does.

#ifndef KOVA_TEST_SUPPORT_HOST_CALL_H_
#define KOVA_TEST_SUPPORT_HOST_CALL_H_

#include <json/reader.h>
#include <json/writer.h>  // prints values in test failures

#include <memory>
#include <stdexcept>
#include <string>

#include "kova/webapi.h"

namespace kova_test {

// The JSON value written in `text`; throws on malformed JSON, a mistake in the test.
inline Json::Value ParseJson(const std::string& text) {
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value value;
  std::string errors;
  if (!reader->parse(text.data(), text.data() + text.size(), &value, &errors)) {
    throw std::invalid_argument("bad JSON in test: " + text + ": " + errors);
  }
  return value;
}

// Calls `handler` with the parameters written in `params` as the user "admin"
// and returns the settled response.
inline KOVA::APIResponse CallHandler(APIHandler handler, const std::string& params = "{}",
                                     const std::string& language = "enu") {
  KOVA::APIRequest request(ParseJson(params), "admin", language);
  KOVA::APIResponse response;
  handler(&request, &response);
  return response;
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_HOST_CALL_H_
