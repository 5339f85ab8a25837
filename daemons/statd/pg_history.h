// kovastatd's history in PostgreSQL (the tables in pg_schema.h).
//
// Add puts each minute's rows in the spool and returns; a writer thread of its
// own writes the spooled batches, oldest first, each with one COPY in one
// transaction with its record of having been written, then removes them from
// the spool. Batches are named by minute and run (a number drawn at the
// start), so that the rest of a minute a restart cut in two is written too,
// while a batch replayed after a crash is not written twice. Hours are rolled up in SQL once a
// later minute is in, old day partitions dropped every few minutes. While the database can't be
// reached the minutes wait in the spool, and the writer tries again with a growing pause; the
// change either way is said once in the system log. Queries use a connection of their own.

#ifndef KOVA_DAEMONS_STATD_PG_HISTORY_H_
#define KOVA_DAEMONS_STATD_PG_HISTORY_H_

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "statd/history_sink.h"
#include "statd/pg_connection.h"
#include "statd/spool.h"

namespace statd {

constexpr uint64_t kDefaultSpoolBytes = 64 << 20;

// What tests and benchmarks change: the clock, how long the writer pauses at
// most before trying the database again, and how long the server may take
// for a query.
struct PgHistoryTuning {
  std::function<int64_t()> now;  // Unix seconds; the system clock when empty
  std::chrono::milliseconds retry_max{4000};
  std::chrono::milliseconds query_timeout{2000};
};

class PgHistory : public HistorySink {
 public:
  // `conninfo`: libpq's connection string. `spool_dir`: the real path of the
  // spool directory, made when missing; the batches it holds from earlier
  // runs are written first. `spool_bytes`: the spool's bound. `log`: the
  // system log, called from any of PgHistory's threads. Starts the writer.
  PgHistory(std::string conninfo, std::string spool_dir, uint64_t spool_bytes, SystemLog log,
            PgHistoryTuning tuning = {});
  // Stops the writer within a moment, even in a hung connect or statement;
  // what it hasn't written stays in the spool for the next start.
  ~PgHistory() override;
  PgHistory(const PgHistory&) = delete;
  PgHistory& operator=(const PgHistory&) = delete;

  // Takes the settings; days below 1 are refused (said) for the defaults.
  void Configure(const HistorySettings& settings) override;
  // Spools the rows, one batch per minute; rows that can't be stored
  // (an empty or control-character series name, a time not on a minute, no
  // samples, a value that isn't finite) are left out and said.
  void Add(std::vector<MinuteRow> rows) override;
  bool Query(const std::vector<std::string>& series, int64_t from, int64_t to, int points,
             HistoryAnswer& answer, std::string& error) override;
  HistoryState State() const override;

  // Waits until every minute taken so far is written and the writer is idle.
  // False when `timeout` passed first.
  bool WaitWritten(std::chrono::milliseconds timeout);

 private:
  void Run();
  // Connects when needed, prunes when due, writes every waiting minute. False
  // with `error` when the database failed; the connection is then closed.
  bool Pass(PgError& error);
  bool Connect(PgError& error);
  // Writes one batch in one transaction; a batch already written is skipped.
  bool WriteBatch(const SpoolBatch& batch, PgError& error);
  // Makes the day partitions of the day holding `time` when they're not known.
  bool EnsurePartitions(int64_t time, PgError& error);
  // Fills series_ids_ for every series of `rows`.
  bool EnsureSeries(const std::vector<MinuteRow>& rows, PgError& error);
  // Drops the day partitions past the retention. False with `error` when the
  // connection broke; a statement that failed is said once and tried again
  // at the next pruning.
  bool Prune(PgError& error);
  // Says a change between writing and waiting once.
  void SetReachable(bool reachable, const std::string& reason);
  int64_t Now() const;
  Deadline WriterDeadline() const;

  const std::string conninfo_;
  const SystemLog log_;
  const PgHistoryTuning tuning_;
  const int stop_fd_;  // an eventfd, readable once stopping
  const int64_t run_;  // names this run's spool batches

  std::mutex mutex_;  // guards what follows up to the writer's own
  std::condition_variable wake_;
  std::condition_variable idle_;
  Spool spool_;
  HistorySettings settings_;
  bool stop_ = false;
  bool woken_ = false;
  bool in_pass_ = false;
  bool prune_due_ = true;

  std::atomic<bool> enabled_{false};
  std::atomic<int> minute_days_{HistorySettings().minute_days};  // for queries
  std::atomic<bool> reachable_{false};

  // The writer's own.
  PgConnection writer_;
  bool said_waiting_ = false;
  bool said_prune_failed_ = false;
  int64_t last_prune_ = 0;
  struct KnownSeries {
    int64_t id = 0;
    int64_t used = 0;  // Now() when a batch last held it
  };
  std::map<std::string, KnownSeries> series_ids_;  // bounded: unused a day, forgotten
  std::set<std::string> partitions_;               // known to exist since the connect
  std::thread thread_;

  std::mutex query_mutex_;  // one query at a time
  PgConnection reader_;
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_PG_HISTORY_H_
