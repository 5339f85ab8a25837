#include "statd/pg_query.h"

#include <gtest/gtest.h>

namespace statd {
namespace {

TEST(PlanQueryTest, StepsAndSources) {
  constexpr int64_t kHour = 3600;
  constexpr int64_t kDay = 86400;
  const struct {
    const char* name;
    int64_t from, to;
    int points;
    int64_t minute_start;
    int64_t step;
    bool hours;
  } cases[] = {
      {"a minute a point", 0, kHour, 60, 0, 60, false},
      {"rounded up to whole minutes", 0, kHour, 7, 0, 540, false},
      {"never below a minute", 0, 600, 600, 0, 60, false},
      {"a day in 600 points", 0, kDay, 600, 0, 180, false},
      {"just under an hour stays in minutes", 0, 59 * 60 * 10, 10, 0, 59 * 60, false},
      {"an hour a point reads hours", 0, kHour, 1, 0, kHour, true},
      {"30 days in 600 points: whole hours", 0, 30 * kDay, 600, 0, 2 * kHour, true},
      {"older than the minute rows reads hours", 100, 100 + kHour, 60, 1000, kHour, true},
      {"from at the oldest minute still reads minutes", 1000, 1000 + kHour, 60, 1000, 60, false},
  };
  for (const auto& c : cases) {
    const QueryPlan plan = PlanQuery(c.from, c.to, c.points, c.minute_start);
    EXPECT_EQ(plan.step, c.step) << c.name;
    EXPECT_EQ(plan.hours, c.hours) << c.name;
  }
}

}  // namespace
}  // namespace statd
