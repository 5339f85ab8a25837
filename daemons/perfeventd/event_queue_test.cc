#include "perfeventd/event_queue.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "kova/log.h"
#include "test_support/perfevent_log.h"
#include "test_support/test_root.h"

namespace perfeventd {

using kova_test::LogLines;
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

// The log's records as KOVALogGet1 prints them, without their ids.
std::vector<std::string> LogLines(const kova_test::TestRoot& root) {
  const std::string out = root.Path("/tmp/dump");
  EXPECT_EQ(KOVALogGet1(kLogTypePerfEvent, out.c_str(), "enu"), 0);
  std::vector<std::string> lines;
  std::istringstream text(root.Read("/tmp/dump"));
  for (std::string line; std::getline(text, line);)
    lines.push_back(line.substr(line.find('\t') + 1));
  return lines;
}

TEST(EventQueueTest, KeepsEventsThroughAFailingLogAndARestart) {
  kova_test::TestRoot root;
  const std::string spill = root.Path("/var/lib/kova/perfevent/waiting_events");
  root.Write("/var/log/kova", "not a directory");  // the log store can't be made
  std::vector<std::string> notices;
  const Notify notify = [&](int, const std::string& text) { notices.push_back(text); };
  {
    EventQueue queue(spill, 100, notify);
    queue.Add({{1700000000, "Warning", "CPU\tup"}, {1700000005, "Critical", "memory\nfull"}});
    EXPECT_FALSE(queue.Flush());
    EXPECT_FALSE(queue.Flush());
    EXPECT_EQ(queue.size(), 2u);
  }  // the daemon ends with events waiting
  EXPECT_EQ(root.Read("/var/lib/kova/perfevent/waiting_events"),
            "1700000000\tWarning\tCPU up\n1700000005\tCritical\tmemory full\n");

  EventQueue queue(spill, 100, notify);
  queue.Restore();
  queue.Add({{1700000009, "Info", "back"}});
  std::filesystem::remove(root.Path("/var/log/kova"));
  EXPECT_TRUE(queue.Flush());
  EXPECT_EQ(queue.size(), 0u);
  EXPECT_FALSE(std::filesystem::exists(spill));
  const std::string user_source = "\tSYSTEM\tkovaperfeventd\t";
  EXPECT_THAT(
      LogLines(root),
      ElementsAre("Warning\t" + KOVALogConvertTime1(1700000000) + user_source + "CPU up",
                  "Critical\t" + KOVALogConvertTime1(1700000005) + user_source + "memory full",
                  "Info\t" + KOVALogConvertTime1(1700000009) + user_source + "back"));
  // Said once while it failed.
  EXPECT_THAT(notices, ElementsAre(HasSubstr("can't write the performance-event log"),
                                   "2 events of an earlier run wait to be written"));
}

TEST(EventQueueTest, DropsTheOldestBeyondItsCapacity) {
  kova_test::TestRoot root;
  std::vector<std::string> notices;
  EventQueue queue(root.Path("/var/lib/kova/perfevent/waiting_events"), 2,
                   [&](int, const std::string& text) { notices.push_back(text); });
  queue.Add({{1, "Info", "a"}, {2, "Info", "b"}, {3, "Info", "c"}});
  EXPECT_TRUE(queue.Flush());
  EXPECT_EQ(LogLines(root).size(), 2u);
  EXPECT_THAT(notices, ElementsAre("1 events were dropped while the log failed"));
}

}  // namespace
}  // namespace perfeventd
