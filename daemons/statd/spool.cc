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

void AppendNumber(std::string& text, double value) {
  char buffer[32];
  const auto result = std::to_chars(buffer, buffer + sizeof(buffer), value);
  text.append(buffer, result.ptr);
}

// The minute a spool file's name holds; nullopt for another name.
std::optional<int64_t> FileMinute(const std::string& name) {
  const size_t digits = name.size() - (sizeof(kSuffix) - 1);
  if (name.size() <= sizeof(kSuffix) - 1 || name.compare(digits, std::string::npos, kSuffix) != 0) {
    return std::nullopt;
  }
  int64_t minute = 0;
  const auto result = std::from_chars(name.data(), name.data() + digits, minute);
  if (result.ec != std::errc() || result.ptr != name.data() + digits) return std::nullopt;
  return minute;
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

Spool::Spool(std::string dir, uint64_t bound, SystemLog log)
    : dir_(std::move(dir)), bound_(bound), log_(std::move(log)) {}

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
  while (const dirent* file = readdir(stream)) {
    const std::string name = file->d_name;
    struct stat status;
    if (name.find(kTempInfix) != std::string::npos) {
      unlinkat(dirfd(stream), file->d_name, 0);  // a write a crash cut short
    } else if (const std::optional<int64_t> minute = FileMinute(name);
               minute && fstatat(dirfd(stream), file->d_name, &status, AT_SYMLINK_NOFOLLOW) == 0 &&
               S_ISREG(status.st_mode) && entries_.count(*minute) == 0) {
      entries_[*minute] = {static_cast<uint64_t>(status.st_size), true, {}, 0};
      bytes_ += status.st_size;
    }
  }
  closedir(stream);
  if (!entries_.empty()) {
    log_(LOG_INFO, std::to_string(entries_.size()) +
                       " minutes of history rows of an earlier run wait in the spool");
  }
  DropOverBound(-1);
  return entries_.size();
}

void Spool::Put(int64_t minute, std::vector<MinuteRow> rows) {
  auto found = entries_.find(minute);
  if (found != entries_.end()) {
    std::vector<MinuteRow> merged;
    std::string reason;
    if (!Load(minute, found->second, merged, reason)) {
      log_(LOG_ERR, "history rows of " + FilePath(minute) + " are replaced: " + reason);
    }
    for (MinuteRow& row : rows) {
      auto same = merged.begin();
      while (same != merged.end() && same->series != row.series) ++same;
      if (same == merged.end()) {
        merged.push_back(std::move(row));
      } else {
        *same = std::move(row);
      }
    }
    rows = std::move(merged);
  }
  Entry& entry = entries_[minute];
  const std::string text = SpoolText(minute, rows);
  bytes_ -= entry.bytes;
  entry.bytes = text.size();
  bytes_ += entry.bytes;
  ++entry.version;
  entry.on_disk =
      kova::MakeDirectories(dir_, 0750) && kova::ReplaceFile(FilePath(minute), text, 0600);
  if (entry.on_disk) {
    entry.rows.clear();
    said_unwritable_ = false;
  } else {
    if (!said_unwritable_) {
      log_(LOG_ERR, "can't write the history spool " + dir_ + " (" + strerror(errno) +
                        "); rows wait in memory");
    }
    said_unwritable_ = true;
    entry.rows = std::move(rows);
  }
  DropOverBound(minute);
}

std::optional<SpoolBatch> Spool::Take() {
  while (!entries_.empty()) {
    const auto& [minute, entry] = *entries_.begin();
    SpoolBatch batch{minute, {}};
    std::string reason;
    if (Load(minute, entry, batch.rows, reason)) {
      taken_ = minute;
      taken_version_ = entry.version;
      return batch;
    }
    log_(LOG_ERR, "history spool file " + FilePath(minute) + " is dropped: " + reason);
    Erase(minute);
  }
  return std::nullopt;
}

void Spool::Done(int64_t minute, bool written) {
  if (taken_ != minute) return;
  taken_.reset();
  const auto found = entries_.find(minute);
  if (written && found != entries_.end() && found->second.version == taken_version_) Erase(minute);
}

std::string Spool::FilePath(int64_t minute) const {
  return dir_ + "/" + std::to_string(minute) + kSuffix;
}

bool Spool::Load(int64_t minute, const Entry& entry, std::vector<MinuteRow>& rows,
                 std::string& reason) const {
  if (!entry.on_disk) {
    rows = entry.rows;
    return true;
  }
  std::string text;
  if (!kova::ReadWholeFile(FilePath(minute), text)) {
    reason = strerror(errno);
    return false;
  }
  return ParseSpoolText(text, minute, rows, reason);
}

void Spool::Erase(int64_t minute) {
  const auto found = entries_.find(minute);
  if (found == entries_.end()) return;
  if (found->second.on_disk && unlink(FilePath(minute).c_str()) != 0 && errno != ENOENT) {
    log_(LOG_ERR, "can't remove " + FilePath(minute) + ": " + strerror(errno));
  }
  bytes_ -= found->second.bytes;
  entries_.erase(found);
  if (entries_.empty()) said_full_ = false;
}

void Spool::DropOverBound(int64_t keep) {
  size_t dropped = 0;
  auto oldest = entries_.begin();
  while (bytes_ > bound_ && oldest != entries_.end()) {
    const int64_t minute = oldest->first;
    ++oldest;
    if (minute == keep || taken_ == minute) continue;
    Erase(minute);
    ++dropped;
  }
  if (dropped > 0 && !said_full_) {
    log_(LOG_WARNING, "the history spool is over its " + std::to_string(bound_) +
                          " bytes; its oldest minutes are dropped");
    said_full_ = true;
  }
}

}  // namespace statd
