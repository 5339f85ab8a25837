// Moving a log from the SQLite database that earlier versions kept it in into
// its folder store (log_folder.h).

#ifndef KOVA_PLATFORM_SRC_LOG_MIGRATION_H_
#define KOVA_PLATFORM_SRC_LOG_MIGRATION_H_

#include <cstdint>
#include <string>

namespace kova {

// Copies every record of the database at `database` into a new store at
// `folder`, ids and all, in segments of `segment_lines`, so that the next id is
// the one the database would have given; puts the store in place, then removes
// the database. When the store is there already (another process moved it),
// only the database is removed. False with errno set when the database can't
// be read or the store made: the database is then kept as it was.
bool MigrateSqliteLog(const std::string& database, const std::string& folder,
                      int64_t segment_lines);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_LOG_MIGRATION_H_
