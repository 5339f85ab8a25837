#include "log/log_reader.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <memory>
#include <new>
#include <string_view>

#include "api/critical_section.h"
#include "kova/conf.h"
#include "kova/log.h"
#include "kova/text.h"

namespace {

constexpr char kSource[] = "log";
constexpr char kTempPrefix[] = "/tmp/kovalog";
constexpr char kFetchLanguage[] = "enu";
// One read of the log's copy takes at most this many bytes less one; a longer
// line arrives in pieces, each parsed as a line of its own.
constexpr size_t kLineBufferSize = 4096;
constexpr size_t kPathSize = 4096;
constexpr int kLeadingFields = 5;  // id, level, time, user, source; the event text follows

// A text member of the filter, as the JSON library reads any scalar: absent or
// null reads as empty, a number as its digits. False for an array or object.
bool ReadText(const Json::Value& filter, const char* key, std::string& text) {
  const Json::Value& member = filter[key];
  if (!member.isConvertibleTo(Json::stringValue)) return false;
  text = member.asString();
  return true;
}

// A time bound of the filter in seconds, as the JSON library reads a number:
// absent or null reads as 0, a fraction is cut off. False for a text, an array,
// an object or a number out of range.
bool ReadSeconds(const Json::Value& filter, const char* key, int64_t& seconds) {
  const Json::Value& member = filter[key];
  const bool readable = member.isNull() || member.isBool() || member.isInt64() ||
                        (member.isDouble() && std::fabs(member.asDouble()) < 9.2e18);
  if (!readable) return false;
  seconds = member.asInt64();
  return true;
}

// Whether the NUL-terminated `text` of at most `length` bytes is ASCII. The
// platform's Unicode mapping upper-cases ASCII letter for letter, without
// growing, so the common case needs no trip to the platform.
bool IsAscii(const char* text, size_t length) {
  for (size_t i = 0; i < length && text[i] != '\0'; ++i) {
    if (static_cast<unsigned char>(text[i]) >= 0x80) return false;
  }
  return true;
}

int AsciiUpper(const char* text, char* buffer) {
  int length = 0;
  for (; text[length] != '\0'; ++length) {
    const char c = text[length];
    buffer[length] = c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
  }
  buffer[length] = '\0';
  return length;
}

// The Unicode upper-case form of a NUL-terminated text of `length` bytes, made
// in a buffer of length + 1 bytes: a text whose upper case is longer fails.
class UpperCased {
 public:
  UpperCased(const char* text, size_t length) {
    char* buffer = stack_;
    if (length >= sizeof(stack_)) {
      heap_.resize(length + 1);
      buffer = heap_.data();
    }
    const int written = IsAscii(text, length) ? AsciiUpper(text, buffer)
                                              : QLIBCUnicodeUTF8StrUpper(text, buffer, length + 1);
    ok_ = written >= 0;
    if (ok_) text_ = std::string_view(buffer, static_cast<size_t>(written));
  }
  UpperCased(const UpperCased&) = delete;
  UpperCased& operator=(const UpperCased&) = delete;

  bool ok() const { return ok_; }
  bool Contains(const UpperCased& needle) const {
    return ok_ && needle.ok_ && text_.find(needle.text_) != std::string_view::npos;
  }

 private:
  char stack_[kLineBufferSize];
  std::string heap_;
  std::string_view text_;
  bool ok_ = false;
};

// The fields of one line of the log's copy, split in place.
struct LogLine {
  std::string_view level;  // each ends in a NUL
  std::string_view time;
  const char* event;
  size_t event_length;
};

// Splits `line` (NUL-terminated, `length` bytes) at tabs the way strtok_r does:
// a run of tabs is one separator and leading tabs are skipped. The event text is
// what follows the one tab that ends the fifth field. Each separator that ends a
// field is overwritten with a NUL. False when there are fewer than five fields.
bool SplitLine(char* line, size_t length, LogLine& out) {
  std::string_view fields[kLeadingFields];
  char* cursor = line;
  for (std::string_view& field : fields) {
    while (*cursor == '\t') ++cursor;
    if (*cursor == '\0') return false;
    const char* start = cursor;
    // Fields before the event are a few bytes: a plain loop beats a call.
    while (*cursor != '\t' && *cursor != '\0') ++cursor;
    field = std::string_view(start, static_cast<size_t>(cursor - start));
    if (*cursor == '\t') *cursor++ = '\0';
  }
  out = {fields[1], fields[2], cursor, static_cast<size_t>(line + length - cursor)};
  return true;
}

// The filter's keyword, level and time tests, with its own texts prepared once.
class LineTests {
 public:
  explicit LineTests(const LogFilter& filter)
      : keyword_(filter.keyword.c_str(), filter.keyword.size()),
        level_(filter.loglevel.c_str(), filter.loglevel.size()),
        test_keyword_(!filter.keyword.empty()),
        test_level_(!filter.loglevel.empty()),
        from_(filter.datefrom != 0 ? KOVALogConvertTime1(filter.datefrom) : ""),
        to_(filter.dateto != 0 ? KOVALogConvertTime1(filter.dateto) : "") {}

  bool Pass(const LogLine& line) const {
    // The keyword must occur in the event text.
    if (test_keyword_ &&
        (line.event_length == 0 || !UpperCased(line.event, line.event_length).Contains(keyword_))) {
      return false;
    }
    // The line's level must occur in the requested level's name, so that
    // "warn" or "WARNING" pass "Warning".
    if (test_level_ && !level_.Contains(UpperCased(line.level.data(), line.level.size()))) {
      return false;
    }
    // Both bounds are inclusive, compared byte by byte.
    const std::string_view time = line.time;
    if (!from_.empty() && std::string_view(from_) > time) return false;
    if (!to_.empty() && std::string_view(to_) < time) return false;
    return true;
  }

 private:
  const UpperCased keyword_;
  const UpperCased level_;
  const bool test_keyword_;
  const bool test_level_;
  const std::string from_;
  const std::string to_;
};

// Deletes the log's copy when the read ends, however it ends.
class RemoveOnExit {
 public:
  explicit RemoveOnExit(const char* path) : path_(path) {}
  ~RemoveOnExit() { unlink(path_); }
  RemoveOnExit(const RemoveOnExit&) = delete;
  RemoveOnExit& operator=(const RemoveOnExit&) = delete;

 private:
  const char* path_;
};

// Closes a descriptor when the read ends, however it ends.
class CloseOnExit {
 public:
  explicit CloseOnExit(int fd) : fd_(fd) {}
  ~CloseOnExit() {
    if (fd_ >= 0) close(fd_);
  }
  CloseOnExit(const CloseOnExit&) = delete;
  CloseOnExit& operator=(const CloseOnExit&) = delete;

 private:
  int fd_;
};

// Hands out the pieces of the log's mapped copy that fgets into a buffer of
// kLineBufferSize bytes would: up to and including a line feed, at most
// kLineBufferSize - 1 bytes, each copied into the caller's buffer. Pages read
// are let go every few MiB, so that a large copy is never resident whole.
class PieceReader {
 public:
  explicit PieceReader(std::string_view text) : text_(text) {}
  ~PieceReader() { Release(text_.size()); }
  PieceReader(const PieceReader&) = delete;
  PieceReader& operator=(const PieceReader&) = delete;

  // Copies the next piece into `line` and ends it with a NUL, with its size,
  // its offset in the copy, and whether it holds a NUL of its own. False at
  // the end of the copy.
  bool Next(char (&line)[kLineBufferSize], size_t& size, size_t& offset, bool& has_nul) {
    if (at_ == text_.size()) return false;
    const char* start = text_.data() + at_;
    const size_t window = std::min(text_.size() - at_, kLineBufferSize - 1);
    const void* newline = memchr(start, '\n', window);
    size = newline != nullptr ? static_cast<const char*>(newline) - start + 1 : window;
    memcpy(line, start, size);
    line[size] = '\0';
    offset = at_;
    has_nul = HasNul(at_, at_ + size);
    at_ += size;
    if (at_ - released_ >= kReleaseEvery) Release(at_);
    return true;
  }

 private:
  static constexpr size_t kReleaseEvery = 8 << 20;
  static constexpr size_t kNulScan = 1 << 20;

  // Whether bytes [begin, end) hold a NUL. The copy is searched ahead a chunk
  // at a time, each byte once, so that pieces without one need no strlen.
  bool HasNul(size_t begin, size_t end) {
    for (;;) {
      if (nul_ < begin) {  // passed: look again from here
        scanned_ = begin;
        nul_ = std::string_view::npos;
      }
      if (nul_ != std::string_view::npos) return nul_ < end;
      if (scanned_ >= end) return false;
      const size_t until = std::min(text_.size(), std::max(end, scanned_ + kNulScan));
      const void* found = memchr(text_.data() + scanned_, '\0', until - scanned_);
      if (found != nullptr)
        nul_ = static_cast<size_t>(static_cast<const char*>(found) - text_.data());
      scanned_ = until;
    }
  }

  // Lets go of the whole pages before `offset`; they come back if read again.
  void Release(size_t offset) {
    static const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    const size_t until = offset / page * page;
    if (until <= released_) return;
    madvise(const_cast<char*>(text_.data()) + released_, until - released_, MADV_DONTNEED);
    released_ = until;
  }

  std::string_view text_;
  size_t at_ = 0;
  size_t released_ = 0;
  size_t scanned_ = 0;
  size_t nul_ = std::string_view::npos;
};

// Parses the log's copy at `name` and adds the entries that pass `tests`, which
// lie in the copy, mapped. A copy that can't be opened reads as empty. False
// when the copy can't be mapped.
bool ReadLogCopy(const char* name, const LineTests& tests, LogRecords& records) {
  const int fd = open(name, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return true;
  const CloseOnExit close_copy(fd);
  struct stat info;
  if (fstat(fd, &info) != 0) return true;
  if (!records.MapText(fd, static_cast<size_t>(info.st_size))) return false;
  // Room for as many entries as lines of a typical length fit in the copy.
  records.Reserve(static_cast<size_t>(info.st_size) / 96);
  PieceReader reader(records.text());
  char line[kLineBufferSize];
  size_t size;
  size_t offset;
  bool has_nul;
  while (reader.Next(line, size, offset, has_nul)) {
    size_t length = has_nul ? strlen(line) : size;
    if (length > 0 && line[length - 1] == '\n') line[--length] = '\0';
    LogLine fields;
    if (!SplitLine(line, length, fields)) {
      // The line as splitting left it: cut at the tab that ends its first field.
      syslog(LOG_ERR, "%s:%d Wrong log: %s", kSource, __LINE__, line);
      continue;
    }
    if (tests.Pass(fields)) records.Add(offset, length, fields.time);
  }
  return true;
}

// ProcessLogRecords, which may throw std::bad_alloc.
bool ReadLog(const LogFilter& filter, LogRecords& records) {
  const LogCompare compare(filter.sortField, filter.sortOrder == "ASC");
  char path[kPathSize];
  memset(path, 0, sizeof(path));
  if (KOVALogFilePathGet(kLogTypePerfEvent, path, sizeof(path)) < 0) return false;
  // A log that was never written has no file: it is empty.
  struct stat info;
  if (stat(path, &info) != 0) return true;

  const LineTests tests(filter);
  char name[kPathSize];
  memset(name, 0, sizeof(name));
  QLIBCFileITmpName(kTempPrefix, name, sizeof(name));
  const RemoveOnExit remove_copy(name);
  CriticalSection section;
  ENTERCriticalSection(section, kSource, __LINE__);
  if (KOVALogGet1(kLogTypePerfEvent, name, kFetchLanguage) < 0) {
    return false;  // this early exit skips the leave on purpose: the ids stay raised
  }
  LEAVECriticalSection(section, kSource, __LINE__);
  if (!ReadLogCopy(name, tests, records)) return false;
  records.Sort(compare);
  return true;
}

}  // namespace

bool ParseLogFilter(const Json::Value& filter, int offset, int limit, LogFilter& out) {
  if (!filter.isNull() && !filter.isObject()) return false;
  std::string loglevel;
  std::string keyword;
  int64_t datefrom = 0;
  int64_t dateto = 0;
  if (!ReadText(filter, "loglevel", loglevel) || !ReadText(filter, "keyword", keyword) ||
      !ReadSeconds(filter, "datefrom", datefrom) || !ReadSeconds(filter, "dateto", dateto)) {
    return false;
  }
  if (!loglevel.empty() && loglevel != kLogLevelWarning && loglevel != kLogLevelCritical) {
    return false;
  }
  out.offset = offset;
  out.limit = limit;
  out.sortOrder = "DESC";
  out.sortField = "time";
  out.dateto = dateto;
  out.datefrom = datefrom;
  out.loglevel = std::move(loglevel);
  out.keyword = std::move(keyword);
  return true;
}

bool ContainsIgnoreCase(const std::string& haystack, const std::string& needle) {
  if (haystack.empty() || needle.empty()) return false;
  return UpperCased(haystack.c_str(), haystack.size())
      .Contains(UpperCased(needle.c_str(), needle.size()));
}

bool ProcessLogRecords(const LogFilter& filter, LogRecords& records) {
  try {
    return ReadLog(filter, records);
  } catch (const std::bad_alloc&) {
    // A log too large for memory can't be read; no part of it is answered.
    records.Clear();
    return false;
  }
}

bool ProcessLog(const LogFilter& filter, std::vector<Json::Value>& entries) {
  LogRecords records;
  if (!ProcessLogRecords(filter, records)) return false;
  const size_t before = entries.size();
  try {
    entries.reserve(before + records.size());
    for (size_t i = 0; i < records.size(); ++i) entries.push_back(records.Entry(i));
  } catch (const std::bad_alloc&) {
    entries.resize(before);
    return false;
  }
  if (before > 0) {
    std::sort(entries.begin(), entries.end(),
              LogCompare(filter.sortField, filter.sortOrder == "ASC"));
  }
  return true;
}
