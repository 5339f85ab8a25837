#include "statd/schedule.h"

#include <gtest/gtest.h>

namespace statd {
namespace {

TEST(NextSampleTime, KeepsToWholeIntervalsWhateverTheClockDoes) {
  const struct {
    double planned;
    double now;
    int interval;
    double next;
  } cases[] = {
      {100, 99.2, 1, 100},   // ahead of time: wait for it
      {100, 100.5, 1, 100},  // a little late: take it now
      {100, 103.5, 1, 104},  // late by more than an interval: the missed ones are skipped
      {100, 40.3, 1, 41},    // the clock set back a minute: no waiting for it to come round
      {120, 110, 10, 120},   // ten-second samples, on time
      {120, 75, 10, 80},     // set back by more than two intervals
      {0, 1795000000.7, 1, 1795000001},  // the first sample
  };
  for (const auto& c : cases) {
    EXPECT_DOUBLE_EQ(NextSampleTime(c.planned, c.now, c.interval), c.next)
        << c.planned << " at " << c.now;
  }
}

}  // namespace
}  // namespace statd
