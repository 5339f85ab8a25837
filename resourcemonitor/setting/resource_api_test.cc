#include "setting/resource_api.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <climits>
#include <functional>
#include <optional>

#include "fake/kova_fake.h"
#include "test_support/host_call.h"

namespace {

using kova_test::CallHandler;
using kova_test::ParseJson;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

constexpr char kConf[] = "/etc/kovainfo.conf";
constexpr char kReload[] = R"(Transmit localhost {"request":"reload"})";
constexpr char kStart[] = "QLIBServiceStart kovaperfeventd";
constexpr char kStop[] = "QLIBServiceStop kovaperfeventd";

class SettingTest : public ::testing::Test {
 protected:
  void SetUp() override { kova_fake::Reset(); }
};

// What a write did to the services: daemon starts and stops and collector reloads.
std::vector<std::string> ServiceEffects() {
  std::vector<std::string> effects;
  for (const std::string& call : kova_fake::Calls()) {
    if (call == kStart || call == kStop || call == kReload) effects.push_back(call);
  }
  return effects;
}

void QueueReply(const char* reply) { kova_fake::QueueExchange({0, 0, ParseJson(reply)}); }

void ExpectError(const KOVA::APIResponse& response, int code, int line, const char* msg,
                 const char* session, const char* key) {
  EXPECT_EQ(response.GetSettleCount(), 1);
  EXPECT_EQ(response.GetErrorCode(), code);
  Json::Value expected;
  expected["err_line"] = line;
  expected["err_msg"] = msg;
  expected["err_session"] = session;
  expected["err_key"] = key;
  EXPECT_EQ(response.GetData(), expected);
}

TEST_F(SettingTest, GetReadsDurationAsLeadingIntegerOfAtLeast15) {
  const struct {
    std::optional<std::string> stored;
    int duration;
  } cases[] = {
      {std::nullopt, 15}, {"", 15},           {"14", 15},   {"15", 15},
      {"16", 16},         {"90abc", 90},      {"  30", 30}, {"+20", 20},
      {"100000", 100000}, {"4294967312", 16},  // narrowed to 32 bits
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    if (c.stored) kova_fake::SetConf(kConf, "resourcemonitor_realtime_max", *c.stored);
    KOVA::APIResponse response = CallHandler(get_v1);
    EXPECT_EQ(response.GetSettleCount(), 1);
    EXPECT_EQ(response.GetData()["duration"], c.duration) << c.stored.value_or("(absent)");
  }
}

// History counts only while its database runs; events count whatever the daemon does.
TEST_F(SettingTest, GetReportsSwitchesOnlyForExactYes) {
  const struct {
    std::optional<std::string> stored;
    bool database_running;
    bool on;
  } cases[] = {
      {std::nullopt, true, false}, {"yes", true, true},  {"yes", false, false},
      {"Yes", true, false},        {"YES", true, false}, {"yes ", true, false},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    if (c.stored) kova_fake::SetConf(kConf, "resourcemonitor_history", *c.stored);
    if (c.stored) kova_fake::SetConf(kConf, "resourcemonitor_performance_event", *c.stored);
    kova_fake::SetServiceRunning("pgsql", c.database_running);
    KOVA::APIResponse response = CallHandler(get_v1);
    const std::string label = c.stored.value_or("(absent)") + (c.database_running ? "" : ", down");
    EXPECT_EQ(response.GetData()["enable_history"], c.on) << label;
    EXPECT_EQ(response.GetData()["enable_event"], c.stored == "yes") << label;
  }
}

TEST_F(SettingTest, GetStopsAtTheFirstKeyItCannotRead) {
  const struct {
    const char* key;
    int line;
  } cases[] = {
      {"resourcemonitor_realtime_max", 68},
      {"resourcemonitor_history", 79},
      {"resourcemonitor_performance_event", 91},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    kova_fake::FailConfRead(kConf, -1, c.key);
    KOVA::APIResponse response = CallHandler(get_v1);
    EXPECT_EQ(response.GetErrorCode(), 6102) << c.key;
    EXPECT_EQ(response.GetData()["err_line"], c.line) << c.key;
    EXPECT_EQ(response.GetData()["err_msg"], "Get Conf Failed") << c.key;
  }
}

// The record is never reset: each failure overwrites only what it names, and
// successes change nothing.
TEST_F(SettingTest, FailuresCarryOverWhatTheyDoNotOverwrite) {
  kova_fake::SetVolumeLookup("pgsql", 1, "/volume1");
  ExpectError(CallHandler(set_v1, R"({"enable_history": true})"), 6104, 143, "PGSQL Disable",
              "error", "db_connect_fail");
  EXPECT_EQ(CallHandler(get_v1).GetState(), KOVA::APIResponse::State::kSuccess);

  kova_fake::FailConfRead(kConf, -1, "resourcemonitor_realtime_max");
  ExpectError(CallHandler(get_v1), 6102, 68, "Get Conf Failed", "error", "db_connect_fail");
  ExpectError(CallHandler(set_v1, R"({"duration": "60"})"), 6101, 68, "Get Conf Failed", "error",
              "db_connect_fail");

  // A failed duration write records nothing: the answer repeats the record.
  kova_fake::FailConfWrite("resourcemonitor_realtime_max", -1);
  ExpectError(CallHandler(set_v1, R"({"duration": 60})"), 6101, 68, "Get Conf Failed", "error",
              "db_connect_fail");

  kova_fake::SetVolumeLookup("pgsql", 0, "");
  ExpectError(CallHandler(set_v1, R"({"enable_history": true})"), 6103, 139, "Not Found Volumes.",
              "error", "volume_no_volumes");
}

TEST_F(SettingTest, SetRejectsParametersOfTheWrongJsonType) {
  const char* const switches[] = {"null", "1", "0", "1.0", R"("true")", "[]", "{}", "[true]"};
  const char* const durations[] = {"null",         "true",       R"("60")",     "60.5", "[]",
                                   R"({"d": 60})", "2147483648", "-2147483649", "1e300"};
  std::vector<std::string> requests;
  for (const char* value : switches) {
    requests.push_back(std::string(R"({"enable_history": )") + value + "}");
    requests.push_back(std::string(R"({"enable_event": )") + value + "}");
  }
  for (const char* value : durations)
    requests.push_back(std::string(R"({"duration": )") + value + "}");
  for (const std::string& request : requests) {
    kova_fake::Reset();
    EXPECT_EQ(CallHandler(set_v1, request).GetErrorCode(), 6101) << request;
    EXPECT_THAT(kova_fake::Calls(), IsEmpty()) << request;
  }
}

TEST_F(SettingTest, SetStoresTheStepThatADurationMapsOnto) {
  const struct {
    std::string duration;
    const char* stored;
  } cases[] = {
      {"29", "15"},
      {"30", "30"},
      {"59", "30"},
      {"60", "60"},
      {"119", "60"},
      {"120", "120"},
      {"100000", "120"},
      {"60.0", "60"},  // integral reals pass the JSON library's integer test
      {std::to_string(INT_MIN), "15"},
      {std::to_string(INT_MAX), "120"},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    EXPECT_EQ(CallHandler(set_v1, "{\"duration\": " + c.duration + "}").GetState(),
              KOVA::APIResponse::State::kSuccess);
    EXPECT_EQ(kova_fake::GetConf(kConf, "resourcemonitor_realtime_max"), c.stored) << c.duration;
  }
}

// History is written and announced only when it changes; the event switch is
// written and the daemon started or stopped on every request.
TEST_F(SettingTest, SetWritesTheSwitchesAndActsOnTheServices) {
  const struct {
    std::optional<std::string> stored_history;
    bool database_running;
    const char* params;
    std::optional<std::string> history, event;
    std::vector<std::string> effects;
  } cases[] = {
      {"yes", true, "{}", "yes", std::nullopt, {}},
      {"yes", true, R"({"enable_history": true, "enable_event": true})", "yes", "yes", {kStart}},
      {std::nullopt, true, R"({"enable_history": false})", std::nullopt, std::nullopt, {}},
      {"yes", false, R"({"enable_history": false})", "no", std::nullopt, {kReload}},
      {"Yes", true, R"({"enable_history": true})", "yes", std::nullopt, {kReload}},
      {"no",
       true,
       R"({"enable_history": true, "enable_event": false})",
       "yes",
       "no",
       {kReload, kStop}},
      {"no", true, R"({"enable_event": true})", "no", "yes", {kStart}},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    if (c.stored_history) kova_fake::SetConf(kConf, "resourcemonitor_history", *c.stored_history);
    kova_fake::SetServiceRunning("pgsql", c.database_running);
    QueueReply(R"({"success": true})");
    KOVA::APIResponse response = CallHandler(set_v1, c.params);
    EXPECT_EQ(response.GetState(), KOVA::APIResponse::State::kSuccess) << c.params;
    EXPECT_TRUE(response.GetData().isNull());
    EXPECT_EQ(kova_fake::GetConf(kConf, "resourcemonitor_history"), c.history) << c.params;
    EXPECT_EQ(kova_fake::GetConf(kConf, "resourcemonitor_performance_event"), c.event) << c.params;
    EXPECT_THAT(ServiceEffects(), ElementsAreArray(c.effects)) << c.params;
  }
}

TEST_F(SettingTest, SetStopsAtEachFailurePointWithItsLineAndMessage) {
  using kova_fake::FailConfWrite;
  using kova_fake::FailService;
  const struct {
    int line;
    const char* msg;
    int code;
    const char* params;
    std::function<void()> arrange;
  } cases[] = {
      {143, "PGSQL Disable", 6104, R"({"enable_history": true, "enable_event": true})",
       [] { kova_fake::SetVolumeLookup("pgsql", 1, "/volume1"); }},
      {139, "Not Found Volumes.", 6103, R"({"enable_history": true, "duration": 60})",
       [] { kova_fake::SetVolumeLookup("pgsql", -1, ""); }},
      {139, "Not Found Volumes.", 6103, R"({"enable_history": true})",
       [] { kova_fake::SetVolumeLookup("pgsql", 2, "/volume1"); }},
      {151, "Get Conf Failed", 6102, R"({"enable_history": false})",
       [] { kova_fake::FailConfRead(kConf, -2, "resourcemonitor_history"); }},
      {164, "Set Conf Failed", 6102, R"({"enable_history": true})",
       [] {
         kova_fake::SetServiceRunning("pgsql", true);
         FailConfWrite("resourcemonitor_history", -1);
       }},
      {170, "Set Conf Failed", 6102, R"({"enable_history": false})",
       [] {
         kova_fake::SetConf(kConf, "resourcemonitor_history", "yes");
         FailConfWrite("resourcemonitor_history", -1);
       }},
      {207, "Set run key failed", 6102, R"({"enable_event": true})",
       [] { FailConfWrite("resourcemonitor_performance_event", -1); }},
      {212, "Stop kovaperfeventd service failed", 6102, R"({"enable_event": true, "duration": 60})",
       [] { FailService("kovaperfeventd", "start", -1); }},
      {217, "Set run key failed", 6102, R"({"enable_event": false})",
       [] { FailConfWrite("resourcemonitor_performance_event", -1); }},
      {222, "Stop kovaperfeventd service failed", 6102, R"({"enable_event": false})",
       [] { FailService("kovaperfeventd", "stop", -1); }},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    c.arrange();
    KOVA::APIResponse response = CallHandler(set_v1, c.params);
    EXPECT_EQ(response.GetErrorCode(), c.code) << c.line;
    EXPECT_EQ(response.GetData()["err_line"], c.line);
    EXPECT_EQ(response.GetData()["err_msg"], c.msg) << c.line;
  }
}

// The collector has reloaded only when it answers a JSON true; the key stays
// written whatever it answers.
TEST_F(SettingTest, SetHistoryJudgesTheCollectorsReplyByAJsonBoolean) {
  const struct {
    kova_fake::Exchange exchange;
    int line;  // 0: the reload succeeded
    const char* msg;
  } cases[] = {
      {{0, 0, ParseJson(R"({"success": true})")}, 0, ""},
      {{-1, 0, Json::Value()}, 113, "Transmition failed."},
      {{0, -1, Json::Value()}, 119, "Transmition Get Json Failed"},
      {{0, 0, ParseJson(R"({"success": "true"})")}, 125, "Get failed reload status"},
      {{0, 0, ParseJson(R"({"success": 1})")}, 125, "Get failed reload status"},
      {{0, 0, ParseJson(R"({"success": false})")}, 125, "Get failed reload status"},
      {{0, 0, ParseJson(R"({})")}, 125, "Get failed reload status"},
      {{0, 0, ParseJson(R"([true])")}, 125, "Get failed reload status"},
      {{0, 0, Json::Value()}, 125, "Get failed reload status"},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    kova_fake::SetServiceRunning("pgsql", true);
    kova_fake::QueueExchange(c.exchange);
    KOVA::APIResponse response = CallHandler(set_v1, R"({"enable_history": true})");
    EXPECT_EQ(kova_fake::GetConf(kConf, "resourcemonitor_history"), "yes");
    EXPECT_EQ(response.GetErrorCode(), c.line == 0 ? 0 : 6105) << c.msg;
    if (c.line == 0) continue;
    EXPECT_EQ(response.GetData()["err_line"], c.line) << c.msg;
    EXPECT_EQ(response.GetData()["err_msg"], c.msg);
  }
}

TEST_F(SettingTest, SetKeepsWhatEarlierStepsWroteWhenALaterStepFails) {
  kova_fake::SetServiceRunning("pgsql", true);
  QueueReply(R"({"success": true})");
  KOVA::APIResponse response =
      CallHandler(set_v1, R"({"enable_history": true, "enable_event": true, "duration": "60"})");
  EXPECT_EQ(response.GetErrorCode(), 6101);
  EXPECT_EQ(kova_fake::GetConf(kConf, "resourcemonitor_history"), "yes");
  EXPECT_EQ(kova_fake::GetConf(kConf, "resourcemonitor_performance_event"), "yes");
  EXPECT_EQ(kova_fake::GetConf(kConf, "resourcemonitor_realtime_max"), std::nullopt);
}

}  // namespace
