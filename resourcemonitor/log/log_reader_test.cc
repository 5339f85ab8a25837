#include "log/log_reader.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "fake/kova_fake.h"
#include "kova/log.h"
#include "test_support/host_call.h"
#include "test_support/run_in_child.h"

namespace {

using kova_test::ParseJson;
using ::testing::ElementsAreArray;

constexpr int64_t kDay1 = 1700000000;
const std::string kTime1 = KOVALogConvertTime1(kDay1);

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
    EXPECT_THAT(line.text.substr(0, space), ::testing::MatchesRegex("log:[0-9]+"));
    EXPECT_EQ(line.priority, 3);
    texts.push_back(line.text.substr(space + 1));
  }
  return texts;
}

TEST(LogFilterTest, RejectsOnlyOtherLevelsAndUnreadableMembers) {
  const char* const accepted[] = {"null",
                                  "{}",
                                  R"({"loglevel": ""})",
                                  R"({"loglevel": "Critical", "keyword": 5})",
                                  R"({"datefrom": true, "dateto": 1.5})",
                                  R"({"datefrom": -1, "dateto": 1e18})"};
  const char* const rejected[] = {R"({"loglevel": "warning"})",
                                  R"({"loglevel": "CRITICAL"})",
                                  R"({"loglevel": "Info"})",
                                  R"({"loglevel": 1})",
                                  R"({"keyword": ["cpu"]})",
                                  R"({"datefrom": "1"})",
                                  R"({"dateto": {}})",
                                  R"({"dateto": 1e19})",
                                  "[]",
                                  R"("Warning")",
                                  "5"};
  for (const char* filter : accepted) {
    LogFilter parsed;
    EXPECT_TRUE(ParseLogFilter(ParseJson(filter), 3, 9, parsed)) << filter;
  }
  for (const char* filter : rejected) {
    LogFilter parsed;
    parsed.keyword = "untouched";
    EXPECT_FALSE(ParseLogFilter(ParseJson(filter), 3, 9, parsed)) << filter;
    EXPECT_EQ(parsed.keyword, "untouched") << filter;
  }
  LogFilter parsed;
  ASSERT_TRUE(ParseLogFilter(
      ParseJson(R"({"loglevel": "Warning", "keyword": "k", "datefrom": 5, "dateto": 8.9})"), 3, 9,
      parsed));
  EXPECT_EQ(std::tie(parsed.offset, parsed.limit, parsed.datefrom, parsed.dateto, parsed.loglevel,
                     parsed.keyword, parsed.sortField, parsed.sortOrder),
            std::make_tuple(3, 9, 5, 8, "Warning", "k", "time", "DESC"));
}

TEST(LogReaderTest, SplitsLinesLikeTokenisingAtTabs) {
  const std::string prefix = Line("Warning", kTime1, "");
  const std::string long_event(5000, 'x');
  const size_t first_piece = 4095 - prefix.size();
  const struct {
    std::vector<std::string> lines;
    std::vector<Json::Value> entries;
    std::vector<std::string> wrong;
  } cases[] = {
      {{}, {}, {}},
      {{Line("Warning", kTime1, "cpu\thigh")}, {Entry("Warning", kTime1, "cpu\thigh")}, {}},
      {{"7\tWarning\t" + kTime1 + "\tadmin\tsrc"}, {Entry("Warning", kTime1, "")}, {}},
      {{"\t\t7\tWarning\t" + kTime1 + "\tadmin\t\tsrc\t\tev"},
       {Entry("Warning", kTime1, "\tev")},
       {}},
      // An empty level field vanishes: every later field moves one place up.
      {{"7\t\t" + kTime1 + "\tadmin\tsrc\tev"}, {Entry(kTime1, "admin", "")}, {}},
      {{Line("Critical", kTime1, "ev\r")}, {Entry("Critical", kTime1, "ev\r")}, {}},
      // A line ends at a NUL, as a C string read into the buffer does.
      {{Line("Info", kTime1, std::string("ab\0cd", 5))}, {Entry("Info", kTime1, "ab")}, {}},
      {{"7\tWarning\t" + kTime1 + "\tadmin", "\t7", ""},
       {},
       {"Wrong log: 7", "Wrong log: \t7", "Wrong log: "}},
      {{prefix + long_event},
       {Entry("Warning", kTime1, long_event.substr(0, first_piece))},
       {"Wrong log: " + long_event.substr(first_piece)}},
      // A line of exactly 4095 bytes leaves its line feed for a read of its own.
      {{prefix + long_event.substr(0, first_piece)},
       {Entry("Warning", kTime1, long_event.substr(0, first_piece))},
       {"Wrong log: "}},
  };
  for (const auto& c : cases) {
    EXPECT_THAT(Read(c.lines), ElementsAreArray(c.entries)) << ::testing::PrintToString(c.lines);
    EXPECT_THAT(WrongLogLines(), ElementsAreArray(c.wrong)) << ::testing::PrintToString(c.lines);
  }
}

// A log many read blocks long, whose clock steps back every 500 lines: every
// entry comes back whole from wherever it lay, newest first.
TEST(LogReaderTest, OrdersALargeLogWithClockSteps) {
  constexpr int kLines = 3000;
  std::vector<std::string> lines;
  std::vector<std::pair<std::string, std::string>> expected;  // time, event
  for (int i = 0; i < kLines; ++i) {
    const int block = i / 500;
    const int64_t time = kDay1 + (block ^ 1) * 500 + i % 500;  // blocks 1, 0, 3, 2, 5, 4
    const std::string event = "event " + std::to_string(i) + std::string(i % 97, '.');
    lines.push_back(Line(i % 2 ? "Warning" : "Critical", KOVALogConvertTime1(time), event));
    expected.emplace_back(KOVALogConvertTime1(time), event);
  }
  std::sort(expected.rbegin(), expected.rend());
  const std::vector<Json::Value> entries = Read(lines);
  ASSERT_EQ(entries.size(), expected.size());
  for (size_t i = 0; i < entries.size(); ++i) {
    ASSERT_EQ(entries[i]["time"].asString(), expected[i].first) << i;
    ASSERT_EQ(entries[i]["event"].asString(), expected[i].second) << i;
  }
}

TEST(LogReaderTest, ContainsIgnoreCase) {
  const struct {
    const char* haystack;
    const char* needle;
    bool contains;
  } cases[] = {
      {"Disk io Latency", "IO LAT", true},
      {"", "a", false},
      {"a", "", false},
      {"abc", "abcd", false},
      {"Café", "É", true},
      {"bad \xff utf-8", "bad", false},
      {"stra\xc3\x9f"
       "e",
       "STRASSE", true},         // same length once upper-cased
      {"\xc5\x89", "N", false},  // grows when upper-cased
  };
  for (const auto& c : cases) {
    EXPECT_EQ(ContainsIgnoreCase(c.haystack, c.needle), c.contains) << c.haystack;
  }
}

// The fetch runs as root and leaves no temporary file; a failed fetch keeps the
// ids raised; a missing log is empty and is not fetched.
TEST(LogReaderTest, FetchPathsCleanUpAndRaiseForTheFetch) {
  if (getuid() != 0) GTEST_SKIP() << "needs root to change effective ids";
  const struct {
    bool path_fails, log_exists, fetch_fails, result, fetched;
    uid_t euid_after;
  } cases[] = {
      {true, true, false, false, false, 65534},
      {false, false, false, true, false, 65534},
      {false, true, true, false, true, 0},
      {false, true, false, true, true, 65534},
  };
  for (const auto& c : cases) {
    EXPECT_TRUE(kova_test::RunInChild([&c] {
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
      EXPECT_EQ(kova_fake::TempFiles().size(), c.fetched ? 1u : 0u);
      for (const auto& name : kova_fake::TempFiles()) {
        EXPECT_EQ(name.rfind("/tmp/kovalog", 0), 0u) << name;
        EXPECT_NE(access(name.c_str(), F_OK), 0) << name << " left behind";
      }
    }));
  }
}

}  // namespace
