// The log store: one folder of segments per log type under /var/log/kova/
// (log_folder.h), made by the first write, holding the newest records. A log
// that an earlier version kept in /var/log/kova/<type>.db is moved into its
// folder the first time the log is opened.

#ifndef KOVA_PLATFORM_SRC_LOG_STORE_H_
#define KOVA_PLATFORM_SRC_LOG_STORE_H_

#include <cstdint>
#include <ctime>
#include <string>
#include <string_view>
#include <vector>

namespace kova {

// The key of /etc/kovainfo.conf that bounds the records kept per log type, and
// the bound when it is absent or not a positive number. The oldest go first, a
// segment (an eighth of the bound) at a time, so a log holds at least the bound
// and at most a segment more.
inline constexpr char kLogMaxRecordsKey[] = "log_max_records";
inline constexpr int64_t kDefaultLogMaxRecords = 100000;

struct LogRecord {
  std::string level;   // kLogLevelInfo, kLogLevelWarning or kLogLevelCritical
  int64_t time = 0;    // seconds since the epoch
  std::string user;    // not empty
  std::string source;  // not empty
  std::string event;
};

// Adds `records` to log `type` in one write and drops the oldest segments
// beyond the bound. Tabs and line breaks in the texts become blanks, so that a fetched
// record stays one line of six fields. Returns 0, or -1 with the last platform
// error set (nothing added): an unknown type, a bad level, an empty user or
// source, or a store that can't be written.
int AppendLogRecords(int type, const std::vector<LogRecord>& records);

// Writes every record of log `type`, oldest first, as the lines of KOVALogGet1
// to the open file `fd`. Returns 0, or -1 with the last platform error set.
int DumpLogRecords(int type, int fd);

// Appends the line of KOVALogGet1 for one record to `out`, the texts made one
// line as AppendLogRecords makes them.
void PutLogLine(int64_t id, std::string_view level, std::string_view time, std::string_view user,
                std::string_view source, std::string_view event, std::string& out);

// Formats times as KOVALogConvertTime1 does, remembering the minute it did
// last, so that a run of records from one minute costs one conversion.
class LogTimeFormatter {
 public:
  // Writes the text into `out` and returns its length (at most 31).
  size_t Format(int64_t seconds, char out[32]);

 private:
  int64_t minute_start_ = 0;
  bool cached_ = false;
  char prefix_[32];  // "YYYY/MM/DD HH:MM:"
  size_t prefix_length_ = 0;
};

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_LOG_STORE_H_
