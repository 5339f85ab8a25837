#include "log/log_reader.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "fake/host_call.h"
#include "fake/kova_fake.h"
#include "fake/run_in_child.h"
#include "kova/log.h"

namespace {

using kova_fake::ParseJson;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::MatchesRegex;
using ::testing::UnorderedElementsAreArray;

constexpr int64_t kDay1 = 1700000000;
const std::string kTime1 = KOVALogConvertTime1(kDay1);
const std::string kTime2 = KOVALogConvertTime1(kDay1 + 86400);
const std::string kTime3 = KOVALogConvertTime1(kDay1 + 2 * 86400);

std::string Line(const std::string& level, const std::string& time, const std::string& event) {
  return "7\t" + level + "\t" + time + "\tadmin\tkovaperfeventd\t" + event;
}

Json::Value Entry(const std::string& level, const std::string& time, const std::string& event) {
  Json::Value entry;
  entry["level"] = level;
  entry["time"] = time;
  entry["event"] = event;
  return entry;
}

// The entries ProcessLog reads from `lines` under the filter written in `filter`.
std::vector<Json::Value> Read(const std::vector<std::string>& lines, const char* filter = "{}") {
  kova_fake::Reset();
  kova_fake::SetLogLines(lines);
  LogFilter parsed;
  EXPECT_TRUE(ParseLogFilter(ParseJson(filter), 0, -1, parsed)) << filter;
  std::vector<Json::Value> entries;
  EXPECT_TRUE(ProcessLog(parsed, entries));
  return entries;
}

// The "Wrong log" lines of the system log, without their "log:<line> " prefix.
std::vector<std::string> WrongLogLines() {
  std::vector<std::string> texts;
  for (const auto& line : kova_fake::Syslog()) {
    if (line.text.find(" Wrong log: ") == std::string::npos) continue;
    const size_t space = line.text.find(' ');
    EXPECT_THAT(line.text.substr(0, space), MatchesRegex("log:[0-9]+"));
    EXPECT_EQ(line.priority, 3);
    texts.push_back(line.text.substr(space + 1));
  }
  return texts;
}

TEST(LogFilterTest, AcceptsOnlyExactLevelsAndReadableMembers) {
  const struct {
    const char* filter;
    bool accepted;
  } cases[] = {
      {"null", true},
      {"{}", true},
      {R"({"loglevel": ""})", true},
      {R"({"loglevel": "Warning", "keyword": "cpu", "datefrom": 1, "dateto": 2})", true},
      {R"({"loglevel": "Critical"})", true},
      {R"({"loglevel": "warning"})", false},
      {R"({"loglevel": "CRITICAL"})", false},
      {R"({"loglevel": "Info"})", false},
      {R"({"loglevel": 1})", false},
      {R"({"keyword": ["cpu"]})", false},
      {R"({"datefrom": "1700000000"})", false},
      {R"({"dateto": {}})", false},
      {"[]", false},
      {R"("Warning")", false},
      {"5", false},
  };
  for (const auto& c : cases) {
    LogFilter filter;
    filter.keyword = "untouched";
    EXPECT_EQ(ParseLogFilter(ParseJson(c.filter), 3, 9, filter), c.accepted) << c.filter;
    EXPECT_EQ(filter.keyword == "untouched", !c.accepted) << c.filter;
  }
  LogFilter filter;
  ASSERT_TRUE(ParseLogFilter(
      ParseJson(R"({"loglevel": "Warning", "keyword": "k", "datefrom": 5, "dateto": 8})"), 3, 9,
      filter));
  EXPECT_EQ(std::tie(filter.offset, filter.limit, filter.datefrom, filter.dateto, filter.loglevel,
                     filter.keyword, filter.sortField, filter.sortOrder),
            std::make_tuple(3, 9, 5, 8, "Warning", "k", "time", "DESC"));
}

TEST(LogReaderTest, SplitsLinesLikeTokenisingAtTabs) {
  const std::string prefix = Line("Warning", kTime1, "");
  const std::string long_event(5000, 'x');
  const size_t first_piece = 4095 - prefix.size();
  const struct {
    std::string line;
    std::vector<Json::Value> entries;
    std::vector<std::string> wrong;
  } cases[] = {
      {Line("Warning", kTime1, "cpu\thigh"), {Entry("Warning", kTime1, "cpu\thigh")}, {}},
      {"7\tWarning\t" + kTime1 + "\tadmin\tsrc", {Entry("Warning", kTime1, "")}, {}},
      {"\t\t7\tWarning\t" + kTime1 + "\tadmin\t\tsrc\t\tev",
       {Entry("Warning", kTime1, "\tev")},
       {}},
      // An empty level field vanishes: every later field moves one place up.
      {"7\t\t" + kTime1 + "\tadmin\tsrc\tev", {Entry(kTime1, "admin", "")}, {}},
      {Line("Critical", kTime1, "ev\r"), {Entry("Critical", kTime1, "ev\r")}, {}},
      {"7\tWarning\t" + kTime1 + "\tadmin", {}, {"Wrong log: 7"}},
      {"\t7", {}, {"Wrong log: \t7"}},
      {"", {}, {"Wrong log: "}},
      {prefix + long_event,
       {Entry("Warning", kTime1, long_event.substr(0, first_piece))},
       {"Wrong log: " + long_event.substr(first_piece)}},
  };
  for (const auto& c : cases) {
    EXPECT_THAT(Read({c.line}), ElementsAreArray(c.entries)) << c.line;
    EXPECT_THAT(WrongLogLines(), ElementsAreArray(c.wrong)) << c.line;
  }
}

TEST(LogReaderTest, FiltersByKeywordLevelAndInclusiveTimeBounds) {
  const std::vector<std::string> lines = {
      Line("Warning", kTime1, "CPU of Café above 80%"),
      Line("warn", kTime2, "memory"),
      Line("CRITICAL", kTime3, "io latency"),
      Line("Warnings", kTime2, "cpu"),
      Line("Info", kTime1, ""),
  };
  const std::string from = std::to_string(kDay1 + 86400);
  const struct {
    std::string filter;
    std::vector<std::string> events;
  } cases[] = {
      {"{}", {"io latency", "memory", "cpu", "CPU of Café above 80%", ""}},
      {R"({"keyword": "cafÉ"})", {"CPU of Café above 80%"}},
      {R"({"keyword": "CPU"})", {"cpu", "CPU of Café above 80%"}},
      // The line's level must occur within the requested level's name.
      {R"({"loglevel": "Warning"})", {"memory", "CPU of Café above 80%"}},
      {R"({"loglevel": "Critical"})", {"io latency"}},
      {R"({"datefrom": )" + from + R"(, "dateto": )" + from + "}", {"memory", "cpu"}},
      {R"({"datefrom": )" + from + "}", {"io latency", "memory", "cpu"}},
      {R"({"dateto": )" + std::to_string(kDay1) + R"(, "loglevel": "Warning"})",
       {"CPU of Café above 80%"}},
  };
  for (const auto& c : cases) {
    std::vector<std::string> events;
    for (const auto& entry : Read(lines, c.filter.c_str()))
      events.push_back(entry["event"].asString());
    EXPECT_THAT(events, UnorderedElementsAreArray(c.events)) << c.filter;
  }
}

TEST(LogReaderTest, ComparesMemberTextsByteWise) {
  const Json::Value a = Entry("Warning", "2024/05/01", "b");
  const Json::Value b = Entry("Warning", "2024/05/01 00:00:00", "a");
  const Json::Value c = Entry("Warning", "2024/05/02", "\xc3\xa9");
  EXPECT_TRUE(LogCompare("time", true)(a, b));  // a prefix sorts first
  EXPECT_FALSE(LogCompare("time", true)(b, a));
  EXPECT_TRUE(LogCompare("time", false)(c, a));  // descending
  EXPECT_FALSE(LogCompare("time", false)(a, a));
  EXPECT_TRUE(LogCompare("event", true)(b, c));  // bytes compare unsigned
  EXPECT_FALSE(LogCompare("missing", false)(a, Json::Value()));
}

TEST(LogReaderTest, SortsNewestFirst) {
  std::vector<std::string> events;
  for (const auto& entry :
       Read({Line("Info", kTime2, "b"), Line("Info", kTime3, "c"), Line("Info", kTime1, "a")})) {
    events.push_back(entry["event"].asString());
  }
  EXPECT_THAT(events, ElementsAre("c", "b", "a"));
}

TEST(LogReaderTest, ContainsIgnoreCase) {
  EXPECT_TRUE(ContainsIgnoreCase("Disk io Latency", "IO LAT"));
  EXPECT_FALSE(ContainsIgnoreCase("", "a"));
  EXPECT_FALSE(ContainsIgnoreCase("a", ""));
  EXPECT_FALSE(ContainsIgnoreCase("abc", "abcd"));
  EXPECT_FALSE(ContainsIgnoreCase("bad \xff utf-8", "bad"));
  EXPECT_TRUE(
      ContainsIgnoreCase("stra\xc3\x9f"
                         "e",
                         "STRASSE"));
  EXPECT_FALSE(ContainsIgnoreCase("\xc5\x89", "N"));  // grows when upper-cased
}

// The fetch runs as root and leaves no temporary file; a failed fetch keeps the
// ids raised; a missing log is empty and is not fetched.
TEST(LogReaderTest, FetchPathsCleanUpAndRaiseForTheFetch) {
  if (getuid() != 0) GTEST_SKIP() << "needs root to change effective ids";
  const struct {
    bool path_fails;
    bool log_exists;
    bool fetch_fails;
    bool result;
    bool fetched;
    uid_t euid_after;
  } cases[] = {
      {true, true, false, false, false, 65534},
      {false, false, false, true, false, 65534},
      {false, true, true, false, true, 0},
      {false, true, false, true, true, 65534},
  };
  for (const auto& c : cases) {
    EXPECT_TRUE(kova_fake::RunInChild([&c] {
      kova_fake::Reset();
      if (c.log_exists) kova_fake::SetLogLines({Line("Info", kTime1, "e")});
      kova_fake::FailLogPath(c.path_fails);
      kova_fake::FailLogFetch(c.fetch_fails);
      ASSERT_EQ(setresuid(-1, 65534, -1), 0);
      std::vector<Json::Value> entries;
      EXPECT_EQ(ProcessLog(LogFilter(), entries), c.result);
      EXPECT_EQ(entries.size(), c.result && c.log_exists ? 1u : 0u);
      EXPECT_EQ(geteuid(), c.euid_after);
      const std::vector<std::string> fetch = {"KOVALogGet1 18 enu euid=0"};
      EXPECT_EQ(kova_fake::Calls(), c.fetched ? fetch : std::vector<std::string>());
      for (const auto& name : kova_fake::TempFiles()) {
        EXPECT_THAT(name, ::testing::StartsWith("/tmp/kovalog"));
        EXPECT_NE(access(name.c_str(), F_OK), 0) << name << " left behind";
      }
      EXPECT_EQ(kova_fake::TempFiles().size(), c.fetched ? 1u : 0u);
    }));
  }
}

}  // namespace
