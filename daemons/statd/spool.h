// kovastatd's spool: batches of history rows on their way to the database,
// one file per batch in the spool directory.
//
// A batch is what one Put takes: rows of one minute. It is named by its
// minute, the run that made it (a number each PgHistory draws at its start)
// and its place among that run's batches: "<minute>_<run>_<seq>.rows". So two
// runs' rows of one minute (a restart within the minute) are two batches, and
// a batch's name says whether it was written already. Files an older version
// wrote, "<minute>.rows", are read as run 0's.
//
// A batch is in its file before Put returns (written to a temporary name,
// flushed and renamed, so a crash never leaves half a file), stays there while
// the database is away, and is removed once written. A restart takes in what
// the directory holds. The spool is bounded in bytes: past the bound the
// oldest batches are dropped, and the log says so once until the spool has
// been empty again. Not thread-safe: the owner serializes calls.

#ifndef KOVA_DAEMONS_STATD_SPOOL_H_
#define KOVA_DAEMONS_STATD_SPOOL_H_

#include <compare>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "statd/history_sink.h"

namespace statd {

// Writes one line to the system log: syslog's priority and the text.
using SystemLog = std::function<void(int priority, const std::string& text)>;

// What names a batch, here and in the database's record of written batches.
// Ordered oldest minute first.
struct BatchId {
  int64_t minute = 0;
  int64_t run = 0;  // the run that made it; 0 for an older version's file
  int64_t seq = 0;  // the run's batches before it
  auto operator<=>(const BatchId&) const = default;
};

struct SpoolBatch {
  BatchId id;
  std::vector<MinuteRow> rows;
};

class Spool {
 public:
  // `dir`: the real path of the spool directory, made when missing. `bound`:
  // the bytes its files may hold together. `run`: this run's number, above 0.
  Spool(std::string dir, uint64_t bound, int64_t run, SystemLog log);

  // Takes in the batches earlier runs left in the directory and removes the
  // temporary files a crash left. Returns how many batches wait; 0 (said in
  // the log) when the directory can't be read or made.
  size_t Restore();

  // Keeps `rows`, all of `minute`, as a batch of its own. When the file can't
  // be written the batch waits in memory instead (said in the log), within
  // the same bound.
  void Put(int64_t minute, std::vector<MinuteRow> rows);

  // The oldest waiting batch, read back; nullopt when none waits. A file that
  // can't be read back is removed and said. The batch stays in the spool,
  // never dropped by the bound, until Done.
  std::optional<SpoolBatch> Take();

  // Ends the Take of `id`: when `written`, removes the batch.
  void Done(const BatchId& id, bool written);

  bool empty() const { return entries_.empty(); }
  size_t size() const { return entries_.size(); }
  uint64_t bytes() const { return bytes_; }

 private:
  struct Entry {
    uint64_t bytes = 0;
    bool on_disk = false;         // else `rows` holds the batch
    std::vector<MinuteRow> rows;  // only while not on disk
  };

  std::string FilePath(const BatchId& id) const;
  // Reads back the rows of batch `id`. False with `reason` when it can't.
  bool Load(const BatchId& id, const Entry& entry, std::vector<MinuteRow>& rows,
            std::string& reason) const;
  // Forgets batch `id` and removes its file.
  void Erase(const BatchId& id);
  // Drops the oldest batches, except `keep` and the one taken, while the
  // spool is over its bound.
  void DropOverBound(const std::optional<BatchId>& keep);

  std::string dir_;
  uint64_t bound_;
  int64_t run_;
  SystemLog log_;
  std::map<BatchId, Entry> entries_;  // oldest first
  uint64_t bytes_ = 0;
  int64_t next_seq_ = 0;
  std::optional<BatchId> taken_;
  bool said_full_ = false;        // the bound was said since the spool was last empty
  bool said_unwritable_ = false;  // a failed write was said since the last one that worked
};

// Appends `value` as the shortest text that reads back as the same double.
void AppendNumber(std::string& text, double value);

// The text of a spool file holding `rows` of `minute`.
std::string SpoolText(int64_t minute, const std::vector<MinuteRow>& rows);

// The rows of the spool file text `text` of `minute`. False with `reason` when
// it isn't one SpoolText makes.
bool ParseSpoolText(const std::string& text, int64_t minute, std::vector<MinuteRow>& rows,
                    std::string& reason);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_SPOOL_H_
