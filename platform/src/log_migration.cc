#include "src/log_migration.h"

#include <errno.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string_view>

#include "src/log_folder.h"
#include "src/log_store.h"
#include "src/sqlite_db.h"

namespace kova {
namespace {

// Lines gathered before one write to the store.
constexpr size_t kBatchBytes = 4 << 20;

// Writes the database's rows into `folder`, each id where it was: a gap in the
// ids begins a new segment, so that ids within a segment stay consecutive.
bool CopyRecords(const Database& db, int64_t segment_lines, LogFolder& folder) {
  Statement select(db, "SELECT id, level, time, user, source, event FROM records ORDER BY id");
  if (!select.ok()) return false;
  std::string text;
  int64_t lines = 0;
  int64_t batch_first = folder.next_id();
  auto flush = [&] {
    const bool ok = text.empty() || folder.Append(text, lines, segment_lines);
    text.clear();
    lines = 0;
    return ok;
  };
  LogTimeFormatter times;
  char time_text[32];
  int step;
  while ((step = select.Step()) == SQLITE_ROW) {
    const int64_t id = select.Int(0);
    if (id < batch_first + lines) continue;  // not ascending: never the case in a sound database
    if (id != batch_first + lines || text.size() >= kBatchBytes) {
      if (!flush()) return false;
      if (id != folder.next_id() && !folder.BeginSegment(id)) return false;
      batch_first = id;
    }
    PutLogLine(id, select.Text(1),
               std::string_view(time_text, times.Format(select.Int(2), time_text)), select.Text(3),
               select.Text(4), select.Text(5), text);
    ++lines;
  }
  return step == SQLITE_DONE && flush();
}

// The next id the database would have given: past its last record and past
// every record it ever held.
int64_t NextId(const Database& db) {
  int64_t next = 1;
  Statement max(db, "SELECT max(id) FROM records");
  if (max.Step() == SQLITE_ROW) next = max.Int(0) + 1;
  Statement sequence(db, "SELECT seq FROM sqlite_sequence WHERE name = 'records'");
  if (sequence.Step() == SQLITE_ROW && sequence.Int(0) + 1 > next) next = sequence.Int(0) + 1;
  return next;
}

void RemoveDatabase(const std::string& database) {
  for (const char* suffix : {"-wal", "-shm", ""}) unlink((database + suffix).c_str());
}

}  // namespace

bool MigrateSqliteLog(const std::string& database, const std::string& folder,
                      int64_t segment_lines) {
  struct stat info;
  if (lstat(folder.c_str(), &info) == 0) {
    RemoveDatabase(database);  // moved already: by another process, or before a crash
    return true;
  }
  Database db;
  if (!db.Open(database, false, nullptr)) {
    if (errno == 0) errno = EIO;
    return false;
  }
  Statement first(db, "SELECT min(id) FROM records");
  const int64_t next = NextId(db);
  const int64_t first_id = first.Step() == SQLITE_ROW && first.Int(0) > 0 ? first.Int(0) : next;
  const bool moved = LogFolder::Create(folder, first_id, [&](LogFolder& store) {
    if (!CopyRecords(db, segment_lines, store)) {
      if (errno == 0) errno = EIO;
      return false;
    }
    return store.next_id() == next || store.BeginSegment(next);
  });
  if (!moved) return false;
  RemoveDatabase(database);
  return true;
}

}  // namespace kova
