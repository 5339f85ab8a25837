// What the collector needs of its history: it hands over each minute's rows
// while history is on, and asks for a reduced stretch of the past. The
// PostgreSQL history implements it; tests use their own.

#ifndef KOVA_DAEMONS_STATD_HISTORY_SINK_H_
#define KOVA_DAEMONS_STATD_HISTORY_SINK_H_

#include <cstdint>
#include <string>
#include <vector>

namespace statd {

// One series over one minute.
struct MinuteRow {
  std::string series;  // the series id, as the catalog names it
  int64_t minute = 0;  // Unix time of the minute's first second, a multiple of 60
  int samples = 0;     // how many samples the minute holds (1 to 60 at one a second)
  double avg = 0;
  double min = 0;
  double max = 0;
};

// The history's settings, read from the system settings file at start and on
// every reload.
struct HistorySettings {
  bool enabled = false;  // "resourcemonitor_history" is exactly "yes"
  int minute_days = 31;  // days minute rows are kept
  int hour_days = 1827;  // days hourly rows are kept
};

// One series of a history answer: parallel arrays, one entry per point, oldest first.
struct HistorySeries {
  std::string id;
  std::vector<int64_t> times;  // Unix time of each point's first second
  std::vector<double> avg;
  std::vector<double> min;
  std::vector<double> max;
};

struct HistoryAnswer {
  int64_t step = 0;                   // seconds one point covers
  std::string source;                 // "minute" or "hour": the rows the points come from
  std::vector<HistorySeries> series;  // in the order asked; empty arrays for a series without rows
};

enum class HistoryState {
  kOff,      // history is not on
  kWriting,  // rows reach the database
  kWaiting,  // the database is away; rows wait in the spool
};

class HistorySink {
 public:
  virtual ~HistorySink() = default;

  // Applies the settings. Never blocks on the database.
  virtual void Configure(const HistorySettings& settings) = 0;

  // Takes one minute's rows; called once a minute by the sampler while history
  // is on. Never blocks on the database: rows it can't take now wait in the
  // spool, up to the spool's bound.
  virtual void Add(std::vector<MinuteRow> rows) = 0;

  // Fills `answer` with `series` between `from` and `to` (Unix seconds,
  // inclusive), reduced to at most `points` points per series. False with
  // `error` (one English sentence) when the database can't be reached or the
  // query fails. Called from the protocol's thread, concurrently with Add; may
  // block for the query's time, which a statement timeout bounds.
  virtual bool Query(const std::vector<std::string>& series, int64_t from, int64_t to, int points,
                     HistoryAnswer& answer, std::string& error) = 0;

  virtual HistoryState State() const = 0;
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_HISTORY_SINK_H_
