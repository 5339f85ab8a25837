// kovastatd's history query: 10 series over 30 days reduced to 600 points,
// through PgHistory::Query, on a store of 200 series holding 31 days of minute
// rows and 180 days of hour rows (loaded with COPY into the day partitions
// PgHistory makes), against the same query over the same rows in unpartitioned
// tables, measured in the same run: with the store's (series, time) B-tree but
// no BRIN, and with no index at all. Starts a throw-away PostgreSQL of its own;
// prints the medians and how many times faster the store is than each. Every
// answer is checked: 10 series in the order asked, at most 600 points each,
// the values loaded.
//
//   history_bench [benchmark flags]

#include <benchmark/benchmark.h>

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
constexpr int64_t kFrom = kNow - 30 * kSecondsPerDay;
constexpr int kPoints = 600;
constexpr int kAskedSeries = 10;

std::string SeriesName(int index) { return "bench." + std::to_string(index); }

// Hour rows of series i alternate between i and i + 0.5 (even and odd hours),
// min avg - 1, max avg + 1, 3600 samples each; minute rows hold -i, so a
// point from the wrong rows shows.
double HourAvg(int series, int64_t hour) { return series + (hour / kSecondsPerHour % 2) * 0.5; }

// The minute and hour rows of the UTC day starting at `day`, in COPY's text
// format, all series for each time.
std::string DayRows(int64_t day, bool hours) {
  std::string data;
  const int64_t step = hours ? kSecondsPerHour : 60;
  for (int64_t time = day; time < day + kSecondsPerDay; time += step) {
    const std::string stamp = '\t' + UtcTimestamp(time) + '\t';
    for (int series = 0; series < kSeries; ++series) {
      const double avg = hours ? HourAvg(series, time) : -series;
      data += std::to_string(series + 1) + stamp + (hours ? "3600\t" : "60\t") +
              std::to_string(avg) + '\t' + std::to_string(avg - 1) + '\t' +
              std::to_string(avg + 1) + '\n';
    }
  }
  return data;
}

// The unpartitioned copies of the store, each in a schema of its own, ended
// by an empty row.
struct Store {
  const char* schema;
  bool btree;  // with the store's (series, time) B-tree
};
constexpr Store kBaselines[] = {
    {"flat_btree", true},
    {"flat_no_index", false},
    {nullptr, false},
};

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
                    std::to_string(kSeries) + ") g"))) {
    return false;
  }
  for (int64_t day = kNow - kHourDays * kSecondsPerDay; day < kNow; day += kSecondsPerDay) {
    if (!pg.Copy("COPY hour_rows FROM STDIN", DayRows(day, true))) return false;
    if (day >= kNow - kMinuteDays * kSecondsPerDay &&
        !pg.Copy("COPY minute_rows FROM STDIN", DayRows(day, false))) {
      return false;
    }
  }
  for (const Store* store = kBaselines; store->schema != nullptr; ++store) {
    const std::string schema = store->schema;
    std::string sql = "CREATE SCHEMA " + schema + ";";
    for (const char* table : {"series", "minute_rows", "hour_rows"}) {
      sql += "CREATE TABLE " + schema + "." + table + " AS SELECT * FROM public." + table +
             (std::string(table) == "series" ? ";" : " ORDER BY time;");
    }
    if (store->btree) {
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

// Why `answer` isn't the loaded rows reduced; empty when it is.
std::string CheckAnswer(const HistoryAnswer& answer) {
  if (answer.source != "hour" || answer.step != 2 * kSecondsPerHour) return "wrong step or source";
  if (answer.series.size() != AskedSeries().size()) return "wrong number of series";
  for (size_t i = 0; i < answer.series.size(); ++i) {
    const HistorySeries& series = answer.series[i];
    const int index = static_cast<int>(i) * kSeries / kAskedSeries;
    if (series.id != AskedSeries()[i]) return "series out of order";
    // Two hours a point, over 30 days of hour rows.
    if (series.times.size() != 30 * 12 || series.times.size() > kPoints) {
      return series.id + " has " + std::to_string(series.times.size()) + " points";
    }
    for (size_t k = 0; k < series.times.size(); ++k) {
      if (series.times[k] != kFrom + static_cast<int64_t>(k) * answer.step ||
          series.avg[k] != index + 0.25 || series.min[k] != index - 1 ||
          series.max[k] != index + 1.5) {
        return series.id + " point " + std::to_string(k) + " isn't as loaded";
      }
    }
  }
  return "";
}

void BM_History(benchmark::State& state, PgHistory* history) {
  for (auto _ : state) {
    HistoryAnswer answer;
    std::string error;
    if (!history->Query(AskedSeries(), kFrom, kNow, kPoints, answer, error)) {
      state.SkipWithError(error.c_str());
      break;
    }
    const std::string wrong = CheckAnswer(answer);
    if (!wrong.empty()) {
      state.SkipWithError(wrong.c_str());
      break;
    }
  }
}

// Times the query on `history` in real time (the work is the server's), ten
// times for a median.
void Register(const std::string& name, PgHistory* history) {
  benchmark::RegisterBenchmark(name.c_str(), BM_History, history)
      ->Unit(benchmark::kMillisecond)
      ->UseRealTime()
      ->Repetitions(10)
      ->ReportAggregatesOnly(true);
}

// The console's report, keeping each benchmark's median.
class MedianReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& run : runs) {
      if (run.run_type == Run::RT_Aggregate && run.aggregate_name == "median" &&
          !run.error_occurred) {
        medians_[run.run_name.function_name] = run.GetAdjustedRealTime();
      }
    }
    ConsoleReporter::ReportRuns(runs);
  }
  double Median(const std::string& name) const {
    const auto found = medians_.find(name);
    return found == medians_.end() ? 0 : found->second;
  }

 private:
  std::map<std::string, double> medians_;
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
  const PgHistoryTuning tuning{[] { return kNow; }, std::chrono::milliseconds(4000)};
  // History stays off: the writers never connect, only queries do.
  const std::string store_name = "history/partitioned";
  PgHistory store(pg.conninfo(), pg.dir() + "/spool", kDefaultSpoolBytes, log, tuning);
  Register(store_name, &store);
  std::vector<std::unique_ptr<PgHistory>> baselines;
  for (const Store* baseline = kBaselines; baseline->schema != nullptr; ++baseline) {
    const std::string schema = baseline->schema;
    baselines.push_back(std::make_unique<PgHistory>(
        pg.conninfo() + " options='-c search_path=" + schema + "'", pg.dir() + "/spool_" + schema,
        kDefaultSpoolBytes, log, tuning));
    Register("history/" + schema, baselines.back().get());
  }
  MedianReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  benchmark::Shutdown();
  const double fast = reporter.Median(store_name);
  printf("median %s: %.2f ms (target under 50 ms)\n", store_name.c_str(), fast);
  bool measured = fast > 0;
  for (const Store* baseline = kBaselines; baseline->schema != nullptr; ++baseline) {
    const std::string name = std::string("history/") + baseline->schema;
    const double slow = reporter.Median(name);
    measured = measured && slow > 0;
    if (fast > 0 && slow > 0) {
      printf(
          "median %s: %.2f ms: %s : partitioned = %.2f (above 1: the partitioned store is "
          "faster)\n",
          name.c_str(), slow, baseline->schema, slow / fast);
    }
  }
  if (!measured) {
    fprintf(stderr, "a benchmark failed or was filtered out; no ratio\n");
    return 1;
  }
  return 0;
}
