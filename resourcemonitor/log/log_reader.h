// Reading the performance-event log: a request's filter, the fetch of the whole
// log into entries {"level", "time", "event"}, and their order.
//
// Every call reads the log afresh: the log library writes it into a temporary
// file, each line is parsed and tested against the filter, and the matching
// entries are sorted. Nothing is cached.

#ifndef RESOURCEMONITOR_LOG_LOG_READER_H_
#define RESOURCEMONITOR_LOG_LOG_READER_H_

#include <json/value.h>

#include <cstdint>
#include <string>
#include <vector>

#include "log/log_records.h"

// What a request asks of the log. The handlers start from these values.
struct LogFilter {
  int32_t offset = 0;    // first entry of a page (list only)
  int32_t limit = -1;    // entries in a page, negative for all (list only)
  int64_t datefrom = 0;  // lower time bound in seconds since the epoch, 0 for none
  int64_t dateto = 0;    // upper time bound, 0 for none
  std::string loglevel;  // "", "Warning" or "Critical"
  std::string keyword;   // text looked for in the event text, "" for none
  std::string sortField = "time";
  std::string sortOrder = "DESC";  // "ASC" ascending, anything else descending
};

// Fills `out` from the request's "filter" (null or an object with "loglevel",
// "datefrom", "dateto", "keyword") and the page bounds; the order is always
// newest first. Returns false, leaving `out` untouched, when "loglevel" is
// neither empty nor exactly "Warning" or "Critical", when `filter` is neither
// null nor an object, or when a member is of a type it can't be read as.
bool ParseLogFilter(const Json::Value& filter, int offset, int limit, LogFilter& out);

// Whether `needle` occurs in `haystack`, both upper-cased as Unicode text. False
// when either is empty or isn't valid UTF-8, or when upper-casing makes it longer.
bool ContainsIgnoreCase(const std::string& haystack, const std::string& needle);

// Appends every entry of the performance-event log that passes `filter` to
// `entries` and sorts them. Returns true on success, also when the log has never
// been written (no entries). Returns false when the log's path can't be had, its
// fetch fails, or memory runs out while it is read (then no entry is added); a
// failed fetch leaves the process in the privileged section. The temporary copy
// of the log is closed and deleted on every path that made it.
bool ProcessLog(const LogFilter& filter, std::vector<Json::Value>& entries);

// ProcessLog without the JSON: reads the entries that pass `filter` into
// `records` and sorts them. Same results and failures.
bool ProcessLogRecords(const LogFilter& filter, LogRecords& records);

#endif  // RESOURCEMONITOR_LOG_LOG_READER_H_
