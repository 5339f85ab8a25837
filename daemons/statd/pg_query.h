// How a history request is answered on the server: the step each point
// covers, the rows it reads (minute or hour rows) and the one statement that
// reduces every asked series to at most the asked number of points.

#ifndef KOVA_DAEMONS_STATD_PG_QUERY_H_
#define KOVA_DAEMONS_STATD_PG_QUERY_H_

#include <cstdint>
#include <string>

namespace statd {

struct QueryPlan {
  int64_t step = 0;    // seconds one point covers
  bool hours = false;  // read hour rows, else minute rows
};

// The plan for `from`..`to` (Unix seconds, from < to) in at most `points`
// (>= 1) points: the span over the points rounded up to whole minutes, and to
// whole hours when that is an hour or more or when `from` is before
// `minute_start`, the oldest time minute rows are kept for.
QueryPlan PlanQuery(int64_t from, int64_t to, int points, int64_t minute_start);

// The statement for `plan`. Parameters: $1 the series' names as a text[],
// $2 from, $3 to, $4 step, $5 points. Rows: name, bucket k (the point at
// from + k * step, 0 <= k < points), avg weighted by samples, min, max;
// ordered by series and k, buckets without rows left out.
std::string QuerySql(const QueryPlan& plan);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_PG_QUERY_H_
