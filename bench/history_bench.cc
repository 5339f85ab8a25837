// kovastatd's history queries through PgHistory::Query, on a store of 200
// series holding 31 days of minute rows and 180 days of hour rows (loaded with
// COPY into the day partitions PgHistory makes; the last hour not rolled up
// yet, as in a running store), in two cases:
//
//   hours    10 series over 30 days in 600 points: two hours a point, from
//            hour rows and, for the last hour, minute rows
//   minutes  10 series over 7 days in 10000 points: two minutes a point,
//            from minute rows
//
// Each case is timed on the store and, in the same run, on the same rows in
// unpartitioned tables: with the store's (series, time) B-tree but no BRIN,
// and with no index at all. Starts a throw-away PostgreSQL of its own; prints
// each case's medians, the points returned and how many times faster the store
// is than each copy. Every answer is checked point by point against the rows
// loaded.
//
//   history_bench [benchmark flags]

#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "statd/pg_history.h"
#include "statd/pg_schema.h"
#include "test_support/test_postgres.h"

namespace statd {
namespace {

constexpr int kSeries = 200;
constexpr int kMinuteDays = 31;
constexpr int kHourDays = 180;
constexpr int64_t kNow = 1700006400;  // 2023-11-15 00:00 UTC: the store ends here
// Hour rows end here: the last hour is pending, its minutes not rolled up.
constexpr int64_t kRolledEnd = kNow - kSecondsPerHour;
constexpr int kAskedSeries = 10;

struct Case {
  const char* name;
  int64_t from;  // the request: from..kNow in `points` points
  int points;
  const char* source;  // what the answer must say
  int64_t step;
};
constexpr Case kCases[] = {
    {"hours", kNow - 30 * kSecondsPerDay, 600, "hour", 2 * kSecondsPerHour},
    {"minutes", kNow - 7 * kSecondsPerDay, 10000, "minute", 120},
};

// The unpartitioned copies of the store, each in a schema of its own.
struct Store {
  const char* schema;
  bool btree;  // with the store's (series, time) B-tree
};
constexpr Store kBaselines[] = {
    {"flat_btree", true},
    {"flat_no_index", false},
};

std::string SeriesName(int index) { return "bench." + std::to_string(index); }

// One loaded row's values.
struct Values {
  int samples;
  double avg;
};

// Hour rows of series i alternate between i and i + 0.5 (even and odd hours),
// 3600 samples each. Minute rows hold -i and -i - 0.5 in turn every two
// minutes, so that a point from the wrong rows or off its step shows; those
// of the last hour, not rolled up, hold their hour's value. Every row's min
// and max are avg - 1 and avg + 1. All values are halves: their sums are
// exact in any order.
double HourAvg(int series, int64_t hour) { return series + (hour / kSecondsPerHour % 2) * 0.5; }
Values HourRow(int series, int64_t hour) { return {3600, HourAvg(series, hour)}; }
Values MinuteRow(int series, int64_t minute) {
  if (minute >= kRolledEnd) return {60, HourAvg(series, minute - minute % kSecondsPerHour)};
  return {60, -series - (minute / 120 % 2) * 0.5};
}

// The rows of the UTC day starting at `day` in COPY's text format, all
// series for each time: hour rows when `hours`, else minute rows.
std::string DayRows(int64_t day, bool hours) {
  std::string data;
  const int64_t step = hours ? kSecondsPerHour : 60;
  const int64_t end = hours ? std::min(day + kSecondsPerDay, kRolledEnd) : day + kSecondsPerDay;
  for (int64_t time = day; time < end; time += step) {
    const std::string stamp = '\t' + UtcTimestamp(time) + '\t';
    for (int series = 0; series < kSeries; ++series) {
      const Values row = hours ? HourRow(series, time) : MinuteRow(series, time);
      data += std::to_string(series + 1) + stamp + std::to_string(row.samples) + '\t';
      AppendNumber(data, row.avg);
      data += '\t';
      AppendNumber(data, row.avg - 1);
      data += '\t';
      AppendNumber(data, row.avg + 1);
      data += '\n';
    }
  }
  return data;
}

// Loads the store into `pg`: PgHistory's tables in schema "public", and the
// same rows in the baselines' plain tables. False when a step failed.
bool LoadStore(const kova_test::TestPostgres& pg) {
  const auto failed = [](const std::vector<std::vector<std::string>>& rows) {
    const bool error = rows.size() == 1 && rows[0].size() == 1 && rows[0][0].rfind("ERROR", 0) == 0;
    if (error) fprintf(stderr, "%s\n", rows[0][0].c_str());
    return error;
  };
  std::string partitions = kCreateSchemaSql;
  for (int64_t day = kNow - kHourDays * kSecondsPerDay; day < kNow; day += kSecondsPerDay) {
    if (day >= kNow - kMinuteDays * kSecondsPerDay) {
      partitions += CreatePartitionSql("minute_rows", day) + ";\n";
    }
    partitions += CreatePartitionSql("hour_rows", day) + ";\n";
  }
  if (failed(pg.Sql(partitions)) ||
      failed(pg.Sql("INSERT INTO series (id, name) SELECT g, 'bench.' || (g - 1) "
                    "FROM generate_series(1, " +
                    std::to_string(kSeries) + ") g")) ||
      failed(pg.Sql("INSERT INTO pending_hours VALUES ('" + UtcTimestamp(kRolledEnd) + "')"))) {
    return false;
  }
  for (int64_t day = kNow - kHourDays * kSecondsPerDay; day < kNow; day += kSecondsPerDay) {
    if (!pg.Copy("COPY hour_rows FROM STDIN", DayRows(day, true))) return false;
    if (day >= kNow - kMinuteDays * kSecondsPerDay &&
        !pg.Copy("COPY minute_rows FROM STDIN", DayRows(day, false))) {
      return false;
    }
  }
  for (const Store& store : kBaselines) {
    const std::string schema = store.schema;
    std::string sql = "CREATE SCHEMA " + schema + ";";
    for (const char* table : {"series", "pending_hours", "minute_rows", "hour_rows"}) {
      const bool rows = std::string(table).ends_with("_rows");
      sql += "CREATE TABLE " + schema + "." + table + " AS SELECT * FROM public." + table +
             (rows ? " ORDER BY time;" : ";");
    }
    if (store.btree) {
      sql += "CREATE INDEX ON " + schema + ".minute_rows (series_id, time);" + "CREATE INDEX ON " +
             schema + ".hour_rows (series_id, time);";
    }
    if (failed(pg.Sql(sql))) return false;
  }
  return !failed(pg.Sql("VACUUM ANALYZE"));
}

const std::vector<std::string>& AskedSeries() {
  static const std::vector<std::string> names = [] {
    std::vector<std::string> list;
    for (int i = 0; i < kAskedSeries; ++i) list.push_back(SeriesName(i * kSeries / kAskedSeries));
    return list;
  }();
  return names;
}

// The point of `series` at [start, start + step) reduced from the rows loaded
// as the store holds them: hour rows before kRolledEnd, minute rows after it
// when `hours`, else minute rows.
struct Point {
  double avg = 0, min = 0, max = 0;
};
Point ExpectedPoint(int series, int64_t start, int64_t step, bool hours) {
  double weighted = 0;
  int64_t samples = 0;
  Point point{0, 1e300, -1e300};
  const auto add = [&](const Values& row) {
    weighted += row.avg * row.samples;
    samples += row.samples;
    point.min = std::min(point.min, row.avg - 1);
    point.max = std::max(point.max, row.avg + 1);
  };
  for (int64_t time = start; time < start + step; time += 60) {
    if (!hours || time >= kRolledEnd) {
      add(MinuteRow(series, time));
    } else if (time % kSecondsPerHour == 0) {
      add(HourRow(series, time));
    }
  }
  point.avg = weighted / samples;
  return point;
}

// Why `answer` to `c` isn't the loaded rows reduced; empty when it is.
std::string CheckAnswer(const Case& c, const HistoryAnswer& answer) {
  if (answer.source != c.source || answer.step != c.step) return "wrong step or source";
  if (answer.series.size() != AskedSeries().size()) return "wrong number of series";
  // `from` is on a step: the points run from it up to kNow, which no row holds.
  const size_t points = (kNow - c.from) / c.step;
  for (size_t i = 0; i < answer.series.size(); ++i) {
    const HistorySeries& series = answer.series[i];
    const int index = static_cast<int>(i) * kSeries / kAskedSeries;
    if (series.id != AskedSeries()[i]) return "series out of order";
    if (series.times.size() != points || series.times.size() > static_cast<size_t>(c.points)) {
      return series.id + " has " + std::to_string(series.times.size()) + " points";
    }
    for (size_t k = 0; k < series.times.size(); ++k) {
      const int64_t start = c.from + static_cast<int64_t>(k) * c.step;
      const Point want = ExpectedPoint(index, start, c.step, std::string(c.source) == "hour");
      if (series.times[k] != start || series.avg[k] != want.avg || series.min[k] != want.min ||
          series.max[k] != want.max) {
        return series.id + " point " + std::to_string(k) + " isn't as loaded";
      }
    }
  }
  return "";
}

void BM_History(benchmark::State& state, PgHistory* history, const Case* c) {
  size_t points = 0;
  for (auto _ : state) {
    HistoryAnswer answer;
    std::string error;
    if (!history->Query(AskedSeries(), c->from, kNow, c->points, answer, error)) {
      state.SkipWithError(error.c_str());
      return;
    }
    state.PauseTiming();
    const std::string wrong = CheckAnswer(*c, answer);
    state.ResumeTiming();
    if (!wrong.empty()) {
      state.SkipWithError(wrong.c_str());
      return;
    }
    points = 0;
    for (const HistorySeries& series : answer.series) points += series.times.size();
  }
  state.counters["points"] = static_cast<double>(points);
}

// Times case `c` on `history` in real time (the work is the server's): ten
// repetitions for a median, or three of one query each for a copy without an
// index, whose every query scans whole tables.
void Register(const std::string& name, PgHistory* history, const Case& c, bool slow) {
  auto* benchmark = benchmark::RegisterBenchmark(name.c_str(), BM_History, history, &c)
                        ->Unit(benchmark::kMillisecond)
                        ->UseRealTime()
                        ->ReportAggregatesOnly(true);
  if (slow) {
    benchmark->Iterations(1)->Repetitions(3);
  } else {
    benchmark->Repetitions(10);
  }
}

// The console's report, keeping each benchmark's median and points.
class MedianReporter : public benchmark::ConsoleReporter {
 public:
  struct Median {
    double ms = 0;
    double points = 0;
  };
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& run : runs) {
      if (run.run_type == Run::RT_Aggregate && run.aggregate_name == "median" &&
          !run.error_occurred) {
        const auto points = run.counters.find("points");
        medians_[run.run_name.function_name] = {
            run.GetAdjustedRealTime(), points == run.counters.end() ? 0 : points->second.value};
      }
    }
    ConsoleReporter::ReportRuns(runs);
  }
  Median Of(const std::string& name) const {
    const auto found = medians_.find(name);
    return found == medians_.end() ? Median{} : found->second;
  }

 private:
  std::map<std::string, Median> medians_;
};

}  // namespace
}  // namespace statd

int main(int argc, char** argv) {
  using namespace statd;
  benchmark::Initialize(&argc, argv);
  kova_test::TestPostgres pg;
  if (!pg.ok()) return 1;
  const auto load_start = std::chrono::steady_clock::now();
  if (!LoadStore(pg)) return 1;
  fprintf(stderr, "loaded %d series: %d days of minute rows, %d days of hour rows in %.1f s\n",
          kSeries, kMinuteDays, kHourDays,
          std::chrono::duration<double>(std::chrono::steady_clock::now() - load_start).count());

  const SystemLog log = [](int, const std::string& text) {
    fprintf(stderr, "history: %s\n", text.c_str());
  };
  // History stays off: the writers never connect, only queries do. The store
  // keeps the daemon's 2 s statement timeout; the copies get 60 s, so that a
  // scan of every row is timed, not cut short.
  PgHistoryTuning tuning{[] { return kNow; }, std::chrono::milliseconds(4000)};
  PgHistory store(pg.conninfo(), pg.dir() + "/spool", kDefaultSpoolBytes, log, tuning);
  tuning.query_timeout = std::chrono::seconds(60);
  std::vector<std::unique_ptr<PgHistory>> baselines;
  for (const Store& baseline : kBaselines) {
    const std::string schema = baseline.schema;
    baselines.push_back(std::make_unique<PgHistory>(
        pg.conninfo() + " options='-c search_path=" + schema + "'", pg.dir() + "/spool_" + schema,
        kDefaultSpoolBytes, log, tuning));
  }
  for (const Case& c : kCases) {
    const std::string prefix = std::string("history/") + c.name + "/";
    Register(prefix + "partitioned", &store, c, false);
    for (size_t i = 0; i < std::size(kBaselines); ++i) {
      Register(prefix + kBaselines[i].schema, baselines[i].get(), c, !kBaselines[i].btree);
    }
  }
  MedianReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  benchmark::Shutdown();

  bool measured = true;
  for (const Case& c : kCases) {
    const std::string prefix = std::string("history/") + c.name + "/";
    const MedianReporter::Median fast = reporter.Of(prefix + "partitioned");
    printf("%s: %d series from %s rows, %.0f points: partitioned %.2f ms", c.name, kAskedSeries,
           c.source, fast.points, fast.ms);
    puts(std::string(c.name) == "hours" ? " (target under 50 ms)" : "");
    measured = measured && fast.ms > 0;
    for (const Store& baseline : kBaselines) {
      const MedianReporter::Median slow = reporter.Of(prefix + baseline.schema);
      measured = measured && slow.ms > 0;
      if (fast.ms > 0 && slow.ms > 0) {
        printf(
            "  %s %.2f ms, %.0f points: %s : partitioned = %.2f (above 1: the partitioned "
            "store is faster)\n",
            baseline.schema, slow.ms, slow.points, baseline.schema, slow.ms / fast.ms);
      }
    }
  }
  if (!measured) {
    fprintf(stderr, "a benchmark failed or was filtered out; no ratio\n");
    return 1;
  }
  return 0;
}
