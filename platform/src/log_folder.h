// The store of one log: a folder of segment files that hold the log's records
// as the very lines KOVALogGet1 writes,
//   <id>\t<level>\t<time>\t<user>\t<source>\t<event>\n
// each segment named by the id of its first line (20 digits and ".log"). A fetch
// is then a plain copy of the segments; an append writes whole lines at the end
// of the last segment; the oldest records go a whole segment at a time.
//
// Writers hold the folder's lock file exclusively and readers shared, so that a
// reader never sees a segment removed or a batch half written. A line cut short
// by a crash is never read: readers stop at the last line feed of a segment, and
// the next writer cuts the torn line off before it appends.

#ifndef KOVA_PLATFORM_SRC_LOG_FOLDER_H_
#define KOVA_PLATFORM_SRC_LOG_FOLDER_H_

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace kova {

class LogFolder {
 public:
  enum class Access { kRead, kWrite };

  LogFolder() = default;
  ~LogFolder();
  LogFolder(const LogFolder&) = delete;
  LogFolder& operator=(const LogFolder&) = delete;

  // Opens the store at the real path `path` and takes its lock, shared for
  // kRead and exclusive for kWrite (waiting for the holder). For kWrite it also
  // finds the next id and cuts off a torn last line. False with errno set when
  // the store can't be opened; ENOENT when there is none.
  bool Open(const std::string& path, Access access);

  // The id that the next appended line must carry.
  int64_t next_id() const { return next_id_; }

  // Appends `text`, which holds `count` whole lines numbered from next_id(), in
  // one write. A new segment is begun first when the last one already holds
  // `segment_lines` lines or more. False with errno set when the write fails;
  // the last segment is then cut back to what it held.
  bool Append(std::string_view text, int64_t count, int64_t segment_lines);

  // Begins an empty segment whose first line will carry `first_id`, which is
  // not below next_id(): the ids in between are never used. False with errno
  // set on failure.
  bool BeginSegment(int64_t first_id);

  // Removes the oldest segments as long as the others hold `keep` lines or
  // more. False with errno set when one can't be removed.
  bool Trim(int64_t keep);

  // Removes every line; the ids go on from next_id(). False with errno set
  // when a segment can't be made or removed.
  bool Clear();

  // Writes every whole line, oldest first, to `fd` from its current offset.
  // False with errno set when a segment can't be read or `fd` written.
  bool CopyTo(int fd) const;

  // Makes a store at `path` that holds nothing and whose first id is
  // `first_id`, lets `fill` append to it (when given), and puts it in place in
  // one rename, so that no one ever sees it half made. True also when another
  // process made the store first (then `fill` is not kept). False with errno
  // set when it can't be made or `fill` fails; nothing is left behind.
  static bool Create(const std::string& path, int64_t first_id,
                     const std::function<bool(LogFolder&)>& fill);

 private:
  bool OpenIn(int parent_fd, const char* name, Access access);
  bool ReadSegments();
  bool FindNextId();
  void Close();

  int dir_fd_ = -1;
  int lock_fd_ = -1;
  std::vector<int64_t> segments_;  // first ids, ascending
  int64_t next_id_ = 1;
};

// The lines of a segment a store begins when it keeps at most `max_records`:
// an eighth of them, so that whole segments go without dropping much more than
// asked, within bounds that keep segments few and small enough to copy.
int64_t SegmentLines(int64_t max_records);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_LOG_FOLDER_H_
