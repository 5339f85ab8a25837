// The system's logs.
//
// Each log type keeps its records (level, time, user, source, event text) apart.
// A log that was never written has no store. Fetched as text, a record is one line
//   <id>\t<level>\t<time>\t<user>\t<source>\t<event>
// where none of the first five fields is empty and the time is written as
// KOVALogConvertTime1 writes it.

#ifndef KOVA_LOG_H_
#define KOVA_LOG_H_

#include <cstddef>
#include <cstdint>
#include <string>

#include "kova/export.h"

// Log types.
inline constexpr int kLogTypePerfEvent = 18;  // events raised by the performance-event daemon

// Levels of a record.
inline constexpr char kLogLevelInfo[] = "Info";
inline constexpr char kLogLevelWarning[] = "Warning";
inline constexpr char kLogLevelCritical[] = "Critical";

// Writes the path of the store of log `type` (a folder) into `path` of `size`
// bytes, whether or not the store exists yet; a log kept by an earlier version
// is moved into it first. Returns 0 on success, -1 for an unknown type or a
// buffer too small.
KOVA_API int KOVALogFilePathGet(int type, char* path, size_t size);

// Writes every record of log `type`, oldest first, as text lines into the file
// `out_path` (created or truncated), with the texts in `language`. Returns 0 on
// success, -1 on failure. A log never written gives an empty file; `out_path`
// is a real path and is never followed when it is a symbolic link.
KOVA_API int KOVALogGet1(int type, const char* out_path, const char* language);

// The time `seconds` since the epoch as the "time" field of fetched lines holds
// it: local time, fixed width, so that comparing two such texts byte by byte
// compares their times.
KOVA_API std::string KOVALogConvertTime1(int64_t seconds);

// Removes every record of log `type`. Returns 0 on success, -1 on failure.
KOVA_API int KOVALogClean(int type);

// Adds a record to log `type`, stamped with the current time. `level` is one of
// the levels above; `user` and `source` name who and what raised it; none of the
// three may be empty. Tabs and line breaks that would split a fetched line become
// blanks. A log keeps its newest records: at least 100,000 unless the key
// "log_max_records" of kKovaInfoConf says otherwise, the oldest going an eighth
// of that at a time. Returns 0 on success, -1 on
// failure.
KOVA_API int KOVALogWrite(int type, const char* level, const char* user, const char* source,
                          const char* event);

#endif  // KOVA_LOG_H_
