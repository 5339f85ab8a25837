// Log entries held compactly while a request reads the whole log, and their
// order.
//
// A large log has a million entries. An entry here is 16 bytes: where its line
// lies in the log's copy, and its time text packed into a number that orders
// as the text does. The texts stay in the copy, which is mapped read-only; only
// the entries a request answers with are read from it.

#ifndef RESOURCEMONITOR_LOG_LOG_RECORDS_H_
#define RESOURCEMONITOR_LOG_LOG_RECORDS_H_

#include <json/value.h>

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

// The texts of one line of the log that an entry is made of.
struct LogFields {
  std::string_view level;
  std::string_view time;
  std::string_view event;
};

// Splits `line` (no line feed, no NUL) at tabs the way strtok_r does: a run of
// tabs is one separator and leading tabs are skipped. The 2nd and 3rd fields
// are the level and time; the event text is what follows the one tab that ends
// the 5th field. False when there are fewer than five fields.
bool SplitLogLine(std::string_view line, LogFields& fields);

// Orders entries by the text of one member ("level", "time" or "event"), byte
// by byte, descending unless ascending is asked for. A missing member compares
// as an empty text.
class LogCompare {
 public:
  LogCompare(std::string sortField, bool ascending);
  bool operator()(const Json::Value& a, const Json::Value& b) const;

  // The compared text of an entry.
  std::string_view Text(const Json::Value& entry) const;
  std::string_view Text(const LogFields& fields) const;
  // Whether a text goes first, given how it compares byte by byte with another
  // (negative, 0 or positive).
  bool Precedes(int byte_order) const { return ascending_ ? byte_order < 0 : byte_order > 0; }
  bool by_time() const { return member_ == &LogFields::time; }

 private:
  std::string sortField_;
  bool ascending_;
  std::string_view LogFields::*member_;  // null for a member entries don't have
};

// The entries of one read of the log and the text they lie in.
class LogRecords {
 public:
  LogRecords() = default;
  ~LogRecords();
  LogRecords(const LogRecords&) = delete;
  LogRecords& operator=(const LogRecords&) = delete;

  // Makes room for `count` entries.
  void Reserve(size_t count);
  // Adds the entry whose line is `length` bytes (at most 4095) at `offset` of
  // the text, and whose time text is `time`.
  void Add(uint64_t offset, size_t length, std::string_view time);
  // Maps the first `size` bytes of the open file `fd` as the text the entries
  // lie in; the mapping lasts as long as the records. False when it can't be
  // mapped.
  bool MapText(int fd, size_t size);
  // Adds an entry of the three texts, kept in a text of the records' own (for
  // records made by hand). The texts hold no tab, line feed or NUL, and the
  // level and time are not empty. Not after MapText.
  void AddLine(std::string_view level, std::string_view time, std::string_view event);
  // Forgets every entry and releases their memory.
  void Clear();
  // Puts the entries in `compare`'s order; entries that compare equal end up
  // in no defined order.
  void Sort(const LogCompare& compare);

  size_t size() const { return entries_.size(); }
  // The text the entries lie in.
  std::string_view text() const { return text_; }
  // The texts of entry `index`.
  LogFields Fields(size_t index) const;
  // Entry `index` as a JSON log entry {"event", "level", "time"}.
  Json::Value Entry(size_t index) const;

 private:
  struct Place {
    uint64_t time_key;  // kPackedTime and the time's digits, or 0: see PackTime
    uint64_t line;      // offset << kLengthBits | length
  };
  std::string_view Line(const Place& place) const;

  std::vector<Place> entries_;
  size_t unpacked_ = 0;   // entries whose time isn't in the log's shape
  std::string own_text_;  // the text of AddLine
  void* mapping_ = nullptr;
  size_t mapping_size_ = 0;
  std::string_view text_;
};

#endif  // RESOURCEMONITOR_LOG_LOG_RECORDS_H_
