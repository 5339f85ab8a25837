// The history's tables in PostgreSQL and the statements that fill, roll up,
// prune and read them.
//
//   series           name -> small integer id
//   minute_rows      rows per series and minute      } partitioned by range on
//   hour_rows        one row per series and hour     } time, one partition per
//                                                      UTC day; BRIN on time
//                                                      for roll-ups, B-tree on
//                                                      (series, time) for queries
//   written_batches  the spool's batches whose rows are in (minute, run,
//                    seq), written in the same transaction as the rows, so a
//                    replay never doubles them; two runs' batches of one
//                    minute are both written, each a row per series
//   pending_hours    hours with minutes not yet rolled up into hour_rows
//
// Every time is a timestamptz; statements take Unix seconds and convert.

#ifndef KOVA_DAEMONS_STATD_PG_SCHEMA_H_
#define KOVA_DAEMONS_STATD_PG_SCHEMA_H_

#include <cstdint>
#include <optional>
#include <string>

#include "statd/history_sink.h"

namespace statd {

constexpr int64_t kSecondsPerDay = 86400;
constexpr int64_t kSecondsPerHour = 3600;

// Makes whatever of the schema is missing; safe to run at every connect.
extern const char kCreateSchemaSql[];

// Session settings of every connection: UTC, so that hours and days are UTC's.
extern const char kSessionSql[];

// $1 a text[] of series names: adds those missing to the series table.
extern const char kAddSeriesSql[];
// $1 a text[] of series names: the id and name of each known one.
extern const char kSeriesIdsSql[];

// COPY of minute rows: series id, time, samples, avg, min, max per line.
extern const char kCopyMinuteRowsSql[];

// $1 minute, $2 run, $3 seq: records the batch as written. Inserts no row
// when it already was.
extern const char kMarkWrittenSql[];
// $1 hour: records that the hour has new minutes.
extern const char kMarkHourSql[];
// The pending hours before the newest written minute's hour, oldest first.
extern const char kCompleteHoursSql[];
// $1 hour, $2 the hour after: the hour's row of every series, made from its
// minute rows, a minute's several rows too (avg weighted by samples);
// replaces rows the hour already has.
extern const char kRollUpSql[];
// $1 hour: forgets the pending hours before it.
extern const char kForgetHoursSql[];

// $1 the parent table's name: the names of its partitions.
extern const char kPartitionsSql[];
// $1 time: forgets the written batches of minutes before it.
extern const char kForgetBatchesSql[];

// The partitioned tables of rows and the settings that say how long their
// rows are kept, ended by an empty row.
struct RowTable {
  const char* name;            // "minute_rows"
  int HistorySettings::*days;  // days the rows are kept
};
extern const RowTable kRowTables[];

// The name of `table`'s partition of the UTC day that holds `time`:
// "minute_rows_20240131".
std::string PartitionName(const std::string& table, int64_t time);

// CREATE TABLE of `table`'s partition of the UTC day that holds `time`,
// made only when missing.
std::string CreatePartitionSql(const std::string& table, int64_t time);

// The start (Unix seconds) of the day of `table`'s partition `name`; nullopt
// when the name isn't one PartitionName makes.
std::optional<int64_t> PartitionDay(const std::string& table, const std::string& name);

// `time` as a timestamptz literal in UTC: "2024-01-31 23:59:00+00".
std::string UtcTimestamp(int64_t time);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_PG_SCHEMA_H_
