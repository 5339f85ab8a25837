#include "statd/pg_history.h"

#include <sys/eventfd.h>
#include <sys/random.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstring>
#include <optional>

#include "statd/pg_query.h"
#include "statd/pg_schema.h"

namespace statd {
namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

constexpr milliseconds kRetryMin{250};
constexpr std::chrono::seconds kWriterTimeout{30};
// The client's whole exchange has 3 s; the server ends a statement after the
// tuning's query_timeout (2 s), the reader gives up this much later.
constexpr milliseconds kQueryGrace{500};
constexpr char kWriterSessionSql[] = "SET lock_timeout = 5000";
constexpr char kQueryCanceled[] = "57014";
constexpr char kUndefinedTable[] = "42P01";
constexpr int64_t kPrunePeriod = 300;  // seconds between two prunings
constexpr std::chrono::seconds kIdleWake{60};
constexpr int64_t kSeriesIdle = 86400;  // seconds unused before a series' id is forgotten

// A number for this run's spool batches: 63 random bits, never 0 (an older
// version's batches).
int64_t NewRunId() {
  uint64_t bits = 0;
  if (getrandom(&bits, sizeof(bits), GRND_NONBLOCK) != sizeof(bits)) {
    // No entropy yet (early boot): the clock and the process id still differ
    // from run to run.
    bits = static_cast<uint64_t>(std::chrono::system_clock::now().time_since_epoch().count()) ^
           (static_cast<uint64_t>(getpid()) << 40);
  }
  bits &= INT64_MAX;
  return bits == 0 ? 1 : static_cast<int64_t>(bits);
}

// Why `row` can't be stored; empty when it can.
const char* RowProblem(const MinuteRow& row) {
  if (row.series.empty()) return "a row has no series";
  for (unsigned char c : row.series) {
    if (c < 0x20 || c == 0x7f) return "a series name holds a control character";
  }
  if (row.minute % 60 != 0) return "a row's time isn't the start of a minute";
  if (row.samples < 1) return "a row has no samples";
  if (!std::isfinite(row.avg) || !std::isfinite(row.min) || !std::isfinite(row.max)) {
    return "a row's value isn't a finite number";
  }
  return "";
}

// `row` as a line of COPY's text format.
void AppendCopyLine(std::string& data, int64_t series_id, const MinuteRow& row) {
  data += std::to_string(series_id) + '\t' + UtcTimestamp(row.minute) + '\t' +
          std::to_string(row.samples);
  for (double value : {row.avg, row.min, row.max}) {
    data += '\t';
    AppendNumber(data, value);
  }
  data += '\n';
}

template <typename Number>
Number Field(const PGresult* result, int row, int column) {
  const char* text = PQgetvalue(result, row, column);
  Number value{};
  std::from_chars(text, text + strlen(text), value);
  return value;
}

}  // namespace

PgHistory::PgHistory(std::string conninfo, std::string spool_dir, uint64_t spool_bytes,
                     SystemLog log, PgHistoryTuning tuning)
    : conninfo_(std::move(conninfo)),
      log_(std::move(log)),
      tuning_(std::move(tuning)),
      stop_fd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
      run_(NewRunId()),
      spool_(std::move(spool_dir), spool_bytes, run_, log_),
      writer_(stop_fd_),
      reader_(stop_fd_) {
  spool_.Restore();
  thread_ = std::thread([this] { Run(); });
}

PgHistory::~PgHistory() {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    stop_ = true;
  }
  wake_.notify_all();
  const uint64_t one = 1;
  if (stop_fd_ >= 0 && write(stop_fd_, &one, sizeof(one)) < 0) {
    log_(LOG_ERR, "can't signal the history writer to stop");
  }
  thread_.join();
  {
    std::lock_guard<std::mutex> lock(query_mutex_);
    reader_.Close();
  }
  writer_.Close();
  if (stop_fd_ >= 0) close(stop_fd_);
}

void PgHistory::Configure(const HistorySettings& settings) {
  HistorySettings checked = settings;
  const HistorySettings defaults;
  if (checked.minute_days < 1) {
    log_(LOG_WARNING, "resourcemonitor_history_minute_days must be at least 1; " +
                          std::to_string(defaults.minute_days) + " is used");
    checked.minute_days = defaults.minute_days;
  }
  if (checked.hour_days < 1) {
    log_(LOG_WARNING, "resourcemonitor_history_hour_days must be at least 1; " +
                          std::to_string(defaults.hour_days) + " is used");
    checked.hour_days = defaults.hour_days;
  }
  std::lock_guard<std::mutex> lock(mutex_);
  if (checked.minute_days != settings_.minute_days || checked.hour_days != settings_.hour_days) {
    prune_due_ = true;
  }
  settings_ = checked;
  enabled_ = checked.enabled;
  minute_days_ = checked.minute_days;
  woken_ = true;
  wake_.notify_all();
}

void PgHistory::Add(std::vector<MinuteRow> rows) {
  std::map<int64_t, std::vector<MinuteRow>> minutes;
  size_t refused = 0;
  std::string problem;
  for (MinuteRow& row : rows) {
    const char* why = RowProblem(row);
    if (*why == '\0') {
      minutes[row.minute].push_back(std::move(row));
    } else if (refused++ == 0) {
      problem = why;
    }
  }
  if (refused > 0) {
    log_(LOG_WARNING, std::to_string(refused) + " history rows are left out: " + problem);
  }
  if (minutes.empty()) return;
  std::lock_guard<std::mutex> lock(mutex_);
  for (auto& [minute, minute_rows] : minutes) spool_.Put(minute, std::move(minute_rows));
  woken_ = true;
  wake_.notify_all();
}

HistoryState PgHistory::State() const {
  if (!enabled_) return HistoryState::kOff;
  return reachable_ ? HistoryState::kWriting : HistoryState::kWaiting;
}

bool PgHistory::WaitWritten(milliseconds timeout) {
  std::unique_lock<std::mutex> lock(mutex_);
  return idle_.wait_for(lock, timeout, [&] { return spool_.empty() && !in_pass_ && !woken_; });
}

void PgHistory::Run() {
  std::unique_lock<std::mutex> lock(mutex_);
  milliseconds retry = kRetryMin;
  steady_clock::time_point retry_at;
  while (!stop_) {
    if (!settings_.enabled && spool_.empty()) {
      // Nothing to write: no connection is kept while history is off.
      writer_.Close();
      woken_ = false;
      idle_.notify_all();
      wake_.wait(lock, [&] { return stop_ || woken_; });
      continue;
    }
    if (steady_clock::now() < retry_at) {
      wake_.wait_until(lock, retry_at, [&] { return stop_; });
      continue;
    }
    woken_ = false;
    in_pass_ = true;
    lock.unlock();
    PgError error;
    const bool ok = Pass(error);
    lock.lock();
    in_pass_ = false;
    if (stop_) break;
    SetReachable(ok, error.message);
    if (ok) {
      retry = kRetryMin;
      retry_at = {};
    } else {
      writer_.Close();
      retry_at = steady_clock::now() + retry;
      retry = std::min(retry * 2, tuning_.retry_max);
    }
    idle_.notify_all();
    if (ok) wake_.wait_for(lock, kIdleWake, [&] { return stop_ || woken_; });
  }
  idle_.notify_all();
}

bool PgHistory::Pass(PgError& error) {
  if (!writer_.is_open() && !Connect(error)) return false;
  const int64_t now = Now();
  bool prune = false;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    prune = prune_due_ || now - last_prune_ >= kPrunePeriod || now < last_prune_;
    prune_due_ = false;
  }
  if (prune && !Prune(error)) return false;
  if (prune) {
    // Series gone for a day (a removed interface, an ended service) leave the
    // cache; their rows in `series` stay, a name and a number each, and give
    // the same id back if they return.
    std::erase_if(series_ids_,
                  [&](const auto& known) { return now - known.second.used >= kSeriesIdle; });
  }
  for (;;) {
    std::optional<SpoolBatch> batch;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      if (stop_) {
        error = {"stopped", ""};
        return false;
      }
      batch = spool_.Take();
    }
    if (!batch) return true;
    const bool written = WriteBatch(*batch, error);
    {
      std::lock_guard<std::mutex> lock(mutex_);
      spool_.Done(batch->id, written);
    }
    if (!written) return false;
  }
}

bool PgHistory::Connect(PgError& error) {
  const Deadline deadline = WriterDeadline();
  if (!writer_.Open(conninfo_, deadline, error) || !writer_.Run(kSessionSql, {}, deadline, error) ||
      !writer_.Run(kWriterSessionSql, {}, deadline, error) ||
      !writer_.Run(kCreateSchemaSql, {}, deadline, error)) {
    writer_.Close();
    return false;
  }
  // The database may have been replaced meanwhile.
  series_ids_.clear();
  partitions_.clear();
  return true;
}

bool PgHistory::WriteBatch(const SpoolBatch& batch, PgError& error) {
  const int64_t minute = batch.id.minute;
  if (!EnsurePartitions(minute, error) || !EnsureSeries(batch.rows, error)) return false;
  std::string data;
  const int64_t now = Now();
  for (const MinuteRow& row : batch.rows) {
    KnownSeries& known = series_ids_[row.series];
    known.used = now;
    AppendCopyLine(data, known.id, row);
  }
  const Deadline deadline = WriterDeadline();
  PgResult marked;
  if (!writer_.Run("BEGIN", {}, deadline, error) ||
      !writer_.Run(
          kMarkWrittenSql,
          {std::to_string(minute), std::to_string(batch.id.run), std::to_string(batch.id.seq)},
          deadline, marked, error)) {
    return false;
  }
  if (strcmp(PQcmdTuples(marked.get()), "0") == 0) {
    log_(LOG_INFO, "history rows of " + UtcTimestamp(minute) +
                       " were in the database already; the spool's copy is dropped");
    return writer_.Run("ROLLBACK", {}, deadline, error);
  }
  const int64_t hour = minute - minute % kSecondsPerHour;
  PgResult hours;
  if (!writer_.CopyIn(kCopyMinuteRowsSql, data, deadline, error) ||
      !writer_.Run(kMarkHourSql, {std::to_string(hour)}, deadline, error) ||
      !writer_.Run(kCompleteHoursSql, {}, deadline, hours, error)) {
    return false;
  }
  // Every hour before the newest minute's is complete: roll up those with new minutes.
  for (int row = 0; row < PQntuples(hours.get()); ++row) {
    const int64_t start = Field<int64_t>(hours.get(), row, 0);
    if (!writer_.Run(kRollUpSql, {std::to_string(start), std::to_string(start + kSecondsPerHour)},
                     deadline, error) ||
        !writer_.Run(kForgetHoursSql, {std::to_string(start + kSecondsPerHour)}, deadline, error)) {
      return false;
    }
  }
  return writer_.Run("COMMIT", {}, deadline, error);
}

bool PgHistory::EnsurePartitions(int64_t time, PgError& error) {
  for (const RowTable* table = kRowTables; table->name != nullptr; ++table) {
    const std::string name = PartitionName(table->name, time);
    if (partitions_.count(name) != 0) continue;
    if (!writer_.Run(CreatePartitionSql(table->name, time), {}, WriterDeadline(), error)) {
      return false;
    }
    partitions_.insert(name);
  }
  return true;
}

bool PgHistory::EnsureSeries(const std::vector<MinuteRow>& rows, PgError& error) {
  std::vector<std::string> missing;
  for (const MinuteRow& row : rows) {
    if (series_ids_.count(row.series) == 0) missing.push_back(row.series);
  }
  if (missing.empty()) return true;
  const Deadline deadline = WriterDeadline();
  const std::string names = TextArray(missing);
  PgResult ids;
  if (!writer_.Run(kAddSeriesSql, {names}, deadline, error) ||
      !writer_.Run(kSeriesIdsSql, {names}, deadline, ids, error)) {
    return false;
  }
  for (int row = 0; row < PQntuples(ids.get()); ++row) {
    series_ids_[PQgetvalue(ids.get(), row, 1)] = {Field<int64_t>(ids.get(), row, 0), Now()};
  }
  for (const std::string& name : missing) {
    if (series_ids_.count(name) == 0) {
      error = {"the series table has no id for " + name, ""};
      return false;
    }
  }
  return true;
}

bool PgHistory::Prune(PgError& error) {
  HistorySettings settings;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    settings = settings_;
  }
  const int64_t now = Now();
  const Deadline deadline = WriterDeadline();
  PgError failure;
  bool ok = true;
  const int64_t minute_start = now - settings.minute_days * kSecondsPerDay;
  for (const RowTable* table = kRowTables; ok && table->name != nullptr; ++table) {
    // Hour rows are kept at least as long as the minute rows they come from.
    const int64_t days = std::max(settings.*(table->days), settings.minute_days);
    const int64_t start = now - days * kSecondsPerDay;
    PgResult names;
    ok = writer_.Run(kPartitionsSql, {table->name}, deadline, names, failure);
    for (int row = 0; ok && row < PQntuples(names.get()); ++row) {
      const std::string name = PQgetvalue(names.get(), row, 0);
      const std::optional<int64_t> day = PartitionDay(table->name, name);
      if (!day || *day + kSecondsPerDay > start) continue;
      ok = writer_.Run("DROP TABLE IF EXISTS " + name, {}, deadline, failure);
      partitions_.erase(name);
    }
  }
  // The record of written batches goes with the days dropped, not before.
  const int64_t first_day = minute_start - (minute_start % kSecondsPerDay);
  ok = ok && writer_.Run(kForgetBatchesSql, {std::to_string(first_day)}, deadline, failure);
  last_prune_ = now;
  if (!writer_.is_open()) {
    error = failure;
    return false;
  }
  if (!ok && !said_prune_failed_) {
    log_(LOG_ERR, "can't drop the old history partitions: " + failure.message);
  }
  said_prune_failed_ = !ok;
  return true;
}

bool PgHistory::Query(const std::vector<std::string>& series, int64_t from, int64_t to, int points,
                      HistoryAnswer& answer, std::string& error) {
  answer = HistoryAnswer();
  if (points < 1) {
    error = "The number of points must be at least 1.";
    return false;
  }
  if (from >= to) {
    error = "The history's start must come before its end.";
    return false;
  }
  if (from < 0 || to > kMaxHistoryTime) {
    error = "The history's times must lie between 0 and 2^40.";
    return false;
  }
  const int64_t minute_days = minute_days_;
  const QueryPlan plan = PlanQuery(from, to, points, Now() - minute_days * kSecondsPerDay);
  answer.step = plan.step;
  answer.source = plan.hours ? "hour" : "minute";
  std::map<std::string, std::vector<size_t>> places;
  for (const std::string& id : series) {
    places[id].push_back(answer.series.size());
    answer.series.push_back({id, {}, {}, {}, {}});
  }
  if (series.empty()) return true;

  std::lock_guard<std::mutex> lock(query_mutex_);
  const Deadline deadline = steady_clock::now() + tuning_.query_timeout + kQueryGrace;
  // Statements this short gain nothing from JIT compiling; it costs milliseconds.
  const std::string session_sql =
      "SET statement_timeout = " + std::to_string(tuning_.query_timeout.count()) +
      "; SET jit = off";
  const std::vector<std::string> params = {TextArray(series), std::to_string(plan.origin),
                                           std::to_string(to), std::to_string(plan.step)};
  PgError failure;
  PgResult rows;
  bool ok = false;
  // A connection the server has ended since the last query gets one retry.
  for (int attempt = 0; !ok && attempt < 2; ++attempt) {
    const bool was_open = reader_.is_open();
    if (!was_open && (!reader_.Open(conninfo_, deadline, failure) ||
                      !reader_.Run(kSessionSql, {}, deadline, failure) ||
                      !reader_.Run(session_sql, {}, deadline, failure))) {
      reader_.Close();
      break;
    }
    ok = reader_.Run(QuerySql(plan), params, deadline, rows, failure);
    if (ok || !was_open || reader_.is_open() || failure.message == "stopped" ||
        steady_clock::now() >= deadline) {
      break;
    }
  }
  if (!ok) {
    if (failure.sqlstate == kUndefinedTable) return true;  // nothing was ever written
    if (failure.sqlstate == kQueryCanceled) {
      const int64_t ms = tuning_.query_timeout.count();
      error =
          "The history query took longer than " +
          (ms % 1000 == 0 ? std::to_string(ms / 1000) + " seconds." : std::to_string(ms) + " ms.");
    } else if (!reader_.is_open()) {
      error = "The history database can't be reached: " + failure.message + ".";
    } else {
      error = "The history query failed: " + failure.message + ".";
    }
    return false;
  }
  for (int row = 0; row < PQntuples(rows.get()); ++row) {
    const auto found = places.find(PQgetvalue(rows.get(), row, 0));
    if (found == places.end()) continue;
    const int64_t time = plan.origin + Field<int64_t>(rows.get(), row, 1) * plan.step;
    for (size_t place : found->second) {
      HistorySeries& out = answer.series[place];
      out.times.push_back(time);
      out.avg.push_back(Field<double>(rows.get(), row, 2));
      out.min.push_back(Field<double>(rows.get(), row, 3));
      out.max.push_back(Field<double>(rows.get(), row, 4));
    }
  }
  return true;
}

void PgHistory::SetReachable(bool reachable, const std::string& reason) {
  if (reachable && said_waiting_) {
    log_(LOG_INFO, "history rows reach the database again");
  } else if (!reachable && !said_waiting_) {
    log_(LOG_WARNING,
         "history rows wait in the spool: the database can't be written (" + reason + ")");
  }
  said_waiting_ = !reachable;
  reachable_ = reachable;
}

int64_t PgHistory::Now() const { return tuning_.now ? tuning_.now() : time(nullptr); }

Deadline PgHistory::WriterDeadline() const { return steady_clock::now() + kWriterTimeout; }

}  // namespace statd
