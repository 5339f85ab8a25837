#include "host/params.h"

#include <gtest/gtest.h>

#include "host/json_text.h"

namespace kova_host {
namespace {

TEST(ParamsTest, DecodesFormFields) {
  const struct {
    const char* text;
    FormFields fields;
  } cases[] = {
      {"api=KOVA.API.Info&version=1", {{"api", "KOVA.API.Info"}, {"version", "1"}}},
      {"a=x+y%20z&&b=", {{"a", "x y z"}, {"b", ""}}},
      {"flag&filter=%7B%22k%22%3A1%7D", {{"flag", ""}, {"filter", R"({"k":1})"}}},
      {"n%C3%A4me=%e2%82%ac", {{"n\xc3\xa4me", "\xe2\x82\xac"}}},
      {"", {}},
  };
  for (const auto& c : cases) {
    FormFields fields;
    std::string error;
    EXPECT_TRUE(DecodeForm(c.text, fields, error)) << c.text;
    EXPECT_EQ(fields, c.fields) << c.text;
  }
  for (const char* broken : {"a=%", "a=%4", "a=%zz", "%G1=1", "a=1&=2"}) {
    FormFields fields;
    std::string error;
    EXPECT_FALSE(DecodeForm(broken, fields, error)) << broken;
    EXPECT_FALSE(error.empty());
  }
}

TEST(ParamsTest, TakesJsonWhenTheWholeTextIsJson) {
  const struct {
    const char* text;
    const char* value;  // as JSON
  } cases[] = {
      {"10", "10"},
      {"-2.5", "-2.5"},
      {"true", "true"},
      {"null", "null"},
      {R"(["a"])", R"(["a"])"},
      {R"({"loglevel": "Warning"})", R"({"loglevel": "Warning"})"},
      {R"("quoted")", R"("quoted")"},
      {"csv", R"("csv")"},
      {"10 apples", R"("10 apples")"},
      {"[1,", R"("[1,")"},
      {R"({"a": 1} {"b": 2})", R"("{\"a\": 1} {\"b\": 2}")"},
      {R"({"a": 1, "a": 2})", R"("{\"a\": 1, \"a\": 2}")"},
      {"", R"("")"},
      {"True", R"("True")"},
  };
  for (const auto& c : cases) {
    Json::Value expected;
    ASSERT_TRUE(FromJson(c.value, expected)) << c.value;
    Json::Value value;
    ASSERT_TRUE(ParamValue(c.text, value)) << c.text;
    EXPECT_EQ(value, expected) << c.text;
  }
  // Nesting up to the limit is taken; deeper is refused, not read as text.
  const auto nested = [](int depth) {
    return std::string(depth, '[') + "1" + std::string(depth, ']');
  };
  Json::Value value;
  EXPECT_TRUE(ParamValue(nested(kMaxParamDepth - 1), value) && value.isArray());
  EXPECT_FALSE(ParamValue(nested(kMaxParamDepth + 1), value));
  EXPECT_FALSE(ParamValue(nested(100), value));
}

}  // namespace
}  // namespace kova_host
