#include "log/log.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <functional>
#include <string>
#include <vector>

#include "fake/host_call.h"
#include "fake/kova_fake.h"
#include "fake/run_in_child.h"
#include "kova/log.h"

namespace {

using kova_fake::CallHandler;
using kova_fake::ParseJson;
using ::testing::ElementsAre;
using ::testing::MatchesRegex;

const std::string kTime1 = KOVALogConvertTime1(1700000000);
const std::string kTime2 = KOVALogConvertTime1(1700000060);
const std::string kTime3 = KOVALogConvertTime1(1700000120);

std::string Line(const std::string& level, const std::string& time, const std::string& event) {
  return "1\t" + level + "\t" + time + "\tadmin\tkovaperfeventd\t" + event;
}

// What `body` writes to standard output.
std::string CaptureOutput(const std::function<void()>& body) {
  fflush(stdout);
  const int saved = dup(STDOUT_FILENO);
  FILE* capture = tmpfile();
  dup2(fileno(capture), STDOUT_FILENO);
  body();  // not flushed here: the handler must flush what it wrote
  dup2(saved, STDOUT_FILENO);
  close(saved);
  std::string text;
  rewind(capture);
  for (int c = fgetc(capture); c != EOF; c = fgetc(capture)) text.push_back(static_cast<char>(c));
  fclose(capture);
  return text;
}

class LogApiTest : public ::testing::Test {
 protected:
  void SetUp() override {
    kova_fake::Reset();
    kova_fake::SetLogLines({Line("Warning", kTime1, "a"), Line("Critical", kTime2, "b"),
                            Line("Warning", kTime3, "c")});
  }
};

// The events of a list page, and its total.
std::pair<std::vector<std::string>, unsigned> Page(const KOVA::APIResponse& response) {
  std::vector<std::string> events;
  for (const auto& entry : response.GetData()["logs"]) events.push_back(entry["event"].asString());
  return {events, response.GetData()["total"].asUInt()};
}

TEST_F(LogApiTest, ListPagesNewestFirst) {
  using Events = std::vector<std::string>;
  const struct {
    const char* params;
    Events events;
    unsigned total;
  } cases[] = {
      {"{}", {"c", "b", "a"}, 3},
      {R"({"offset": 1})", {"b", "a"}, 3},
      {R"({"offset": 1, "limit": 1})", {"b"}, 3},
      {R"({"offset": 2, "limit": 5})", {"a"}, 3},
      {R"({"limit": 0})", {}, 3},
      {R"({"limit": -7})", {"c", "b", "a"}, 3},
      {R"({"offset": 3})", {}, 3},
      {R"({"offset": 4})", {}, 3},
      {R"({"offset": -1, "limit": 2})", {}, 3},
      {R"({"filter": {"loglevel": "Warning"}, "limit": 1})", {"c"}, 2},
      {R"({"filter": null})", {"c", "b", "a"}, 3},
  };
  for (const auto& c : cases) {
    const KOVA::APIResponse response = CallHandler(log_list_v1, c.params);
    EXPECT_EQ(response.GetState(), KOVA::APIResponse::State::kSuccess) << c.params;
    EXPECT_EQ(Page(response), std::make_pair(c.events, c.total)) << c.params;
    EXPECT_TRUE(response.GetData()["logs"].isArray()) << c.params;
  }
}

TEST_F(LogApiTest, ListAndExportRejectUnreadableParametersWith101) {
  const struct {
    const char* params;
    bool export_reads_it;  // the export has no page bounds
  } cases[] = {
      {R"({"offset": "1"})", false},
      {R"({"limit": [1]})", false},
      {R"({"offset": 1e20})", false},
      {R"({"filter": "Warning"})", true},
      {R"({"filter": [1]})", true},
      {R"({"filter": {"loglevel": "warning"}})", true},
      {R"({"filter": {"keyword": {}}})", true},
  };
  for (const auto& c : cases) {
    std::vector<KOVA::APIResponse> responses = {CallHandler(log_list_v1, c.params)};
    if (c.export_reads_it) {
      Json::Value params = ParseJson(c.params);
      params["type"] = "csv";
      const std::string output = CaptureOutput(
          [&] { responses.push_back(CallHandler(log_export_v1, params.toStyledString())); });
      EXPECT_EQ(output, "") << c.params;
    }
    for (const auto& response : responses) {
      EXPECT_EQ(response.GetErrorCode(), 101) << c.params;
      EXPECT_TRUE(response.GetData().isNull()) << c.params;
      EXPECT_EQ(response.GetSettleCount(), 1) << c.params;
    }
  }
  EXPECT_TRUE(kova_fake::Calls().empty());
}

TEST_F(LogApiTest, ListAnswersAnUnreadableLogWithTheRecordBesideAnEmptyPage) {
  kova_fake::FailLogPath(true);
  const KOVA::APIResponse response = CallHandler(log_list_v1);
  EXPECT_EQ(response.GetErrorCode(), 6199);
  Json::Value expected = ParseJson(R"({"logs": [], "err_line": 0, "err_msg": "",
      "err_session": "", "err_key": ""})");
  expected["total"] = Json::UInt(0);  // unsigned, as on success
  EXPECT_EQ(response.GetData(), expected);
}

TEST_F(LogApiTest, ClearSucceedsAlwaysAndRunsAsRoot) {
  for (bool fails : {false, true}) {
    kova_fake::FailLogFetch(fails);  // no effect on the clear
    const KOVA::APIResponse response = CallHandler(log_clear_v1);
    EXPECT_EQ(response.GetState(), KOVA::APIResponse::State::kSuccess);
    EXPECT_TRUE(response.GetData().isNull());
  }
  if (getuid() != 0) GTEST_SKIP() << "needs root to change effective ids";
  EXPECT_TRUE(kova_fake::RunInChild([] {
    kova_fake::Reset();
    ASSERT_EQ(setresuid(-1, 65534, -1), 0);
    EXPECT_EQ(CallHandler(log_clear_v1).GetState(), KOVA::APIResponse::State::kSuccess);
    EXPECT_THAT(kova_fake::Calls(), ElementsAre("KOVALogClean 18 euid=0"));
    EXPECT_EQ(geteuid(), 65534u);
  }));
}

constexpr char kNamePattern[] = "ResourceMonitor-[0-9]{4}(-[0-9]{2}){5}";

TEST_F(LogApiTest, ExportWritesTheDownloadByteForByte) {
  kova_fake::SetText("log", "log_time", "Time");
  kova_fake::SetText("log", "log_type", "Level");
  kova_fake::SetText("common", "log_action", "Event");
  const std::string head =
      "<html><head>\n"
      "<meta http-equiv=\"Content-Type\" content=\"text/html; charset=utf-8;\">\n"
      "</head>\n<body>\n<center><h2> ResourceMonitor </h2></center>\n";
  const std::vector<std::string> lines = {Line("Warning", kTime1, "cpu, 91% <high> \"x\""),
                                          Line("Critical", kTime2, "say \"hi\"")};
  const struct {
    const char* type;
    std::vector<std::string> lines;
    std::string body;
  } cases[] = {
      {"csv", {}, ""},
      {"html", {}, head + "</body></html>"},
      {"csv", lines,
       "Time,Level,Event,\r\n" + kTime2 + ",Critical,say \"hi\",\r\n" + kTime1 +
           ",Warning,\"cpu, 91% <high> \"x\"\",\r\n"},
      {"html", lines,
       head + "<table border=1 width=95%>\n<tr><th>Time</th><th>Level</th><th>Event</th></tr>\n" +
           "<tr><td>" + kTime2 + "</td><td>Critical</td><td>say &quot;hi&quot;</td></tr>\n" +
           "<tr><td>" + kTime1 +
           "</td><td>Warning</td><td>cpu, 91% &lt;high&gt; &quot;x&quot;</td></tr>\n" +
           "</table>\n</body></html>"},
  };
  for (const auto& c : cases) {
    kova_fake::SetLogLines(c.lines);
    KOVA::APIResponse response;
    const std::string output = CaptureOutput([&] {
      response = CallHandler(log_export_v1, std::string(R"({"type": ")") + c.type + "\"}");
    });
    EXPECT_FALSE(response.IsOutputEnabled());
    const std::string mime = std::string(c.type) == "csv" ? "text/csv" : "text/html";
    const size_t body_start = output.find("\r\n\r\n") + 4;
    EXPECT_THAT(output.substr(0, body_start),
                MatchesRegex("Content-Type: " + mime + "\r\nContent-Disposition:attachment; " +
                             "filename=\"" + kNamePattern + "\\." + c.type + "\"\r\n\r\n"));
    EXPECT_EQ(output.substr(body_start), c.body) << c.type;
  }
}

TEST_F(LogApiTest, ExportRejectsOtherTypesBeforePrintingAnything) {
  for (const char* params : {"{}", R"({"type": "CSV"})", R"({"type": "pdf"})", R"({"type": 1})"}) {
    KOVA::APIResponse response;
    EXPECT_EQ(CaptureOutput([&] { response = CallHandler(log_export_v1, params); }), "") << params;
    EXPECT_EQ(response.GetErrorCode(), 101) << params;
    EXPECT_TRUE(response.IsOutputEnabled()) << params;
  }
}

TEST_F(LogApiTest, ExportOfAnUnreadableLogIsEmpty) {
  kova_fake::FailLogFetch(true);
  const std::string output =
      CaptureOutput([] { CallHandler(log_export_v1, R"({"type": "csv"})"); });
  EXPECT_EQ(output.substr(output.find("\r\n\r\n")), "\r\n\r\n");
}

}  // namespace
