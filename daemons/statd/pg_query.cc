#include "statd/pg_query.h"

#include <algorithm>

#include "statd/pg_schema.h"

namespace statd {
namespace {

constexpr int64_t kSecondsPerMinute = 60;
// Steps tried one unit apart before taking one that always fits.
constexpr int kStepTries = 64;

// `value` rounded up to a whole number of `unit`s, at least one.
int64_t RoundUp(int64_t value, int64_t unit) {
  return std::max<int64_t>(1, (value + unit - 1) / unit) * unit;
}

// True when the aligned points of `step` from `from`'s through `to`'s number
// at most `points`.
bool Fits(int64_t from, int64_t to, int points, int64_t step) {
  return (to - from / step * step) / step < points;
}

}  // namespace

QueryPlan PlanQuery(int64_t from, int64_t to, int points, int64_t minute_start) {
  QueryPlan plan;
  const int64_t span = to - from;
  plan.hours = from < minute_start;
  int64_t unit = plan.hours ? kSecondsPerHour : kSecondsPerMinute;
  int64_t step = RoundUp((span + points - 1) / points, unit);
  // Aligned points may number one more than the span over the step: the next
  // steps usually fit. Past those, one of at least span / (points - 1) always
  // does (no more than points - 1 step boundaries lie in the span); a single
  // point doubles its step until no boundary does, at the latest past `to`.
  for (int tries = 0;; ++tries) {
    if (!plan.hours && step >= kSecondsPerHour) {
      plan.hours = true;
      unit = kSecondsPerHour;
      step = RoundUp(step, unit);
    }
    if (Fits(from, to, points, step)) break;
    if (tries < kStepTries) {
      step += unit;
    } else if (points > 1) {
      step = RoundUp((span + points - 2) / (points - 1), unit);
    } else {
      step *= 2;
    }
  }
  plan.step = step;
  plan.origin = from / step * step;
  return plan;
}

std::string QuerySql(const QueryPlan& plan) {
  // Each series on its own, through the (series, time) index of the day
  // partitions in range.
  const char* const minutes = R"sql(
    SELECT m.time, m.samples, m.avg, m.min, m.max FROM minute_rows m
    WHERE m.series_id = s.id
      AND m.time >= to_timestamp($2::bigint) AND m.time <= to_timestamp($3::bigint))sql";
  // Hour rows end where the oldest pending hour starts; minute rows fill in
  // from there, weighted by samples alike.
  const char* const hours = R"sql(
    SELECT h.time, h.samples, h.avg, h.min, h.max FROM hour_rows h
    WHERE h.series_id = s.id AND h.time < e.time
      AND h.time >= to_timestamp($2::bigint) AND h.time <= to_timestamp($3::bigint)
    UNION ALL
    SELECT m.time, m.samples, m.avg, m.min, m.max FROM minute_rows m
    WHERE m.series_id = s.id AND m.time >= e.time
      AND m.time >= to_timestamp($2::bigint) AND m.time <= to_timestamp($3::bigint))sql";
  return std::string(plan.hours ? R"sql(
WITH e AS (SELECT coalesce(min(hour), 'infinity') AS time FROM pending_hours))sql"
                                : "") +
         R"sql(
SELECT s.name, b.k, b.avg, b.min, b.max
FROM series s)sql" +
         (plan.hours ? " CROSS JOIN e" : "") + R"sql( CROSS JOIN LATERAL (
  SELECT (extract(epoch FROM r.time)::bigint - $2::bigint) / $4::bigint AS k,
         sum(r.avg * r.samples) / sum(r.samples) AS avg, min(r.min) AS min, max(r.max) AS max
  FROM ()sql" +
         (plan.hours ? hours : minutes) + R"sql() r
  GROUP BY 1) b
WHERE s.name = ANY($1::text[])
ORDER BY s.id, b.k
)sql";
}

}  // namespace statd
