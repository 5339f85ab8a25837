#include "statd/protocol.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <vector>

#include "test_support/host_call.h"
#include "test_support/test_root.h"

namespace statd {
namespace {

using kova_test::ParseJson;

// A history that answers from memory, or fails as the database would.
class FakeHistory : public HistorySink {
 public:
  void Configure(const HistorySettings& settings) override { settings_ = settings; }
  void Add(std::vector<MinuteRow> rows) override {
    for (MinuteRow& row : rows) added.push_back(std::move(row));
  }
  bool Query(const std::vector<std::string>& series, int64_t from, int64_t to, int points,
             HistoryAnswer& answer, std::string& error) override {
    asked = {from, to, points};
    if (!reachable) {
      error = "the history database can't be reached";
      return false;
    }
    answer.step = 60;
    answer.source = "minute";
    for (const std::string& id : series) answer.series.push_back({id, {from}, {1.5}, {1}, {2}});
    return true;
  }
  HistoryState State() const override { return HistoryState::kWaiting; }

  HistorySettings settings_;
  std::vector<MinuteRow> added;
  std::vector<int64_t> asked;
  bool reachable = true;
};

class ProtocolTest : public ::testing::Test {
 protected:
  void Settings(const std::string& conf) {
    root_.Write("/etc/kovainfo.conf", conf);
    std::string error;
    ASSERT_TRUE(collector_.Reload(error)) << error;
  }
  Json::Value Ask(const std::string& line) {
    const std::string answer = Answer(line, collector_);
    EXPECT_EQ(answer.find('\n'), std::string::npos);
    return ParseJson(answer);
  }
  static SeriesValue Value(const std::string& id, double value, Labels labels = {}) {
    return SeriesValue{SeriesInfo{id, id.substr(0, id.find('@')), "B/s", std::move(labels)}, value};
  }

  kova_test::TestRoot root_;
  FakeHistory history_;
  Collector collector_{history_, 1};
};

TEST_F(ProtocolTest, BadRequestsGetAClearErrorAndChangeNothing) {
  Settings("resourcemonitor_history=\"yes\"\n");
  const struct {
    std::string line;
    const char* code;
  } cases[] = {
      {"", "bad_request"},
      {"not json", "bad_request"},
      {"[\"catalog\"]", "bad_request"},
      {"{\"request\":\"catalog\"} trailing", "bad_request"},
      {"{}", "bad_request"},
      {"{\"request\":7}", "bad_request"},
      {"{\"request\":\"shutdown\"}", "bad_request"},
      {"{\"request\":\"realtime\"}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[]}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":\"cpu.user\"}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[1]}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[\"\"]}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[\"a\\u0001\"]}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[\"\xc3\"]}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[\"\xed\xa0\x80\"]}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[\"a\"],\"since\":\"1\"}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[\"a\"],\"since\":1.5}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[\"a\"],\"since\":-1}", "bad_request"},
      {"{\"request\":\"realtime\",\"series\":[\"a\"],\"since\":1e300}", "bad_request"},
      {"{\"request\":\"history\",\"series\":[\"a\"],\"to\":2}", "bad_request"},
      {"{\"request\":\"history\",\"series\":[\"a\"],\"from\":2,\"to\":2}", "bad_request"},
      {"{\"request\":\"history\",\"series\":[\"a\"],\"from\":1,\"to\":2,\"points\":0}",
       "bad_request"},
      {"{\"request\":\"history\",\"series\":[\"a\"],\"from\":1,\"to\":2,\"points\":10001}",
       "bad_request"},
      {std::string(70000, ' '), "too_large"},
      {std::string(100, '[') + std::string(100, ']'), "bad_request"},
  };
  std::string many = "{\"request\":\"realtime\",\"series\":[";
  for (int i = 0; i < 65; ++i) many += (i ? ",\"s" : "\"s") + std::to_string(i) + "\"";
  for (const auto& [line, code] : cases) {
    const Json::Value answer = Ask(line);
    EXPECT_EQ(answer["success"], false) << line;
    EXPECT_EQ(answer["error"]["code"], code) << line;
    EXPECT_TRUE(answer["error"]["message"].isString()) << line;
  }
  EXPECT_EQ(Ask(many + "]}")["error"]["code"], "bad_request");
  EXPECT_TRUE(history_.asked.empty());
}

TEST_F(ProtocolTest, RealtimeAnswersTheSamplesAfterATimeInTheOrderAsked) {
  collector_.Record(100, {Value("cpu.user", 1.5), Value("net.rx_bytes@eth0", 10)});
  collector_.Record(101, {Value("cpu.user", 2.5)});
  collector_.Record(102, {Value("cpu.user", 3.5), Value("net.rx_bytes@eth0", 30)});
  const Json::Value answer =
      Ask(R"({"request":"realtime","series":["net.rx_bytes@eth0","nope","cpu.user"],"since":100})");
  ASSERT_EQ(answer["success"], true) << answer;
  EXPECT_EQ(answer["data"], ParseJson(R"({"interval":1,"now":102,"unknown":["nope"],"series":[
                {"id":"net.rx_bytes@eth0","times":[102],"values":[30]},
                {"id":"cpu.user","times":[101,102],"values":[2.5,3.5]}]})"));
}

TEST_F(ProtocolTest, ReloadReadsTheSettingsAndTheCatalogShowsThem) {
  Settings("resourcemonitor_realtime_max=\"15\"\n");
  for (int64_t t = 1; t <= 1000; ++t) collector_.Record(t, {Value("cpu.user", 1)});
  root_.Write("/etc/kovainfo.conf",
              "resourcemonitor_realtime_max=\"30\"\nresourcemonitor_history=\"yes\"\n"
              "resourcemonitor_history_minute_days=\"7\"\n");
  EXPECT_EQ(Ask(R"({"request":"reload"})"), ParseJson(R"({"success":true})"));
  EXPECT_TRUE(history_.settings_.enabled);
  EXPECT_EQ(history_.settings_.minute_days, 7);
  EXPECT_EQ(history_.settings_.hour_days, 1827);
  collector_.Record(1001, {Value("net.rx_bytes@eth0", 5, {{"interface", "eth0"}})});
  // Two hours east of UTC all year.
  setenv("TZ", "Etc/GMT-2", 1);
  tzset();
  const Json::Value catalog = Ask(R"({"request":"catalog"})")["data"];
  unsetenv("TZ");
  tzset();
  EXPECT_EQ(catalog, ParseJson(R"({
      "interval":1,"realtime_minutes":30,"history":{"enabled":true,"state":"waiting"},
      "utc_offset":7200,
      "series":[{"id":"net.rx_bytes@eth0","metric":"net.rx_bytes","unit":"B/s",
                 "labels":{"interface":"eth0"}},
                {"id":"cpu.user","metric":"cpu.user","unit":"B/s","labels":{}}]})"));
  // The ring kept its samples across the change of reach.
  const Json::Value samples = Ask(R"({"request":"realtime","series":["cpu.user"]})");
  EXPECT_EQ(samples["data"]["series"][0]["times"].size(), 900u);
  // Settings that can't be read fail the reload and keep the ones before.
  std::filesystem::remove(root_.Path("/etc/kovainfo.conf"));
  std::filesystem::create_directory(root_.Path("/etc/kovainfo.conf"));
  EXPECT_EQ(Ask(R"({"request":"reload"})")["error"]["code"], "internal");
  EXPECT_TRUE(history_.settings_.enabled);
}

TEST_F(ProtocolTest, HistoryIsAskedOnlyWhileItIsOnAndItsFailureIsNamed) {
  Settings("resourcemonitor_history=\"no\"\n");
  const std::string line = R"({"request":"history","series":["cpu.user"],"from":60,"to":3600})";
  EXPECT_EQ(Ask(line)["error"]["code"], "history_off");
  Settings("resourcemonitor_history=\"yes\"\n");
  EXPECT_EQ(Ask(line)["data"], ParseJson(R"({"from":60,"to":3600,"step":60,"source":"minute",
      "series":[{"id":"cpu.user","times":[60],"avg":[1.5],"min":[1],"max":[2]}]})"));
  EXPECT_EQ(history_.asked, (std::vector<int64_t>{60, 3600, 600}));
  history_.reachable = false;
  const Json::Value failed = Ask(line);
  EXPECT_EQ(failed["error"]["code"], "database_unavailable");
  EXPECT_EQ(failed["error"]["message"], "the history database can't be reached");
}

TEST_F(ProtocolTest, MinutesGoToTheHistoryOnlyWhileItIsOn) {
  Settings("resourcemonitor_history=\"yes\"\n");
  collector_.Record(60, {Value("cpu.user", 1)});
  collector_.Record(61, {Value("cpu.user", 3)});
  collector_.Record(120, {Value("cpu.user", 5)});
  ASSERT_EQ(history_.added.size(), 1u);
  EXPECT_EQ(history_.added[0].samples, 2);
  EXPECT_DOUBLE_EQ(history_.added[0].avg, 2);
  // At a stop, the minute not yet whole goes too.
  collector_.Flush();
  ASSERT_EQ(history_.added.size(), 2u);
  EXPECT_EQ(history_.added[1].minute, 120);
  EXPECT_EQ(history_.added[1].samples, 1);
  Settings("resourcemonitor_history=\"no\"\n");
  collector_.Record(180, {Value("cpu.user", 1)});
  collector_.Record(240, {Value("cpu.user", 1)});
  collector_.Flush();
  EXPECT_EQ(history_.added.size(), 2u);
}

}  // namespace
}  // namespace statd
