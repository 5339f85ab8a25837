#include "statd/pg_history.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <atomic>
#include <filesystem>
#include <memory>
#include <mutex>

#include "statd/spool.h"
#include "test_support/test_postgres.h"
#include "test_support/test_root.h"

namespace statd {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;

constexpr int64_t kHour = 3600;
constexpr int64_t kDay = 86400;
constexpr int64_t kDay0 = 1700006400;  // 2023-11-15 00:00 UTC
constexpr auto kWait = std::chrono::seconds(15);
constexpr char kSpool[] = "/var/lib/kova/statd/spool";

constexpr char kMinuteRowsSql[] =
    "SELECT s.name, extract(epoch FROM r.time)::bigint, r.samples, r.avg, r.min, r.max "
    "FROM minute_rows r JOIN series s ON s.id = r.series_id ORDER BY 2, 1, 3";
constexpr char kHourRowsSql[] =
    "SELECT s.name, extract(epoch FROM r.time)::bigint, r.samples, r.avg, r.min, r.max "
    "FROM hour_rows r JOIN series s ON s.id = r.series_id ORDER BY 2, 1";

MinuteRow Row(const char* series, int64_t minute, double avg = 1) {
  return {series, minute, 60, avg, avg, avg};
}

class PgHistoryTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(pg_.ok()); }

  // A history of the test's database and spool, switched on.
  std::unique_ptr<PgHistory> Make() {
    auto history = std::make_unique<PgHistory>(
        pg_.conninfo(), root_.Path(kSpool), kDefaultSpoolBytes,
        [this](int, const std::string& text) {
          std::lock_guard<std::mutex> lock(log_mutex_);
          log_.push_back(text);
        },
        PgHistoryTuning{[this] { return now_.load(); }, std::chrono::milliseconds(300)});
    history->Configure({true, 31, 1827});
    return history;
  }

  std::vector<std::string> Log() {
    std::lock_guard<std::mutex> lock(log_mutex_);
    return log_;
  }

  // The rows of `sql`, each as its fields joined by blanks.
  std::vector<std::string> Rows(const std::string& sql) const {
    std::vector<std::string> lines;
    for (const auto& row : pg_.Sql(sql)) {
      std::string line;
      for (const std::string& field : row) line += (line.empty() ? "" : " ") + field;
      lines.push_back(line);
    }
    return lines;
  }

  // The partitions of `table`, by their days' dates.
  std::vector<std::string> Partitions(const std::string& table) const {
    std::vector<std::string> days;
    for (const std::string& name :
         Rows("SELECT c.relname FROM pg_inherits i JOIN pg_class c ON c.oid = i.inhrelid "
              "WHERE i.inhparent = '" +
              table + "'::regclass ORDER BY 1")) {
      days.push_back(name.substr(table.size() + 1));
    }
    return days;
  }

  size_t SpoolFiles() const {
    size_t count = 0;
    for (const auto& file : std::filesystem::directory_iterator(root_.Path(kSpool))) {
      count += file.is_regular_file();
    }
    return count;
  }

  kova_test::TestPostgres pg_;
  kova_test::TestRoot root_;
  std::atomic<int64_t> now_{kDay0 + 12 * kHour};
  std::mutex log_mutex_;
  std::vector<std::string> log_;
};

TEST_F(PgHistoryTest, WritesMinutesAndReadsThemBack) {
  auto history = Make();
  const int64_t minute = kDay0 + 10 * kHour;
  history->Add(
      {{"cpu.user", minute, 60, 12.5, 1, 99.5}, {"net.rx_bytes@eth0", minute, 59, 1e9, 0, 2.5e9}});
  history->Add({{"cpu.user", minute + 60, 30, 0.25, 0, 0.5},
                {"bad\nname", minute, 1, 1, 1, 1},
                {"cpu.user", minute + 7, 1, 1, 1, 1}});
  ASSERT_TRUE(history->WaitWritten(kWait));
  EXPECT_EQ(history->State(), HistoryState::kWriting);
  EXPECT_THAT(Rows(kMinuteRowsSql),
              ElementsAre("cpu.user 1700042400 60 12.5 1 99.5",
                          "net.rx_bytes@eth0 1700042400 59 1000000000 0 2500000000",
                          "cpu.user 1700042460 30 0.25 0 0.5"));
  EXPECT_EQ(SpoolFiles(), 0u);

  HistoryAnswer answer;
  std::string error;
  ASSERT_TRUE(history->Query({"cpu.user"}, minute, minute + 119, 2, answer, error)) << error;
  EXPECT_EQ(answer.source, "minute");
  EXPECT_EQ(answer.step, 60);
  ASSERT_EQ(answer.series.size(), 1u);
  EXPECT_THAT(answer.series[0].times, ElementsAre(minute, minute + 60));
  EXPECT_THAT(answer.series[0].avg, ElementsAre(12.5, 0.25));
  EXPECT_THAT(answer.series[0].min, ElementsAre(1, 0));
  EXPECT_THAT(answer.series[0].max, ElementsAre(99.5, 0.5));
  EXPECT_THAT(Log(), ElementsAre("2 history rows are left out: a series name holds a control "
                                 "character"));
}

TEST_F(PgHistoryTest, RollsUpCompleteHoursOnceEach) {
  auto history = Make();
  const int64_t hour = kDay0 + 5 * kHour;
  history->Add({{"a", hour, 60, 10, 5, 20}, {"b", hour, 1, -4, -4, -4}});
  history->Add({{"a", hour + 60, 30, 40, 1, 50}});
  ASSERT_TRUE(history->WaitWritten(kWait));
  EXPECT_THAT(Rows(kHourRowsSql), IsEmpty());  // no later minute yet

  history->Add({{"a", hour + kHour, 1, 0, 0, 0}});
  ASSERT_TRUE(history->WaitWritten(kWait));
  // avg (60 * 10 + 30 * 40) / 90
  EXPECT_THAT(Rows(kHourRowsSql),
              ElementsAre("a 1700024400 90 20 1 50", "b 1700024400 1 -4 -4 -4"));

  // A late minute rolls its hour again.
  history->Add({{"a", hour + 120, 10, 110, 0, 100}});
  ASSERT_TRUE(history->WaitWritten(kWait));
  EXPECT_THAT(Rows(kHourRowsSql),
              ElementsAre("a 1700024400 100 29 0 100", "b 1700024400 1 -4 -4 -4"));
  EXPECT_EQ(Rows(kMinuteRowsSql).size(), 5u);
  EXPECT_THAT(Log(), IsEmpty());
}

TEST_F(PgHistoryTest, DropsWholeDayPartitionsPastTheRetention) {
  auto history = Make();
  history->Configure({true, 40, 40});
  history->Add({Row("cpu.user", kDay0 - 3 * kDay + kHour), Row("cpu.user", kDay0 - kDay + kHour),
                Row("cpu.user", kDay0 + kHour)});
  const struct {
    int minute_days, hour_days;
    int64_t advance;  // seconds the clock moves first
    std::vector<std::string> minute_partitions, hour_partitions;
  } steps[] = {
      {40, 40, 0, {"20231112", "20231114", "20231115"}, {"20231112", "20231114", "20231115"}},
      // hour rows are kept at least as long as minute rows
      {3, 1, 0, {"20231112", "20231114", "20231115"}, {"20231112", "20231114", "20231115"}},
      {2, 3, 0, {"20231114", "20231115"}, {"20231112", "20231114", "20231115"}},
      // a day goes once all of it is past: 1 day back from noon keeps yesterday
      {1, 2, 0, {"20231114", "20231115"}, {"20231114", "20231115"}},
      // the clock alone moves the retention on
      {1, 2, 2 * kDay, {"20231117"}, {"20231115", "20231117"}},
  };
  for (size_t step = 0; step < std::size(steps); ++step) {
    const auto& s = steps[step];
    now_ += s.advance;
    history->Configure({true, s.minute_days, s.hour_days});
    history->Add({Row("cpu.user", now_ - now_ % 60 - kHour + 60 * static_cast<int64_t>(step))});
    ASSERT_TRUE(history->WaitWritten(kWait));
    EXPECT_THAT(Partitions("minute_rows"), ElementsAreArray(s.minute_partitions)) << step;
    EXPECT_THAT(Partitions("hour_rows"), ElementsAreArray(s.hour_partitions)) << step;
  }
  EXPECT_THAT(Log(), IsEmpty());
}

TEST_F(PgHistoryTest, SpoolsWhileTheDatabaseIsStoppedAndCatchesUp) {
  auto history = Make();
  const int64_t minute = kDay0 + 3 * kHour;
  history->Add({Row("cpu.user", minute)});
  ASSERT_TRUE(history->WaitWritten(kWait));
  ASSERT_TRUE(pg_.Stop());

  history->Add({Row("cpu.user", minute + 60)});
  history->Add({Row("cpu.user", minute + 120)});
  EXPECT_FALSE(history->WaitWritten(std::chrono::milliseconds(500)));
  EXPECT_EQ(history->State(), HistoryState::kWaiting);
  EXPECT_EQ(SpoolFiles(), 2u);
  HistoryAnswer answer;
  std::string error;
  EXPECT_FALSE(history->Query({"cpu.user"}, minute, minute + kHour, 10, answer, error));
  EXPECT_THAT(error, StartsWith("The history database can't be reached: "));
  // Rows taken while on are written even after history is switched off.
  history->Configure({false, 31, 1827});
  EXPECT_EQ(history->State(), HistoryState::kOff);

  ASSERT_TRUE(pg_.Start());
  ASSERT_TRUE(history->WaitWritten(kWait));
  EXPECT_THAT(Rows("SELECT extract(epoch FROM time)::bigint, count(*) FROM minute_rows "
                   "GROUP BY 1 ORDER BY 1"),
              ElementsAre("1700017200 1", "1700017260 1", "1700017320 1"));
  EXPECT_EQ(SpoolFiles(), 0u);
  EXPECT_THAT(Log(), ElementsAre(HasSubstr("history rows wait in the spool"),
                                 "history rows reach the database again"));
}

TEST_F(PgHistoryTest, TwoRunsWriteTheirPartsOfAMinuteAndAReplayNeverDoublesRows) {
  const int64_t minute = kDay0 + 4 * kHour;
  // An older version's record of 03:58 as written, and its spool files of
  // 03:58 (written then) and 03:59 (not yet).
  ASSERT_THAT(Rows("CREATE TABLE written_minutes (minute timestamptz PRIMARY KEY);"
                   "INSERT INTO written_minutes VALUES (to_timestamp(" +
                   std::to_string(minute - 120) + "))"),
              IsEmpty());
  for (const int64_t old : {minute - 120, minute - 60}) {
    root_.Write(std::string(kSpool) + "/" + std::to_string(old) + ".rows",
                SpoolText(old, {Row("cpu.user", old, 6)}));
  }
  {
    auto history = Make();
    // The first 20 seconds of 04:00, handed over as the run stops.
    history->Add({{"cpu.user", minute, 20, 1, 0, 2}});
    ASSERT_TRUE(history->WaitWritten(kWait));
    // As if a crash came between that batch's commit and its file's removal.
    const std::vector<std::string> written =
        Rows("SELECT run || '_' || seq FROM written_batches WHERE minute = to_timestamp(" +
             std::to_string(minute) + ")");
    ASSERT_EQ(written.size(), 1u);
    root_.Write(std::string(kSpool) + "/" + std::to_string(minute) + "_" + written[0] + ".rows",
                SpoolText(minute, {{"cpu.user", minute, 20, 1, 0, 2}}));
    ASSERT_TRUE(pg_.Stop());
    history->Add({Row("cpu.user", minute + 60, 2)});
    history->Add({Row("cpu.user", minute + 120, 3)});
  }
  auto history = Make();
  ASSERT_TRUE(pg_.Start());
  // The next run: the other 40 seconds of 04:00, then a minute of the next hour.
  history->Add({{"cpu.user", minute, 40, 5.5, 3, 8}});
  history->Add({Row("cpu.user", minute + kHour, 7)});
  ASSERT_TRUE(history->WaitWritten(kWait));
  EXPECT_THAT(Rows(kMinuteRowsSql),
              ElementsAre("cpu.user 1700020740 60 6 6 6", "cpu.user 1700020800 20 1 0 2",
                          "cpu.user 1700020800 40 5.5 3 8", "cpu.user 1700020860 60 2 2 2",
                          "cpu.user 1700020920 60 3 3 3", "cpu.user 1700024400 60 7 7 7"));
  // Both parts of 04:00 count by their samples: (20 * 1 + 40 * 5.5 + 60 * 2 + 60 * 3) / 180.
  EXPECT_THAT(Rows(kHourRowsSql),
              ElementsAre("cpu.user 1700017200 60 6 6 6", "cpu.user 1700020800 180 3 0 8"));
  HistoryAnswer answer;
  std::string error;
  ASSERT_TRUE(history->Query({"cpu.user"}, minute, minute + 59, 1, answer, error)) << error;
  ASSERT_EQ(answer.series.size(), 1u);
  EXPECT_THAT(answer.series[0].times, ElementsAre(minute));
  EXPECT_THAT(answer.series[0].avg, ElementsAre(4));  // (20 * 1 + 40 * 5.5) / 60
  EXPECT_THAT(answer.series[0].min, ElementsAre(0));
  EXPECT_THAT(answer.series[0].max, ElementsAre(8));
  EXPECT_EQ(SpoolFiles(), 0u);
  const std::vector<std::string> log = Log();
  EXPECT_THAT(log, Contains("2 batches of history rows of an earlier run wait in the spool"));
  EXPECT_THAT(log, Contains("3 batches of history rows of an earlier run wait in the spool"));
  EXPECT_THAT(log, Contains(HasSubstr("rows of 2023-11-15 03:58:00+00 were in the database")));
  EXPECT_THAT(log, Contains(HasSubstr("rows of 2023-11-15 04:00:00+00 were in the database")));
}

TEST_F(PgHistoryTest, ReducesEachSeriesOnTheServer) {
  // Series "a" over three hours and 21 minutes: even minutes 30 samples of
  // 100 * hour, odd minutes 10 samples of 100 * hour + 40, each within +-5.
  // Series "b" from the third hour on, 60 samples of 7. Hours 0 to 2 are
  // rolled up (hour 2: 1200 samples of 210); hour 3 isn't (430 samples of
  // 133000 / 430, from 295 to 345).
  const int64_t start = kDay0 + 6 * kHour;
  now_ = kDay0 + 2 * kDay;
  std::vector<MinuteRow> rows;
  for (int i = 0; i <= 200; ++i) {
    const double avg = 100 * (i / 60) + (i % 2 ? 40 : 0);
    rows.push_back({"a", start + 60 * i, i % 2 ? 10 : 30, avg, avg - 5, avg + 5});
    if (i >= 120) rows.push_back({"b", start + 60 * i, 60, 7, 7, 7});
  }
  auto history = Make();
  history->Add(rows);
  ASSERT_TRUE(history->WaitWritten(kWait));

  struct Point {
    int64_t time;
    double avg, min, max;
  };
  const struct {
    const char* name;
    int minute_days;
    int64_t from, to;
    int points;
    int64_t step;
    const char* source;
    size_t a_points;
    Point a_first, a_last;
    size_t b_points;
  } cases[] = {
      {"two minutes a point",
       31,
       start,
       start + 3599,
       30,
       120,
       "minute",
       30,
       {start, 10, -5, 45},
       {start + 3480, 10, -5, 45},
       0},
      {"a row at `to` takes a point more: two minutes a point",
       31,
       start,
       start + 3600,
       60,
       120,
       "minute",
       31,
       {start, 10, -5, 45},
       {start + 3600, 100, 95, 105},
       0},
      {"an unaligned start keeps its whole first point",
       31,
       start + 90,
       start + 3689,
       30,
       180,
       "minute",
       21,
       {start, 400.0 / 70, -5, 45},
       {start + 3600, 110, 95, 145},
       0},
      {"an hour a point",
       31,
       start,
       start + 3 * kHour - 1,
       3,
       kHour,
       "hour",
       3,
       {start, 10, -5, 45},
       {start + 2 * kHour, 210, 195, 245},
       1},
      {"from 06:30 two hours a point from 06:00",
       31,
       start + 1800,
       start + 3 * kHour - 1,
       2,
       2 * kHour,
       "hour",
       2,
       {start, 60, -5, 145},
       {start + 2 * kHour, 210, 195, 245},
       1},
      {"the hour not rolled up comes from minute rows",
       31,
       start,
       start + 4 * kHour - 1,
       4,
       kHour,
       "hour",
       4,
       {start, 10, -5, 45},
       {start + 3 * kHour, 133000.0 / 430, 295, 345},
       2},
      {"a point of an hour row and minute rows",
       31,
       start,
       start + 4 * kHour - 1,
       2,
       2 * kHour,
       "hour",
       2,
       {start, 60, -5, 145},
       {start + 2 * kHour, (252000.0 + 133000) / 1630, 195, 345},
       1},
      {"older than the minute rows",
       1,
       start,
       start + 2 * kHour - 1,
       100,
       kHour,
       "hour",
       2,
       {start, 10, -5, 45},
       {start + kHour, 110, 95, 145},
       0},
  };
  for (const auto& c : cases) {
    history->Configure({true, c.minute_days, 1827});
    HistoryAnswer answer;
    std::string error;
    ASSERT_TRUE(history->Query({"b", "nope", "a"}, c.from, c.to, c.points, answer, error))
        << c.name << ": " << error;
    EXPECT_EQ(answer.step, c.step) << c.name;
    EXPECT_EQ(answer.source, c.source) << c.name;
    ASSERT_EQ(answer.series.size(), 3u) << c.name;
    EXPECT_EQ(answer.series[0].id, "b");
    EXPECT_EQ(answer.series[0].times.size(), c.b_points) << c.name;
    EXPECT_EQ(answer.series[1].id, "nope");
    EXPECT_THAT(answer.series[1].times, IsEmpty());
    const HistorySeries& a = answer.series[2];
    EXPECT_EQ(a.id, "a");
    ASSERT_EQ(a.times.size(), c.a_points) << c.name;
    ASSERT_TRUE(a.avg.size() == a.times.size() && a.min.size() == a.times.size() &&
                a.max.size() == a.times.size())
        << c.name;
    const Point first = {a.times.front(), a.avg.front(), a.min.front(), a.max.front()};
    const Point last = {a.times.back(), a.avg.back(), a.min.back(), a.max.back()};
    for (const auto& [got, want] : {std::pair{first, c.a_first}, std::pair{last, c.a_last}}) {
      EXPECT_EQ(got.time, want.time) << c.name;
      EXPECT_DOUBLE_EQ(got.avg, want.avg) << c.name;
      EXPECT_EQ(got.min, want.min) << c.name;
      EXPECT_EQ(got.max, want.max) << c.name;
    }
  }
  HistoryAnswer answer;
  std::string error;
  EXPECT_FALSE(history->Query({"a"}, start, start, 10, answer, error));
  EXPECT_EQ(error, "The history's start must come before its end.");
  EXPECT_FALSE(history->Query({"a"}, start, start + 60, 0, answer, error));
  EXPECT_EQ(error, "The number of points must be at least 1.");
  EXPECT_FALSE(history->Query({"a"}, -60, start, 10, answer, error));
  EXPECT_EQ(error, "The history's times must lie between 0 and 2^40.");
}

TEST_F(PgHistoryTest, AHungServerHoldsNeitherQueriesNorTheStop) {
  auto history = Make();
  history->Add({Row("cpu.user", kDay0)});
  ASSERT_TRUE(history->WaitWritten(kWait));
  const pid_t server = pg_.ServerPid();
  ASSERT_GT(server, 0);
  // The stopped postmaster takes no new connection: connects hang.
  ASSERT_EQ(kill(server, SIGSTOP), 0);
  auto hung = Make();
  HistoryAnswer answer;
  std::string error;
  const bool answered = hung->Query({"cpu.user"}, kDay0, kDay0 + kHour, 10, answer, error);
  const auto stop_start = std::chrono::steady_clock::now();
  hung.reset();
  const auto stop_took = std::chrono::steady_clock::now() - stop_start;
  kill(server, SIGCONT);
  EXPECT_FALSE(answered);
  EXPECT_EQ(error, "The history database can't be reached: the server didn't answer in time.");
  EXPECT_LT(stop_took, std::chrono::seconds(3));
}

}  // namespace
}  // namespace statd
