#include "log/log_handlers.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdio_ext.h>
#include <time.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <vector>

#include "api/error_report.h"
#include "fake/kova_fake.h"
#include "kova/log.h"
#include "test_support/host_call.h"
#include "test_support/run_in_child.h"

namespace {

using kova_test::CallHandler;
using kova_test::ParseJson;
using State = KOVA::APIResponse::State;

constexpr int64_t kDay1 = 1700000000;
// The time text of day `n` (1 to 5).
std::string Day(int n) { return KOVALogConvertTime1(kDay1 + (n - 1) * 86400); }
const std::string kTime1 = Day(1);
const std::string kTime2 = Day(2);
const std::string kTime3 = Day(3);

std::string Line(const std::string& level, const std::string& time, const std::string& event) {
  return "1\t" + level + "\t" + time + "\tadmin\tkovaperfeventd\t" + event;
}

// What `body` writes to standard output. The handler must have flushed it.
std::string CaptureOutput(const std::function<void()>& body) {
  fflush(stdout);
  const int saved = dup(STDOUT_FILENO);
  FILE* capture = tmpfile();
  dup2(fileno(capture), STDOUT_FILENO);
  body();
  EXPECT_EQ(__fpending(stdout), 0u) << "output left unflushed";
  fflush(stdout);
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
    kova_fake::SetLogLines({Line("Warning", Day(1), "CPU of Café above 80%"),
                            Line("warn", Day(2), "memory"), Line("Info", Day(3), ""),
                            Line("Warnings", Day(4), "cpu"), Line("CRITICAL", Day(5), "io")});
  }
};

// Each filter and each page bound once: the page holds the matching entries
// newest first, and "total" counts them all.
TEST_F(LogApiTest, ListFiltersAndPagesNewestFirst) {
  const std::string day2 = std::to_string(kDay1 + 86400);
  const std::string day4 = std::to_string(kDay1 + 3 * 86400);
  const std::string all[] = {"io", "cpu", "", "memory", "CPU of Café above 80%"};
  const struct {
    std::string params;
    std::vector<std::string> events;
    unsigned total;
  } cases[] = {
      {"{}", {all, all + 5}, 5},
      {R"({"offset": 1, "limit": 2})", {"cpu", ""}, 5},
      {R"({"offset": 3, "limit": 5})", {"memory", "CPU of Café above 80%"}, 5},
      {R"({"limit": 0})", {}, 5},
      {R"({"limit": -7, "filter": null})", {all, all + 5}, 5},
      {R"({"limit": 1e12, "offset": true})", {all + 1, all + 5}, 5},
      {R"({"offset": 5})", {}, 5},
      {R"({"offset": 4294967296})", {}, 5},
      {R"({"offset": -1, "limit": 2})", {}, 5},
      {R"({"filter": {"keyword": "cafÉ"}})", {"CPU of Café above 80%"}, 1},
      {R"({"filter": {"keyword": "CPU"}, "limit": 1})", {"cpu"}, 2},
      // The line's level must occur within the requested level's name.
      {R"({"filter": {"loglevel": "Warning"}})", {"memory", "CPU of Café above 80%"}, 2},
      {R"({"filter": {"loglevel": "Critical"}})", {"io"}, 1},
      {R"({"filter": {"datefrom": )" + day2 + R"(, "dateto": )" + day2 + "}}", {"memory"}, 1},
      {R"({"filter": {"datefrom": )" + day4 + "}}", {"io", "cpu"}, 2},
      {R"({"filter": {"dateto": )" + day2 + R"(, "loglevel": "Warning"}, "offset": 1})",
       {"CPU of Café above 80%"},
       2},
  };
  for (const auto& c : cases) {
    const KOVA::APIResponse response = CallHandler(log_list_v1, c.params);
    EXPECT_EQ(response.GetState(), State::kSuccess) << c.params;
    std::vector<std::string> events;
    for (const auto& entry : response.GetData()["logs"])
      events.push_back(entry["event"].asString());
    EXPECT_EQ(events, c.events) << c.params;
    EXPECT_TRUE(response.GetData()["logs"].isArray()) << c.params;
    EXPECT_EQ(response.GetData()["total"], Json::Value(Json::UInt(c.total))) << c.params;
  }
}

TEST_F(LogApiTest, ListAndExportRejectUnreadableParametersWith101BeforeAnyOutput) {
  const std::string bad_filters[] = {R"("Warning")", R"({"loglevel": "warning"})",
                                     R"({"keyword": {}})"};
  std::vector<std::pair<APIHandler, std::string>> calls = {{log_list_v1, R"({"offset": "1"})"},
                                                           {log_list_v1, R"({"limit": [1]})"},
                                                           {log_export_v1, "{}"},
                                                           {log_export_v1, R"({"type": "CSV"})"},
                                                           {log_export_v1, R"({"type": 1})"}};
  for (const std::string& filter : bad_filters) {
    calls.push_back({log_list_v1, R"({"filter": )" + filter + "}"});
    calls.push_back({log_export_v1, R"({"type": "csv", "filter": )" + filter + "}"});
  }
  for (const auto& [handler, params] : calls) {
    KOVA::APIResponse response;
    EXPECT_EQ(CaptureOutput([&] { response = CallHandler(handler, params); }), "") << params;
    EXPECT_EQ(response.GetErrorCode(), 101) << params;
    EXPECT_TRUE(response.GetData().isNull()) << params;
    EXPECT_TRUE(response.IsOutputEnabled()) << params;
  }
  EXPECT_TRUE(kova_fake::Calls().empty());
}

// An unreadable log is answered with the error record as it stands, beside an
// empty page: what an earlier failure left in it, whether the path or the fetch
// failed.
TEST_F(LogApiTest, ListOfAnUnreadableLogAnswersTheRecord) {
  Fail({.line = 7, .msg = "m", .session = "s", .key = "k", .code = 6105});
  for (bool path_fails : {true, false}) {
    kova_fake::FailLogPath(path_fails);
    kova_fake::FailLogFetch(!path_fails);
    const KOVA::APIResponse response = CallHandler(log_list_v1, R"({"offset": 1})");
    EXPECT_EQ(response.GetErrorCode(), 6105);
    Json::Value expected = ParseJson(R"({"err_line": 7, "err_msg": "m", "err_session": "s",
                                         "err_key": "k", "logs": []})");
    expected["total"] = Json::UInt(0);
    EXPECT_EQ(response.GetData(), expected);
  }
}

TEST_F(LogApiTest, ClearSucceedsAlwaysAndRunsAsRoot) {
  EXPECT_TRUE(kova_test::RunInChild([] {
    kova_fake::FailLogClean(true);
    if (getuid() == 0) {
      ASSERT_EQ(setresuid(-1, 65534, -1), 0);
    }
    const KOVA::APIResponse response = CallHandler(log_clear_v1);
    EXPECT_EQ(response.GetState(), State::kSuccess);
    EXPECT_TRUE(response.GetData().isNull());
    if (getuid() != 0) return;
    EXPECT_THAT(kova_fake::Calls(), ::testing::ElementsAre("KOVALogClean 18 euid=0"));
    EXPECT_EQ(geteuid(), 65534u);
  }));
}

TEST_F(LogApiTest, ExportWritesTheDownloadByteForByte) {
  kova_fake::SetText("log", "log_time", "Time");
  kova_fake::SetText("log", "log_type", "Level");
  kova_fake::SetText("common", "log_action", "Event");
  setenv("TZ", "KST-9", 1);  // the name's time stamp is local time
  tzset();
  const std::string head =
      "<html><head>\n"
      "<meta http-equiv=\"Content-Type\" content=\"text/html; charset=utf-8;\">\n"
      "</head>\n<body>\n<center><h2> ResourceMonitor </h2></center>\n";
  const std::vector<std::string> lines = {Line("Warning", kTime1, "cpu, 91% <high> \"x\""),
                                          Line("Critical", kTime2, "say \"hi\""),
                                          Line("Info", kTime3, "\xc5\x89, grows")};
  const struct {
    std::string type;
    std::string filter;
    std::vector<std::string> lines;
    std::string body;
    bool unreadable = false;
  } cases[] = {
      {"csv", "null", {}, ""},
      {"html", "null", {}, head + "</body></html>"},
      // A log that can't be fetched is exported as an empty one.
      {"csv", "null", lines, "", true},
      {"html", "null", lines, head + "</body></html>", true},
      {"csv", "null", lines,
       "Time,Level,Event,\r\n" + kTime3 + ",Info,\xc5\x89, grows,\r\n" + kTime2 +
           ",Critical,say \"hi\",\r\n" + kTime1 + ",Warning,\"cpu, 91% <high> \"x\"\",\r\n"},
      {"html", R"({"loglevel": "Warning"})", lines,
       head + "<table border=1 width=95%>\n<tr><th>Time</th><th>Level</th><th>Event</th></tr>\n" +
           "<tr><td>" + kTime1 +
           "</td><td>Warning</td><td>cpu, 91% &lt;high&gt; &quot;x&quot;</td></tr>\n" +
           "</table>\n</body></html>"},
  };
  for (const auto& c : cases) {
    kova_fake::SetLogLines(c.lines);
    kova_fake::FailLogFetch(c.unreadable);
    const std::string& type = c.type;
    KOVA::APIResponse response;
    char before[64], after[64];
    const time_t start = time(nullptr);
    const std::string output = CaptureOutput([&] {
      response =
          CallHandler(log_export_v1, R"({"type": ")" + type + R"(", "filter": )" + c.filter + "}");
    });
    const time_t end = time(nullptr);
    strftime(before, sizeof(before), "%Y-%m-%d-%H-%M-%S", localtime(&start));
    strftime(after, sizeof(after), "%Y-%m-%d-%H-%M-%S", localtime(&end));
    EXPECT_FALSE(response.IsOutputEnabled());
    const std::string header = "Content-Type: text/" + type +
                               "\r\nContent-Disposition:attachment; filename=\"ResourceMonitor-";
    const std::string ending = "." + type + "\"\r\n\r\n" + c.body;
    EXPECT_THAT(output, ::testing::AnyOf(header + before + ending, header + after + ending));
  }
  unsetenv("TZ");
  tzset();
}

// Every column of a row goes through the same cell format.
TEST(LogExportTest, EscapesEveryColumn) {
  const std::string text = "a,<b>";
  const struct {
    int column;  // 0 time, 1 level, 2 event
    std::string csv_row;
    std::string html_row;
  } cases[] = {
      {0, "\"a,<b>\",Warning,e,\r\n", "<tr><td>a,&lt;b&gt;</td><td>Warning</td><td>e</td></tr>\n"},
      {1, "t,\"a,<b>\",e,\r\n", "<tr><td>t</td><td>a,&lt;b&gt;</td><td>e</td></tr>\n"},
      {2, "t,Warning,\"a,<b>\",\r\n", "<tr><td>t</td><td>Warning</td><td>a,&lt;b&gt;</td></tr>\n"},
  };
  for (const auto& c : cases) {
    std::string fields[] = {"t", "Warning", "e"};
    fields[c.column] = text;
    kova_fake::Reset();
    kova_fake::SetLogLines({Line(fields[1], fields[0], fields[2])});
    const std::string csv = CaptureOutput([] { CallHandler(log_export_v1, R"({"type": "csv"})"); });
    const std::string html =
        CaptureOutput([] { CallHandler(log_export_v1, R"({"type": "html"})"); });
    EXPECT_THAT(csv, ::testing::EndsWith(c.csv_row)) << c.column;
    EXPECT_THAT(html, ::testing::HasSubstr(c.html_row)) << c.column;
  }
}

}  // namespace
