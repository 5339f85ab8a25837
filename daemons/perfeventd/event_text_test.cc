#include "perfeventd/event_text.h"

#include <gtest/gtest.h>

namespace perfeventd {
namespace {

TEST(EventTextTest, NamesResourceObjectThresholdValueAndDuration) {
  const struct {
    Rule rule;
    const char* name;
    bool raised;
    double average;
    const char* level;
    const char* text;
  } cases[] = {
      {{"1", 1, "smb", 1, 1, 80, 5, 30},
       "Windows file service",
       true,
       93.44,
       "Warning",
       "CPU use of service \"Windows file service\" has been above 80% for 30 seconds "
       "(average 93.4%)."},
      {{"2", 1, "smb", 2, 2, 90, 5, 30},
       "Windows file service",
       true,
       95,
       "Critical",
       "Memory use of service \"Windows file service\" has been above 90% for 30 seconds "
       "(average 95.0%)."},
      {{"3", 2, "lun-1", 3, 2, 5000, 5, 30},
       "Backup LUN",
       true,
       7300.31,
       "Critical",
       "I/O rate of LUN \"Backup LUN\" has been above 5000 KiB/s for 30 seconds "
       "(average 7300.3 KiB/s)."},
      {{"4", 2, "lun-1", 4, 1, 20, 5, 30},
       "Backup LUN",
       false,
       3.5,
       "Info",
       "I/O latency of LUN \"Backup LUN\" has been back at or below 20 ms for 30 seconds "
       "(average 3.5 ms)."},
      {{"5", 0, "", 1, 1, 1, 5, 30},
       "",
       true,
       12,
       "Warning",
       "CPU use of the system has been above 1% for 30 seconds (average 12.0%)."},
      {{"6", 0, "NAS", 2, 2, 50, 1, 1},
       "NAS",
       false,
       20,
       "Info",
       "Memory use of the system \"NAS\" has been back at or below 50% for 1 second "
       "(average 20.0%)."},
  };
  for (const auto& c : cases) {
    const Event event = DescribeChange(c.rule, c.name, c.raised, c.average, 1700000000);
    EXPECT_EQ(event, (Event{1700000000, c.level, c.text})) << c.rule.id;
  }
}

}  // namespace
}  // namespace perfeventd
