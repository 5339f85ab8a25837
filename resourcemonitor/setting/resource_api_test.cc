#include "setting/resource_api.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <climits>
#include <optional>

#include "fake/host_call.h"
#include "fake/kova_fake.h"
#include "kova/conf.h"

namespace {

using kova_fake::CallHandler;
using kova_fake::ParseJson;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

constexpr char kConf[] = "/etc/kovainfo.conf";
constexpr char kGetHistory[] = "QLIBCFileGetKeyValue /etc/kovainfo.conf resourcemonitor_history";
constexpr char kReload[] = R"(Transmit localhost {"request":"reload"})";

class SettingTest : public ::testing::Test {
 protected:
  void SetUp() override { kova_fake::Reset(); }

  static void QueueReply(const char* reply) { kova_fake::QueueExchange({0, 0, ParseJson(reply)}); }
};

void ExpectError(const KOVA::APIResponse& response, int code, int line, const char* msg,
                 const char* session, const char* key) {
  EXPECT_EQ(response.GetSettleCount(), 1);
  EXPECT_EQ(response.GetState(), KOVA::APIResponse::State::kError);
  EXPECT_EQ(response.GetErrorCode(), code);
  Json::Value expected;
  expected["err_line"] = line;
  expected["err_msg"] = msg;
  expected["err_session"] = session;
  expected["err_key"] = key;
  EXPECT_EQ(response.GetData(), expected);
}

void ExpectSuccess(const KOVA::APIResponse& response) {
  EXPECT_EQ(response.GetSettleCount(), 1);
  EXPECT_EQ(response.GetState(), KOVA::APIResponse::State::kSuccess) << response.GetData();
}

TEST_F(SettingTest, GetReadsDurationAsLeadingIntegerOfAtLeast15) {
  const struct {
    std::optional<std::string> stored;
    int duration;
  } cases[] = {
      {std::nullopt, 15}, {"", 15},    {"14", 15},         {"0", 15},          {"-5", 15},
      {"abc", 15},        {"15", 15},  {"16", 16},         {"45", 45},         {"90abc", 90},
      {"  30", 30},       {"+20", 20}, {"100000", 100000}, {"4294967312", 16},  // narrowed to 32
                                                                                // bits
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    if (c.stored) kova_fake::SetConf(kConf, "resourcemonitor_realtime_max", *c.stored);
    KOVA::APIResponse response = CallHandler(get_v1);
    ExpectSuccess(response);
    EXPECT_EQ(response.GetData()["duration"], c.duration) << c.stored.value_or("(absent)");
  }
}

TEST_F(SettingTest, GetReportsHistoryOnlyForExactYesWithDatabaseRunning) {
  const struct {
    std::optional<std::string> stored;
    bool database_running;
    bool enabled;
    bool database_asked;
  } cases[] = {
      {std::nullopt, true, false, false}, {"yes", true, true, true},   {"yes", false, false, true},
      {"Yes", true, false, false},        {"YES", true, false, false}, {"yes ", true, false, false},
      {"no", true, false, false},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    if (c.stored) kova_fake::SetConf(kConf, "resourcemonitor_history", *c.stored);
    kova_fake::SetServiceRunning("pgsql", c.database_running);
    KOVA::APIResponse response = CallHandler(get_v1);
    ExpectSuccess(response);
    const std::string label = c.stored.value_or("(absent)");
    EXPECT_EQ(response.GetData()["enable_history"], c.enabled) << label;
    const auto& calls = kova_fake::Calls();
    EXPECT_EQ(std::count(calls.begin(), calls.end(), "QLIBServiceIsRunning pgsql"),
              c.database_asked ? 1 : 0)
        << label;
  }
}

TEST_F(SettingTest, GetReportsEventsForExactYesWithoutAskingTheDaemon) {
  const struct {
    std::optional<std::string> stored;
    bool enabled;
  } cases[] = {{std::nullopt, false}, {"yes", true}, {"no", false}, {"Yes", false}};
  for (const auto& c : cases) {
    kova_fake::Reset();
    if (c.stored) kova_fake::SetConf(kConf, "resourcemonitor_performance_event", *c.stored);
    KOVA::APIResponse response = CallHandler(get_v1);
    ExpectSuccess(response);
    EXPECT_EQ(response.GetData()["enable_event"], c.enabled) << c.stored.value_or("(absent)");
    EXPECT_THAT(kova_fake::Calls(),
                ::testing::Not(::testing::Contains("QLIBServiceIsRunning kovaperfeventd")));
  }
  EXPECT_EQ(CallHandler(get_v1).GetData(), ParseJson(R"({"duration": 15, "enable_history": false,
                                                         "enable_event": false})"));
}

TEST_F(SettingTest, GetStopsAtTheFirstKeyItCannotRead) {
  const struct {
    const char* key;
    int line;
    size_t reads;
  } cases[] = {
      {"resourcemonitor_realtime_max", 68, 1},
      {"resourcemonitor_history", 79, 2},
      {"resourcemonitor_performance_event", 91, 3},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    kova_fake::FailConfRead(kConf, -1, c.key);
    KOVA::APIResponse response = CallHandler(get_v1);
    EXPECT_EQ(response.GetErrorCode(), 6102) << c.key;
    EXPECT_EQ(response.GetData()["err_line"], c.line) << c.key;
    EXPECT_EQ(response.GetData()["err_msg"], "Get Conf Failed") << c.key;
    EXPECT_EQ(kova_fake::Calls().size(), c.reads) << c.key;
  }
}

// The record is never reset: each failure overwrites only what it names.
TEST_F(SettingTest, FailuresCarryOverWhatTheyDoNotOverwrite) {
  kova_fake::SetVolumeLookup("pgsql", 1, "/volume1");
  ExpectError(CallHandler(set_v1, R"({"enable_history": true})"), 6104, 143, "PGSQL Disable",
              "error", "db_connect_fail");

  ExpectSuccess(CallHandler(get_v1));

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

TEST_F(SettingTest, SetWithoutParametersChangesNothing) {
  KOVA::APIResponse response = CallHandler(set_v1);
  ExpectSuccess(response);
  EXPECT_TRUE(response.GetData().isNull());
  EXPECT_THAT(kova_fake::Calls(), IsEmpty());
}

TEST_F(SettingTest, SetRejectsParametersOfTheWrongJsonType) {
  const char* const switches[] = {"null", "1", "0", "1.0", R"("true")", "[]", "{}", "[true]"};
  const char* const durations[] = {"null",         "true",       R"("60")",     "60.5", "[]",
                                   R"({"d": 60})", "2147483648", "-2147483649", "1e300"};
  struct Case {
    std::string param;
    std::string value;
  };
  std::vector<Case> cases;
  for (const char* value : switches) {
    cases.push_back({"enable_history", value});
    cases.push_back({"enable_event", value});
  }
  for (const char* value : durations) cases.push_back({"duration", value});
  for (const auto& c : cases) {
    kova_fake::Reset();
    KOVA::APIResponse response = CallHandler(set_v1, "{\"" + c.param + "\": " + c.value + "}");
    EXPECT_EQ(response.GetErrorCode(), 6101) << c.param << " " << c.value;
    EXPECT_THAT(kova_fake::Calls(), IsEmpty()) << c.param << " " << c.value;
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
      {"-5", "15"},
      {"0", "15"},
      {"60.0", "60"},  // integral reals pass the JSON library's integer test
      {std::to_string(INT_MIN), "15"},
      {std::to_string(INT_MAX), "120"},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    ExpectSuccess(CallHandler(set_v1, "{\"duration\": " + c.duration + "}"));
    EXPECT_EQ(kova_fake::GetConf(kConf, "resourcemonitor_realtime_max"), c.stored) << c.duration;
  }
}

TEST_F(SettingTest, SetHistoryWritesAndReloadsOnlyOnChange) {
  const struct {
    const char* name;
    std::optional<std::string> stored;
    bool database_running;
    const char* params;
    std::vector<std::string> calls;
  } cases[] = {
      {"already on",
       "yes",
       true,
       R"({"enable_history": true})",
       {"QLIBServiceIsRunning pgsql", kGetHistory}},
      {"absent counts as off", std::nullopt, true, R"({"enable_history": false})", {kGetHistory}},
      {"off with database down",
       "yes",
       false,
       R"({"enable_history": false})",
       {kGetHistory, "QLIBCINFOSetKeyValue resourcemonitor_history=no", kReload}},
      {"other case counts as off",
       "Yes",
       true,
       R"({"enable_history": true})",
       {"QLIBServiceIsRunning pgsql", kGetHistory,
        "QLIBCINFOSetKeyValue resourcemonitor_history=yes", kReload}},
      {"goes on to the next steps",
       "no",
       true,
       R"({"enable_history": true, "enable_event": false, "duration": 30})",
       {"QLIBServiceIsRunning pgsql", kGetHistory,
        "QLIBCINFOSetKeyValue resourcemonitor_history=yes", kReload,
        "QLIBCINFOSetKeyValue resourcemonitor_performance_event=no",
        "QLIBServiceStop kovaperfeventd", "QLIBCINFOSetKeyValue resourcemonitor_realtime_max=30"}},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    if (c.stored) kova_fake::SetConf(kConf, "resourcemonitor_history", *c.stored);
    kova_fake::SetServiceRunning("pgsql", c.database_running);
    QueueReply(R"({"success": true})");
    ExpectSuccess(CallHandler(set_v1, c.params));
    EXPECT_THAT(kova_fake::Calls(), ElementsAreArray(c.calls)) << c.name;
  }
}

TEST_F(SettingTest, SetHistoryOnFailsBeforeAnyWriteWhileTheDatabaseIsDown) {
  const struct {
    int lookup;
    int code;
    int line;
  } cases[] = {{1, 6104, 143}, {0, 6103, 139}, {-1, 6103, 139}, {2, 6103, 139}};
  for (const auto& c : cases) {
    kova_fake::Reset();
    kova_fake::SetVolumeLookup("pgsql", c.lookup, "/volume1");
    KOVA::APIResponse response =
        CallHandler(set_v1, R"({"enable_history": true, "enable_event": true, "duration": 60})");
    EXPECT_EQ(response.GetErrorCode(), c.code) << c.lookup;
    EXPECT_EQ(response.GetData()["err_line"], c.line) << c.lookup;
    EXPECT_THAT(kova_fake::Calls(),
                ElementsAre("QLIBServiceIsRunning pgsql", "KOVAShareServiceVolumeGetbyLink pgsql"));
  }
}

TEST_F(SettingTest, SetHistoryFailsWhenTheSettingCannotBeReadOrWritten) {
  kova_fake::SetServiceRunning("pgsql", true);
  kova_fake::FailConfRead(kConf, -2, "resourcemonitor_history");
  EXPECT_EQ(CallHandler(set_v1, R"({"enable_history": true})").GetData()["err_line"], 151);

  kova_fake::Reset();
  kova_fake::SetServiceRunning("pgsql", true);
  kova_fake::FailConfWrite("resourcemonitor_history", -1);
  KOVA::APIResponse response = CallHandler(set_v1, R"({"enable_history": true})");
  EXPECT_EQ(response.GetErrorCode(), 6102);
  EXPECT_EQ(response.GetData()["err_line"], 164);
  EXPECT_EQ(response.GetData()["err_msg"], "Set Conf Failed");
  kova_fake::SetConf(kConf, "resourcemonitor_history", "yes");
  EXPECT_EQ(CallHandler(set_v1, R"({"enable_history": false})").GetData()["err_line"], 170);
}

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
    // The key stays written whatever the collector says.
    EXPECT_EQ(kova_fake::GetConf(kConf, "resourcemonitor_history"), "yes");
    if (c.line == 0) {
      ExpectSuccess(response);
      continue;
    }
    EXPECT_EQ(response.GetErrorCode(), 6105) << c.msg;
    EXPECT_EQ(response.GetData()["err_line"], c.line) << c.msg;
    EXPECT_EQ(response.GetData()["err_msg"], c.msg);
  }
}

TEST_F(SettingTest, SetEventRewritesTheKeyAndStartsOrStopsTheDaemonEveryTime) {
  const struct {
    const char* params;
    const char* failing_key;        // key whose write fails, or null
    const char* failing_operation;  // daemon operation that fails, or null
    int line;                       // 0: success
    const char* msg;
    std::vector<std::string> calls;
  } cases[] = {
      {R"({"enable_event": true})",
       nullptr,
       nullptr,
       0,
       "",
       {"QLIBCINFOSetKeyValue resourcemonitor_performance_event=yes",
        "QLIBServiceStart kovaperfeventd"}},
      {R"({"enable_event": false})",
       nullptr,
       nullptr,
       0,
       "",
       {"QLIBCINFOSetKeyValue resourcemonitor_performance_event=no",
        "QLIBServiceStop kovaperfeventd"}},
      {R"({"enable_event": true, "duration": 60})",
       "resourcemonitor_performance_event",
       nullptr,
       207,
       "Set run key failed",
       {"QLIBCINFOSetKeyValue resourcemonitor_performance_event=yes"}},
      {R"({"enable_event": true})",
       nullptr,
       "start",
       212,
       "Stop kovaperfeventd service failed",
       {"QLIBCINFOSetKeyValue resourcemonitor_performance_event=yes",
        "QLIBServiceStart kovaperfeventd"}},
      {R"({"enable_event": false})",
       "resourcemonitor_performance_event",
       nullptr,
       217,
       "Set run key failed",
       {"QLIBCINFOSetKeyValue resourcemonitor_performance_event=no"}},
      {R"({"enable_event": false, "duration": 60})",
       nullptr,
       "stop",
       222,
       "Stop kovaperfeventd service failed",
       {"QLIBCINFOSetKeyValue resourcemonitor_performance_event=no",
        "QLIBServiceStop kovaperfeventd"}},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    if (c.failing_key) kova_fake::FailConfWrite(c.failing_key, -1);
    if (c.failing_operation) kova_fake::FailService("kovaperfeventd", c.failing_operation, -1);
    KOVA::APIResponse response = CallHandler(set_v1, c.params);
    EXPECT_THAT(kova_fake::Calls(), ElementsAreArray(c.calls)) << c.params;
    if (c.line == 0) {
      ExpectSuccess(response);
      continue;
    }
    EXPECT_EQ(response.GetErrorCode(), 6102) << c.params;
    EXPECT_EQ(response.GetData()["err_line"], c.line) << c.params;
    EXPECT_EQ(response.GetData()["err_msg"], c.msg) << c.params;
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
