#include "statd/pg_query.h"

#include <algorithm>

#include "statd/pg_schema.h"

namespace statd {
namespace {

constexpr int64_t kSecondsPerMinute = 60;

// `value` rounded up to a whole number of `unit`s, at least one.
int64_t RoundUp(int64_t value, int64_t unit) {
  return std::max<int64_t>(1, (value + unit - 1) / unit) * unit;
}

}  // namespace

QueryPlan PlanQuery(int64_t from, int64_t to, int points, int64_t minute_start) {
  QueryPlan plan;
  const int64_t span = to - from;
  plan.step = RoundUp((span + points - 1) / points, kSecondsPerMinute);
  plan.hours = plan.step >= kSecondsPerHour || from < minute_start;
  if (plan.hours) plan.step = RoundUp(plan.step, kSecondsPerHour);
  return plan;
}

std::string QuerySql(const QueryPlan& plan) {
  // Each series on its own, through the (series, time) index of the day
  // partitions in range. The last bucket also takes a row at exactly `to`, so
  // that a span of a whole number of steps still gives at most `points` points.
  return std::string(R"sql(
SELECT s.name, b.k, b.avg, b.min, b.max
FROM series s CROSS JOIN LATERAL (
  SELECT least((extract(epoch FROM r.time)::bigint - $2::bigint) / $4::bigint,
               $5::bigint - 1) AS k,
         sum(r.avg * r.samples) / sum(r.samples) AS avg, min(r.min) AS min, max(r.max) AS max
  FROM )sql") +
         (plan.hours ? "hour_rows" : "minute_rows") + R"sql( r
  WHERE r.series_id = s.id
    AND r.time >= to_timestamp($2::bigint) AND r.time <= to_timestamp($3::bigint)
  GROUP BY 1) b
WHERE s.name = ANY($1::text[])
ORDER BY s.id, b.k
)sql";
}

}  // namespace statd
