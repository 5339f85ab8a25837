#include "api/critical_section.h"

#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "fake/kova_fake.h"
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

}  // namespace
