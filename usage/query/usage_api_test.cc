#include "query/usage_api.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "fake/kova_fake.h"
#include "test_support/host_call.h"

namespace {

using kova_test::CallHandler;
using kova_test::ParseJson;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr char kOk[] = R"({"success": true, "data": {"now": 1795000000}})";

// A JSON array of `count` ids of `bytes` bytes each, such as ["aaa","aaa"].
std::string Ids(int count, size_t bytes) {
  std::string text = "[";
  for (int i = 0; i < count; ++i) text += (i > 0 ? ",\"" : "\"") + std::string(bytes, 'a') + "\"";
  return text + "]";
}

class UsageApiTest : public ::testing::Test {
 protected:
  void SetUp() override { kova_fake::Reset(); }
};

TEST_F(UsageApiTest, RefusesBadParametersWithoutAskingTheCollector) {
  const std::string series = R"("series": ["cpu.user"])";
  const struct {
    APIHandler handler;
    std::string params;
    const char* refused;
  } cases[] = {
      {usage_realtime_v1, "{}", "series"},
      {usage_realtime_v1, R"({"series": "cpu.user"})", "series"},
      {usage_realtime_v1, R"({"series": []})", "series"},
      {usage_realtime_v1, "{\"series\": " + Ids(65, 4) + "}", "series"},
      {usage_realtime_v1, R"({"series": [""]})", "series"},
      {usage_realtime_v1, R"({"series": ["a\u0001"]})", "series"},
      {usage_realtime_v1, "{\"series\": " + Ids(1, 257) + "}", "series"},
      {usage_realtime_v1, "{" + series + R"(, "since": 60.5})", "since"},
      {usage_realtime_v1, "{" + series + R"(, "since": -1})", "since"},
      {usage_realtime_v1, "{" + series + R"(, "since": true})", "since"},
      {usage_realtime_v1, "{" + series + R"(, "since": 1099511627777})", "since"},  // 2^40 + 1
      {usage_history_v1, R"({"from": 1, "to": 2})", "series"},
      {usage_history_v1, "{" + series + R"(, "to": 2})", "from"},
      {usage_history_v1, "{" + series + R"(, "from": "1", "to": 2})", "from"},
      {usage_history_v1, "{" + series + R"(, "from": 1})", "to"},
      {usage_history_v1, "{" + series + R"(, "from": 10, "to": 10})", "to"},
      {usage_history_v1, "{" + series + R"(, "from": 1, "to": 2, "points": 0})", "points"},
      {usage_history_v1, "{" + series + R"(, "from": 1, "to": 2, "points": 10001})", "points"},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    const KOVA::APIResponse response = CallHandler(c.handler, c.params);
    EXPECT_EQ(response.GetSettleCount(), 1) << c.params;
    EXPECT_EQ(response.GetErrorCode(), 101) << c.params;
    EXPECT_EQ(response.GetData(), ParseJson(std::string(R"({"param": ")") + c.refused + "\"}"))
        << c.params;
    EXPECT_THAT(kova_fake::Calls(), IsEmpty()) << c.params;
  }
}

// Numbers go out as integers, defaults included; parameters a method doesn't
// know stay behind.
TEST_F(UsageApiTest, SendsOneRequestToTheLocalCollector) {
  const std::string two = R"("series": ["cpu.user", "disk.util@sda"])";
  const std::string two_sent = R"("series":["cpu.user","disk.util@sda"])";
  const struct {
    APIHandler handler;
    std::string params;
    std::string sent;
  } cases[] = {
      {usage_catalog_v1, "{}", R"({"request":"catalog"})"},
      {usage_catalog_v1, R"({"series": 5, "since": "x"})", R"({"request":"catalog"})"},
      {usage_realtime_v1, "{" + two + "}",
       R"({"request":"realtime",)" + two_sent + R"(,"since":0})"},
      {usage_realtime_v1, "{" + two + R"(, "since": 1795000000.0, "to": "x"})",
       R"({"request":"realtime",)" + two_sent + R"(,"since":1795000000})"},
      {usage_realtime_v1, "{\"series\": " + Ids(64, 256) + "}",
       R"({"request":"realtime","series":)" + Ids(64, 256) + R"(,"since":0})"},
      {usage_history_v1, "{" + two + R"(, "from": 0, "to": 1})",
       R"({"from":0,"points":600,"request":"history",)" + two_sent + R"(,"to":1})"},
      {usage_history_v1, "{" + two + R"(, "from": 1795000000, "to": 1795086400, "points": 1})",
       R"({"from":1795000000,"points":1,"request":"history",)" + two_sent + R"(,"to":1795086400})"},
      {usage_history_v1, "{" + two + R"(, "from": 5, "to": 6.0, "points": 10000})",
       R"({"from":5,"points":10000,"request":"history",)" + two_sent + R"(,"to":6})"},
      {usage_history_v1, "{" + two + R"(, "from": 5, "to": 1099511627776})",
       R"({"from":5,"points":600,"request":"history",)" + two_sent + R"(,"to":1099511627776})"},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    kova_fake::QueueExchange({0, 0, ParseJson(kOk)});
    const KOVA::APIResponse response = CallHandler(c.handler, c.params);
    EXPECT_EQ(response.GetState(), KOVA::APIResponse::State::kSuccess) << c.params;
    EXPECT_THAT(kova_fake::Calls(), ElementsAre("Transmit localhost " + c.sent)) << c.params;
  }
}

TEST_F(UsageApiTest, AnswersTheCollectorsDataUnchanged) {
  const struct {
    const char* reply;
    const char* data;
  } cases[] = {
      {R"({"success": true, "data": {"interval": 1, "series": [{"id": "cpu.user",
          "times": [1795000000], "values": [12.5]}], "unknown": ["net.rx_bytes@eth9"]}})",
       R"({"interval": 1, "series": [{"id": "cpu.user", "times": [1795000000],
           "values": [12.5]}], "unknown": ["net.rx_bytes@eth9"]})"},
      {R"({"success": true})", "null"},
      {R"({"success": true, "data": [1, "two"], "extra": 3})", R"([1, "two"])"},
  };
  for (APIHandler handler : {usage_catalog_v1, usage_realtime_v1, usage_history_v1}) {
    for (const auto& c : cases) {
      kova_fake::Reset();
      kova_fake::QueueExchange({0, 0, ParseJson(c.reply)});
      const KOVA::APIResponse response =
          CallHandler(handler, R"({"series": ["cpu.user"], "from": 1, "to": 2})");
      EXPECT_EQ(response.GetSettleCount(), 1) << c.reply;
      EXPECT_EQ(response.GetState(), KOVA::APIResponse::State::kSuccess) << c.reply;
      EXPECT_EQ(response.GetData(), ParseJson(c.data)) << c.reply;
    }
  }
}

TEST_F(UsageApiTest, MapsEveryFailureOntoTheModulesErrors) {
  const struct {
    bool queued;  // false: no collector at all
    int transmit;
    int get;
    const char* reply;
    int code;
    const char* key;
    const char* reason;  // "": none
  } cases[] = {
      {false, 0, 0, "null", 6201, "collector_unavailable", ""},
      {true, -1, 0, R"({"success": true})", 6201, "collector_unavailable", ""},
      {true, 0, -1, R"({"success": true})", 6201, "collector_unavailable", ""},
      {true, 0, 0, R"([true])", 6201, "collector_unavailable", ""},
      {true, 0, 0, "{}", 6201, "collector_unavailable", ""},
      {true, 0, 0, R"({"success": "true", "data": 1})", 6201, "collector_unavailable", ""},
      {true, 0, 0, R"({"success": false, "error": {"code": "history_off", "message": "off"}})",
       6202, "history_off", "off"},
      {true, 0, 0,
       R"({"success": false, "error": {"code": "database_unavailable", "message": "gone"}})", 6203,
       "database_unavailable", "gone"},
      {true, 0, 0, R"({"success": false, "error": {"code": "bad_request", "message": "bad"}})",
       6204, "collector_failed", "bad"},
      {true, 0, 0, R"({"success": false, "error": {"code": "internal"}})", 6204, "collector_failed",
       ""},
      {true, 0, 0, R"({"success": false, "error": {"code": 6202, "message": 5}})", 6204,
       "collector_failed", ""},
      {true, 0, 0, R"({"success": false, "data": {"now": 1}})", 6204, "collector_failed", ""},
  };
  for (APIHandler handler : {usage_catalog_v1, usage_realtime_v1, usage_history_v1}) {
    for (const auto& c : cases) {
      kova_fake::Reset();
      for (const char* key :
           {"collector_unavailable", "history_off", "database_unavailable", "collector_failed"}) {
        kova_fake::SetText("usage", key, std::string("text of ") + key);
      }
      if (c.queued) kova_fake::QueueExchange({c.transmit, c.get, ParseJson(c.reply)});
      const KOVA::APIResponse response =
          CallHandler(handler, R"({"series": ["cpu.user"], "from": 1, "to": 2})");
      Json::Value expected;
      expected["err_msg"] = std::string("text of ") + c.key;
      expected["err_session"] = "usage";
      expected["err_key"] = c.key;
      if (*c.reason != '\0') expected["reason"] = c.reason;
      EXPECT_EQ(response.GetSettleCount(), 1) << c.reply;
      EXPECT_EQ(response.GetErrorCode(), c.code) << c.reply;
      EXPECT_EQ(response.GetData(), expected) << c.reply;
      EXPECT_EQ(kova_fake::Calls().size(), 1u) << c.reply;
    }
  }
}

}  // namespace
