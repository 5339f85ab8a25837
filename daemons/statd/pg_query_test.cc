#include "statd/pg_query.h"

#include <gtest/gtest.h>

namespace statd {
namespace {

TEST(PlanQueryTest, StepsOriginsAndSources) {
  constexpr int64_t kHour = 3600;
  constexpr int64_t kDay = 86400;
  const struct {
    const char* name;
    int64_t from, to;
    int points;
    int64_t minute_start;
    int64_t step, origin;
    bool hours;
  } cases[] = {
      {"a minute a point", 0, kHour - 1, 60, 0, 60, 0, false},
      {"`to` on a boundary makes a point more: the next step", 0, kHour, 60, 0, 120, 0, false},
      {"rounded up to whole minutes", 0, kHour - 1, 7, 0, 540, 0, false},
      {"never below a minute", 0, 600, 600, 0, 60, 0, false},
      {"a day in 600 points", 0, kDay, 600, 0, 180, 0, false},
      {"just under an hour stays in minutes", 0, 59 * 60 * 10 - 1, 10, 0, 59 * 60, 0, false},
      {"an hour a point reads hours", 0, kHour - 1, 1, 0, kHour, 0, true},
      {"30 days in 600 points: whole hours", 0, 30 * kDay, 600, 0, 2 * kHour, 0, true},
      {"from 10:30 the first hour starts at 10:00", 10 * kHour + 1800, 20 * kHour - 1, 10, 0, kHour,
       10 * kHour, true},
      {"an unaligned span a point too long: two hours", 10 * kHour + 1800, 20 * kHour + 1799, 10, 0,
       2 * kHour, 10 * kHour, true},
      {"one point over a boundary: the first step holding both ends", 3599, 3601, 1, 0, 420, 3360,
       false},
      {"older than the minute rows reads hours", 100, 100 + kHour, 60, 1000, kHour, 0, true},
      {"from at the oldest minute still reads minutes", 1020, 1020 + kHour - 1, 60, 1020, 60, 1020,
       false},
  };
  for (const auto& c : cases) {
    const QueryPlan plan = PlanQuery(c.from, c.to, c.points, c.minute_start);
    EXPECT_EQ(plan.step, c.step) << c.name;
    EXPECT_EQ(plan.origin, c.origin) << c.name;
    EXPECT_EQ(plan.hours, c.hours) << c.name;
  }
}

TEST(PlanQueryTest, PointsHoldBothEndsAndNeverExceedTheCount) {
  // Spans that start anywhere in a step, end on or off a boundary, and ask
  // for few points, where an extra aligned point is likeliest.
  for (const int points : {1, 2, 3, 7, 600, 10000}) {
    for (const int64_t span : {int64_t{1}, int64_t{59}, int64_t{3600}, int64_t{86399},
                               int64_t{86400}, int64_t{2592000}, int64_t{31536000}}) {
      for (const int64_t from : {int64_t{0}, int64_t{1700006399}, int64_t{1700007000},
                                 int64_t{1700010030}, kMaxHistoryTime - span}) {
        const QueryPlan plan = PlanQuery(from, from + span, points, 0);
        const std::string name = std::to_string(points) + " points of " + std::to_string(span) +
                                 " s from " + std::to_string(from);
        ASSERT_GT(plan.step, 0) << name;
        EXPECT_EQ(plan.step % (plan.hours ? 3600 : 60), 0) << name;
        EXPECT_EQ(plan.origin % plan.step, 0) << name;
        EXPECT_LE(plan.origin, from) << name;
        EXPECT_GT(plan.origin + plan.step, from) << name;
        EXPECT_LT((from + span - plan.origin) / plan.step, points) << name;
      }
    }
  }
}

}  // namespace
}  // namespace statd
