#include "statd/minute_rows.h"

#include <gtest/gtest.h>

#include <cmath>

namespace statd {
namespace {

SeriesValue Value(const std::string& id, double value) {
  return SeriesValue{SeriesInfo{id, id, "%", {}}, value};
}

void ExpectRow(const MinuteRow& row, const std::string& series, int64_t minute, int samples,
               double avg, double min, double max) {
  EXPECT_EQ(row.series, series);
  EXPECT_EQ(row.minute, minute);
  EXPECT_EQ(row.samples, samples);
  EXPECT_DOUBLE_EQ(row.avg, avg);
  EXPECT_DOUBLE_EQ(row.min, min);
  EXPECT_DOUBLE_EQ(row.max, max);
}

TEST(MinuteRows, AMinutesSamplesBecomeOneRowPerSeriesWhenTheNextMinuteBegins) {
  MinuteRows rows;
  EXPECT_TRUE(rows.Add(120, {Value("a", 1), Value("b", 10)}).empty());
  EXPECT_TRUE(rows.Add(150, {Value("b", 30), Value("a", std::nan(""))}).empty());
  EXPECT_TRUE(rows.Add(179, {Value("a", 5), Value("c", 7)}).empty());
  const std::vector<MinuteRow> done = rows.Add(180, {Value("a", 100)});
  ASSERT_EQ(done.size(), 3u);
  ExpectRow(done[0], "a", 120, 2, 3, 1, 5);
  ExpectRow(done[1], "b", 120, 2, 20, 10, 30);
  ExpectRow(done[2], "c", 120, 1, 7, 7, 7);
  // The new minute started with the value that closed the old one.
  const std::vector<MinuteRow> next = rows.Add(300, {});
  ASSERT_EQ(next.size(), 1u);
  ExpectRow(next[0], "a", 180, 1, 100, 100, 100);
}

TEST(MinuteRows, AClockSetBackClosesTheMinuteAsCloseDoes) {
  MinuteRows rows;
  rows.Add(600, {Value("a", 2)});
  const std::vector<MinuteRow> done = rows.Add(59, {Value("a", 4)});
  ASSERT_EQ(done.size(), 1u);
  ExpectRow(done[0], "a", 600, 1, 2, 2, 2);
  // Closing hands over the minute not yet whole; clearing forgets it.
  const std::vector<MinuteRow> partial = rows.Close();
  ASSERT_EQ(partial.size(), 1u);
  ExpectRow(partial[0], "a", 0, 1, 4, 4, 4);
  rows.Add(1000, {Value("a", 1)});
  rows.Clear();
  EXPECT_TRUE(rows.Close().empty());
}

}  // namespace
}  // namespace statd
