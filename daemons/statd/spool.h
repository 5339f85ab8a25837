// kovastatd's spool: the minutes of history rows on their way to the
// database, one file per minute ("<minute>.rows" in the spool directory).
//
// A minute is in its file before Put returns (written to a temporary name,
// flushed and renamed, so a crash never leaves half a file), stays there while
// the database is away, and is removed once written. A restart takes in what
// the directory holds. The spool is bounded in bytes: past the bound the
// oldest minutes are dropped, and the log says so once until the spool has
// been empty again. Not thread-safe: the owner serializes calls.

#ifndef KOVA_DAEMONS_STATD_SPOOL_H_
#define KOVA_DAEMONS_STATD_SPOOL_H_

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

struct SpoolBatch {
  int64_t minute = 0;
  std::vector<MinuteRow> rows;
};

class Spool {
 public:
  // `dir`: the real path of the spool directory, made when missing. `bound`:
  // the bytes its files may hold together.
  Spool(std::string dir, uint64_t bound, SystemLog log);

  // Takes in the minutes an earlier run left in the directory and removes the
  // temporary files a crash left. Returns how many minutes wait; 0 (said in
  // the log) when the directory can't be read or made.
  size_t Restore();

  // Keeps `rows`, all of `minute`, after the minutes already kept; rows of a
  // minute that waits already are merged into it (a series given again
  // replaces its row). When the file can't be written the minute waits in
  // memory instead (said in the log), within the same bound.
  void Put(int64_t minute, std::vector<MinuteRow> rows);

  // The oldest waiting minute, read back; nullopt when none waits. A file that
  // can't be read back is removed and said. The minute stays in the spool,
  // never dropped by the bound, until Done.
  std::optional<SpoolBatch> Take();

  // Ends the Take of `minute`: when `written`, removes it, unless a Put
  // changed it meanwhile (then it waits again).
  void Done(int64_t minute, bool written);

  bool empty() const { return entries_.empty(); }
  size_t size() const { return entries_.size(); }
  uint64_t bytes() const { return bytes_; }

 private:
  struct Entry {
    uint64_t bytes = 0;
    bool on_disk = false;         // else `rows` holds the minute
    std::vector<MinuteRow> rows;  // only while not on disk
    uint64_t version = 0;         // counts the Puts into this minute
  };

  std::string FilePath(int64_t minute) const;
  // Reads back the rows of `minute`. False with `reason` when it can't.
  bool Load(int64_t minute, const Entry& entry, std::vector<MinuteRow>& rows,
            std::string& reason) const;
  // Forgets `minute` and removes its file.
  void Erase(int64_t minute);
  // Drops the oldest minutes, except `keep` and the one taken, while the
  // spool is over its bound.
  void DropOverBound(int64_t keep);

  std::string dir_;
  uint64_t bound_;
  SystemLog log_;
  std::map<int64_t, Entry> entries_;  // by minute, oldest first
  uint64_t bytes_ = 0;
  std::optional<int64_t> taken_;
  uint64_t taken_version_ = 0;
  bool said_full_ = false;        // the bound was said since the spool was last empty
  bool said_unwritable_ = false;  // a failed write was said since the last one that worked
};

// The text of a spool file holding `rows` of `minute`.
std::string SpoolText(int64_t minute, const std::vector<MinuteRow>& rows);

// The rows of the spool file text `text` of `minute`. False with `reason` when
// it isn't one SpoolText makes.
bool ParseSpoolText(const std::string& text, int64_t minute, std::vector<MinuteRow>& rows,
                    std::string& reason);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_SPOOL_H_
