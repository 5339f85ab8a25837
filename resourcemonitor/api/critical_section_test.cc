#include "api/critical_section.h"

#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <string>
#include <vector>

#include "eventrule/EventRule.h"
#include "fake/kova_fake.h"
#include "log/log_handlers.h"
#include "test_support/host_call.h"
#include "test_support/run_in_child.h"

namespace {

using kova_fake::SyslogLine;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;

constexpr unsigned kNobody = 65534;

SyslogLine Warning(const std::string& text) { return {38, text}; }
SyslogLine Error(const std::string& text) { return {35, text}; }

// Runs as root with real and saved ids 0, as the host runs the module, and
// lowers the effective ids for each case.
class CriticalSectionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (getuid() != 0) GTEST_SKIP() << "needs root to change effective ids";
    kova_fake::Reset();
  }
  void TearDown() override {
    if (getuid() != 0) return;
    ASSERT_EQ(setresuid(-1, 0, -1), 0);
    ASSERT_EQ(setresgid(-1, 0, -1), 0);
  }
};

TEST_F(CriticalSectionTest, RaisesToRootAndRestoresTheLoweredIds) {
  const struct {
    unsigned euid;
    unsigned egid;
    std::vector<SyslogLine> enter_log;
    std::vector<SyslogLine> leave_log;
  } cases[] = {
      {kNobody,
       kNobody,
       {Warning("EventRule:7 WARNING: setresgid(-1, 0, -1)"),
        Warning("EventRule:7 WARNING: setresuid(-1, 0, -1)")},
       {Warning("EventRule:9 WARNING: setresuid(-1, 0, -1)")}},
      {kNobody,
       0,
       {Warning("EventRule:7 WARNING: setresuid(-1, 0, -1)")},
       {Warning("EventRule:9 WARNING: setresuid(-1, 0, -1)")}},
      {0, kNobody, {Warning("EventRule:7 WARNING: setresgid(-1, 0, -1)")}, {}},
      {0, 0, {}, {}},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    ASSERT_EQ(setresgid(-1, c.egid, -1), 0);
    ASSERT_EQ(setresuid(-1, c.euid, -1), 0);
    const std::string label = std::to_string(c.euid) + "/" + std::to_string(c.egid);

    CriticalSection section;
    errno = 5;
    ENTERCriticalSection(section, "EventRule", 7);
    EXPECT_EQ(errno, 0) << label;
    EXPECT_EQ(geteuid(), 0u) << label;
    EXPECT_EQ(getegid(), 0u) << label;
    EXPECT_THAT(kova_fake::Syslog(), ElementsAreArray(c.enter_log)) << label;

    kova_fake::Reset();
    errno = 5;
    LEAVECriticalSection(section, "EventRule", 9);
    EXPECT_EQ(errno, 0) << label;
    EXPECT_EQ(geteuid(), c.euid) << label;
    EXPECT_EQ(getegid(), c.egid) << label;
    uid_t real, effective, saved;
    getresuid(&real, &effective, &saved);
    EXPECT_EQ(real, 0u);
    EXPECT_EQ(saved, 0u);
    EXPECT_THAT(kova_fake::Syslog(), ElementsAreArray(c.leave_log)) << label;
    ASSERT_EQ(setresuid(-1, 0, -1), 0);
  }
}

TEST_F(CriticalSectionTest, LogsAndGoesOnWhenTheProcessCannotRaise) {
  EXPECT_TRUE(kova_test::RunInChild([] {
    ASSERT_EQ(setresgid(kNobody, kNobody, kNobody), 0);
    ASSERT_EQ(setresuid(kNobody, kNobody, kNobody), 0);

    CriticalSection section;
    ENTERCriticalSection(section, "log", 3);
    EXPECT_EQ(errno, 1);
    EXPECT_EQ(geteuid(), kNobody);
    EXPECT_THAT(kova_fake::Syslog(),
                ElementsAre(Error("log:3 ERROR: setresgid(-1, 0, -1) [Operation not permitted]"),
                            Error("log:3 ERROR: ENTERCriticalSection")));

    // Nothing was raised, so leaving has nothing to do.
    kova_fake::Reset();
    LEAVECriticalSection(section, "log", 4);
    EXPECT_EQ(errno, 0);
    EXPECT_THAT(kova_fake::Syslog(), ElementsAre());

    // A group id it cannot put back stops the leave at that call.
    LEAVECriticalSection(CriticalSection{kNobody, 0}, "log", 5);
    EXPECT_EQ(errno, 1);
    EXPECT_THAT(kova_fake::Syslog(),
                ElementsAre(Error("log:5 ERROR: setresgid(-1, 0, -1) [Operation not permitted]"),
                            Error("log:5 ERROR: LEAVECriticalSection")));

    // Nor can it take the user id to 0 to begin with.
    kova_fake::Reset();
    LEAVECriticalSection(CriticalSection{0, kNobody}, "log", 6);
    EXPECT_EQ(errno, 1);
    EXPECT_THAT(kova_fake::Syslog(),
                ElementsAre(Error("log:6 ERROR: setresuid(-1, 0, -1) [Operation not permitted]"),
                            Error("log:6 ERROR: LEAVECriticalSection")));
  }));
}

// The line numbers of the first "ENTERCriticalSection(" and the first
// "LEAVECriticalSection(" after `function` in the module source `file`.
std::pair<int, int> SectionLines(const std::string& file, const std::string& function) {
  std::ifstream source(std::string(KOVA_RESOURCEMONITOR_DIR) + "/" + file);
  EXPECT_TRUE(source.is_open()) << file;
  int enter = 0, leave = 0, number = 0;
  bool inside = false;
  for (std::string line; std::getline(source, line) && leave == 0;) {
    ++number;
    inside = inside || line.find(function) != std::string::npos;
    if (inside && enter == 0 && line.find("ENTERCriticalSection(") != std::string::npos) {
      enter = number;
    }
    if (enter != 0 && line.find("LEAVECriticalSection(") != std::string::npos) leave = number;
  }
  EXPECT_NE(leave, 0) << function << " in " << file;
  return {enter, leave};
}

// A handler that enters the section logs its source's name and the line of the
// call it made, on entry and on leaving.
TEST_F(CriticalSectionTest, CallSitesLogTheirOwnSourceAndLine) {
  const struct {
    APIHandler handler;
    const char* params;
    const char* source;
    const char* file;
    const char* function;
  } cases[] = {
      {log_clear_v1, "{}", "log", "log/log_handlers.cc", "void log_clear_v1("},
      {log_list_v1, "{}", "log", "log/log_reader.cc", "bool ReadLog("},
      {rule_set_v1, R"({"service": "x"})", "EventRule", "eventrule/EventRule.cc",
       "void rule_set_v1("},
      {rule_delete_v1, R"({"id_list": []})", "EventRule", "eventrule/EventRule.cc",
       "void rule_delete_v1("},
      {rule_onoff_v1, R"({"id_list": []})", "EventRule", "eventrule/EventRule.cc",
       "void rule_onoff_v1("},
  };
  for (const auto& c : cases) {
    const auto [enter, leave] = SectionLines(c.file, c.function);
    kova_fake::Reset();
    kova_fake::SetLogLines({});
    ASSERT_EQ(setresuid(-1, kNobody, -1), 0);
    kova_test::CallHandler(c.handler, c.params);
    ASSERT_EQ(setresuid(-1, 0, -1), 0);
    std::vector<std::string> warnings;
    for (const SyslogLine& line : kova_fake::Syslog()) {
      if (line.text.find(" WARNING: ") != std::string::npos) warnings.push_back(line.text);
    }
    const std::string raise = " WARNING: setresuid(-1, 0, -1)";
    EXPECT_THAT(warnings, ElementsAre(c.source + (":" + std::to_string(enter)) + raise,
                                      c.source + (":" + std::to_string(leave)) + raise))
        << c.function;
  }
}

}  // namespace
