// How a history request is answered on the server: the step each point
// covers, where the points start, the rows they read (minute or hour rows)
// and the one statement that reduces every asked series to at most the
// asked number of points.

#ifndef KOVA_DAEMONS_STATD_PG_QUERY_H_
#define KOVA_DAEMONS_STATD_PG_QUERY_H_

#include <cstdint>
#include <string>

namespace statd {

// The latest time a history request may name: 2^40 Unix seconds.
constexpr int64_t kMaxHistoryTime = int64_t{1} << 40;

struct QueryPlan {
  int64_t step = 0;    // seconds one point covers
  int64_t origin = 0;  // the start of the first point: `from` rounded down to a step
  bool hours = false;  // read hour rows, else minute rows
};

// The plan for `from`..`to` (Unix seconds, 0 <= from < to <= kMaxHistoryTime,
// `to` included) in at most `points` (>= 1) points. Points are whole steps
// aligned on multiples of the step: point k covers [origin + k * step,
// origin + (k + 1) * step), the first holds `from`, the last `to`. The step
// is the smallest whole number of minutes that gives at most `points` such
// points, whole hours when that is an hour or more or when `from` is before
// `minute_start`, the oldest time minute rows are kept for.
QueryPlan PlanQuery(int64_t from, int64_t to, int points, int64_t minute_start);

// The statement for `plan`. Parameters: $1 the series' names as a text[],
// $2 origin, $3 to, $4 step. Rows: name, point k (0 <= k < points), avg
// weighted by samples, min, max; ordered by series and k, points without rows
// left out. From hour rows, the hours not rolled up yet (from the oldest
// pending hour on) are read from minute rows, so that the last point reaches
// the newest minute written.
std::string QuerySql(const QueryPlan& plan);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_PG_QUERY_H_
