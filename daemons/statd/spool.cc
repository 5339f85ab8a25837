#include "statd/spool.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <charconv>
#include <cstring>

#include "src/atomic_file.h"
#include "src/system_root.h"

namespace statd {
namespace {

constexpr char kSuffix[] = ".rows";
constexpr char kTempInfix[] = ".tmp.";  // ReplaceFile's temporary names
constexpr char kHeader[] = "kovastatd spool 1 ";

// Reads a whole number at the start of `text` and advances past it.
bool TakeNumber(std::string_view& text, int64_t& value) {
  const auto result = std::from_chars(text.data(), text.data() + text.size(), value);
  if (result.ec != std::errc()) return false;
  text.remove_prefix(result.ptr - text.data());
  return true;
}

// The name of batch `id`'s spool file.
std::string FileName(const BatchId& id) {
  std::string name = std::to_string(id.minute);
  if (id.run != 0) name += '_' + std::to_string(id.run) + '_' + std::to_string(id.seq);
  return name + kSuffix;
}

// The batch a spool file's name holds: "<minute>_<run>_<seq>.rows", or an
// older version's "<minute>.rows" (run 0); nullopt for another name.
std::optional<BatchId> FileBatch(const std::string& name) {
  std::string_view rest = name;
  BatchId id;
  if (!TakeNumber(rest, id.minute)) return std::nullopt;
  if (rest.starts_with('_')) {
    rest.remove_prefix(1);
    if (!TakeNumber(rest, id.run) || !rest.starts_with('_')) return std::nullopt;
    rest.remove_prefix(1);
    if (!TakeNumber(rest, id.seq)) return std::nullopt;
  }
  // Only the name FileName gives back: no other spelling of the numbers.
  if (id.run < 0 || id.seq < 0 || (id.run == 0 && id.seq != 0) || FileName(id) != name) {
    return std::nullopt;
  }
  return id;
}

// Splits `line` at tabs.
std::vector<std::string_view> Fields(std::string_view line) {
  std::vector<std::string_view> fields;
  for (size_t start = 0;;) {
    const size_t tab = line.find('\t', start);
    fields.push_back(line.substr(start, tab - start));
    if (tab == std::string_view::npos) return fields;
    start = tab + 1;
  }
}

template <typename Number>
bool ParseNumber(std::string_view text, Number& value) {
  const auto result = std::from_chars(text.data(), text.data() + text.size(), value);
  return result.ec == std::errc() && result.ptr == text.data() + text.size();
}

}  // namespace

void AppendNumber(std::string& text, double value) {
  char buffer[32];
  const auto result = std::to_chars(buffer, buffer + sizeof(buffer), value);
  text.append(buffer, result.ptr);
}

std::string SpoolText(int64_t minute, const std::vector<MinuteRow>& rows) {
  std::string text = kHeader + std::to_string(minute) + "\n";
  for (const MinuteRow& row : rows) {
    text += row.series;
    text += '\t';
    text += std::to_string(row.samples);
    for (double value : {row.avg, row.min, row.max}) {
      text += '\t';
      AppendNumber(text, value);
    }
    text += '\n';
  }
  return text;
}

bool ParseSpoolText(const std::string& text, int64_t minute, std::vector<MinuteRow>& rows,
                    std::string& reason) {
  rows.clear();
  const std::string header = kHeader + std::to_string(minute) + "\n";
  if (text.compare(0, header.size(), header) != 0) {
    reason = "it doesn't start with the spool's header of its minute";
    return false;
  }
  for (size_t start = header.size(); start < text.size();) {
    const size_t end = text.find('\n', start);
    if (end == std::string::npos) {
      reason = "its last line is cut short";
      return false;
    }
    const std::vector<std::string_view> fields =
        Fields(std::string_view(text).substr(start, end - start));
    start = end + 1;
    MinuteRow row;
    row.minute = minute;
    if (fields.size() != 5 || fields[0].empty() || !ParseNumber(fields[1], row.samples) ||
        !ParseNumber(fields[2], row.avg) || !ParseNumber(fields[3], row.min) ||
        !ParseNumber(fields[4], row.max)) {
      reason = "line " + std::to_string(rows.size() + 2) + " isn't a row";
      return false;
    }
    row.series = std::string(fields[0]);
    rows.push_back(std::move(row));
  }
  return true;
}

Spool::Spool(std::string dir, uint64_t bound, int64_t run, SystemLog log)
    : dir_(std::move(dir)), bound_(bound), run_(run), log_(std::move(log)) {}

size_t Spool::Restore() {
  if (!kova::MakeDirectories(dir_, 0750)) {
    log_(LOG_ERR, "can't make the history spool " + dir_ + ": " + strerror(errno));
    return 0;
  }
  DIR* stream = opendir(dir_.c_str());
  if (stream == nullptr) {
    log_(LOG_ERR, "can't read the history spool " + dir_ + ": " + strerror(errno));
    return 0;
  }
  size_t restored = 0;
  while (const dirent* file = readdir(stream)) {
    const std::string name = file->d_name;
    struct stat status;
    if (name.find(kTempInfix) != std::string::npos) {
      unlinkat(dirfd(stream), file->d_name, 0);  // a write a crash cut short
    } else if (const std::optional<BatchId> id = FileBatch(name);
               id && id->run != run_ &&
               fstatat(dirfd(stream), file->d_name, &status, AT_SYMLINK_NOFOLLOW) == 0 &&
               S_ISREG(status.st_mode) && entries_.count(*id) == 0) {
      entries_[*id] = {static_cast<uint64_t>(status.st_size), true, {}};
      bytes_ += status.st_size;
      ++restored;
    }
  }
  closedir(stream);
  if (restored > 0) {
    log_(LOG_INFO,
         std::to_string(restored) + " batches of history rows of an earlier run wait in the spool");
  }
  DropOverBound(std::nullopt);
  return entries_.size();
}

void Spool::Put(int64_t minute, std::vector<MinuteRow> rows) {
  const BatchId id{minute, run_, next_seq_++};
  Entry& entry = entries_[id];
  const std::string text = SpoolText(minute, rows);
  entry.bytes = text.size();
  bytes_ += entry.bytes;
  entry.on_disk = kova::MakeDirectories(dir_, 0750) && kova::ReplaceFile(FilePath(id), text, 0600);
  if (entry.on_disk) {
    said_unwritable_ = false;
  } else {
    if (!said_unwritable_) {
      log_(LOG_ERR, "can't write the history spool " + dir_ + " (" + strerror(errno) +
                        "); rows wait in memory");
    }
    said_unwritable_ = true;
    entry.rows = std::move(rows);
  }
  DropOverBound(id);
}

std::optional<SpoolBatch> Spool::Take() {
  while (!entries_.empty()) {
    const auto& [id, entry] = *entries_.begin();
    SpoolBatch batch{id, {}};
    std::string reason;
    if (Load(id, entry, batch.rows, reason)) {
      taken_ = id;
      return batch;
    }
    log_(LOG_ERR, "history spool file " + FilePath(id) + " is dropped: " + reason);
    Erase(batch.id);
  }
  return std::nullopt;
}

void Spool::Done(const BatchId& id, bool written) {
  if (taken_ != id) return;
  taken_.reset();
  if (written) Erase(id);
}

std::string Spool::FilePath(const BatchId& id) const { return dir_ + "/" + FileName(id); }

bool Spool::Load(const BatchId& id, const Entry& entry, std::vector<MinuteRow>& rows,
                 std::string& reason) const {
  if (!entry.on_disk) {
    rows = entry.rows;
    return true;
  }
  std::string text;
  if (!kova::ReadWholeFile(FilePath(id), text)) {
    reason = strerror(errno);
    return false;
  }
  return ParseSpoolText(text, id.minute, rows, reason);
}

void Spool::Erase(const BatchId& id) {
  const auto found = entries_.find(id);
  if (found == entries_.end()) return;
  if (found->second.on_disk && unlink(FilePath(id).c_str()) != 0 && errno != ENOENT) {
    log_(LOG_ERR, "can't remove " + FilePath(id) + ": " + strerror(errno));
  }
  bytes_ -= found->second.bytes;
  entries_.erase(found);
  if (entries_.empty()) said_full_ = false;
}

void Spool::DropOverBound(const std::optional<BatchId>& keep) {
  size_t dropped = 0;
  auto oldest = entries_.begin();
  while (bytes_ > bound_ && oldest != entries_.end()) {
    const BatchId id = oldest->first;
    ++oldest;
    if (id == keep || id == taken_) continue;
    Erase(id);
    ++dropped;
  }
  if (dropped > 0 && !said_full_) {
    log_(LOG_WARNING, "the history spool is over its " + std::to_string(bound_) +
                          " bytes; its oldest batches are dropped");
    said_full_ = true;
  }
}

}  // namespace statd
