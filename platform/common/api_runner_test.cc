#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <stdexcept>

#include "kova/webapi.h"
#include "test_support/host_call.h"

namespace {

using kova_test::ParseJson;

void Echo(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  Json::Value data;
  data["user"] = request->GetUser();
  data["n"] = request->GetParam("n", -1);
  response->SetSuccess(data);
}
void Nothing(KOVA::APIRequest*, KOVA::APIResponse* response) { response->SetSuccess({}); }
void Refuse(KOVA::APIRequest*, KOVA::APIResponse* response) {
  Json::Value errors;
  errors["why"] = "no";
  response->SetError(6102, errors);
}
void Silent(KOVA::APIRequest*, KOVA::APIResponse*) {}
void Throw(KOVA::APIRequest*, KOVA::APIResponse*) { throw std::runtime_error("boom"); }
int Deny(KOVA::APIRequest*) { return 0; }

APITableEntry kTable[] = {
    {"Test.Echo", 1, "echo", Echo},     {"Test.Echo", 1, "nothing", Nothing},
    {"Test.Echo", 1, "refuse", Refuse}, {"Test.Echo", 1, "silent", Silent},
    {"Test.Echo", 1, "throw", Throw},   {"Test.Echo", 1, "denied", Echo},
    {"Test.Echo", 2, "echo", Echo},     {nullptr, 0, nullptr, nullptr},
};
APICheckEntry kChecks[] = {
    {"Test.Echo", 1, "denied", Deny, 0, 0},
    {nullptr, 0, nullptr, nullptr, 0, 0},
};

class APIRunnerTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(KOVA::APIRunner::Register(kTable, kChecks), 7); }
  void TearDown() override { KOVA::APIRunner::Unregister(kTable); }
};

TEST_F(APIRunnerTest, AnswersInTheEnvelopeOfTheWebAPI) {
  const struct {
    const char* api;
    int version;
    const char* method;
    int result;
    const char* out;
  } cases[] = {
      {"Test.Echo", 1, "echo", 0, R"({"success": true, "data": {"user": "admin", "n": 7}})"},
      {"Test.Echo", 2, "echo", 0, R"({"success": true, "data": {"user": "admin", "n": 7}})"},
      {"Test.Echo", 1, "nothing", 0, R"({"success": true})"},
      {"Test.Echo", 1, "refuse", 0,
       R"({"success": false, "error": {"code": 6102, "errors": {"why": "no"}}})"},
      {"Test.Echo", 1, "denied", 0, R"({"success": false, "error": {"code": 105}})"},
      {"Test.Echo", 1, "silent", 0, R"({"success": false, "error": {"code": 100}})"},
      {"Test.Echo", 1, "throw", 0, R"({"success": false, "error": {"code": 100}})"},
      {"Test.Other", 1, "echo", -1, R"({"success": false, "error": {"code": 102}})"},
      {"Test.Echo", 3, "echo", -1, R"({"success": false, "error": {"code": 104}})"},
      {"Test.Echo", 1, "missing", -1, R"({"success": false, "error": {"code": 103}})"},
  };
  for (const auto& c : cases) {
    Json::Value out;
    EXPECT_EQ(
        KOVA::APIRunner::Exec(out, c.api, c.version, c.method, ParseJson(R"({"n": 7})"), "admin"),
        c.result)
        << c.method;
    EXPECT_EQ(out, ParseJson(c.out)) << c.api << " v" << c.version << " " << c.method;
  }
}

TEST_F(APIRunnerTest, RefusesTablesThatRepeatAMethodOrLackAHandler) {
  APITableEntry repeated[] = {{"Test.New", 1, "a", Echo}, {"Test.Echo", 1, "echo", Echo}, {}};
  APITableEntry twice[] = {{"Test.New", 1, "a", Echo}, {"Test.New", 1, "a", Echo}, {}};
  APITableEntry no_handler[] = {{"Test.New", 1, "a", nullptr}, {}};
  for (const APITableEntry* table : {repeated, twice, no_handler}) {
    EXPECT_EQ(KOVA::APIRunner::Register(table, nullptr), -1);
    Json::Value out;
    EXPECT_EQ(KOVA::APIRunner::Exec(out, "Test.New", 1, "a", Json::Value(), "admin"), -1);
  }
}

TEST_F(APIRunnerTest, CallsOnTheCallersRequestAndResponseAndListsTheMethods) {
  KOVA::APIRequest request(ParseJson(R"({"n": 3})"), "operator", "ger");
  KOVA::APIResponse response;
  EXPECT_EQ(KOVA::APIRunner::Call("Test.Echo", 2, "echo", request, response), 0);
  EXPECT_EQ(response.GetData(), ParseJson(R"({"user": "operator", "n": 3})"));

  KOVA::APIResponse refused;
  EXPECT_EQ(KOVA::APIRunner::Call("Test.Echo", 1, "denied", request, refused),
            KOVA::kAPIErrorNotPermitted);
  EXPECT_EQ(refused.GetSettleCount(), 0);  // the handler did not run
  EXPECT_EQ(KOVA::APIRunner::Call("Test.Echo", 9, "echo", request, refused),
            KOVA::kAPIErrorBadVersion);
  EXPECT_THROW(KOVA::APIRunner::Call("Test.Echo", 1, "throw", request, refused),
               std::runtime_error);

  const Json::Value list = KOVA::APIRunner::List();
  ASSERT_EQ(list.size(), 7u);
  EXPECT_EQ(list[0], ParseJson(R"({"api": "Test.Echo", "version": 1, "method": "denied"})"));
  EXPECT_EQ(list[6], ParseJson(R"({"api": "Test.Echo", "version": 2, "method": "echo"})"));
}

}  // namespace
