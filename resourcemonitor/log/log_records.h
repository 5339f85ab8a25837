// Log entries held compactly while a request reads the whole log, and their
// order.
//
// A large log has a million entries. As JSON objects each would cost a dozen
// allocations and scattered memory to sort; here the texts of all entries sit
// in a few large blocks and an entry is three views into them. Only the entries
// a request answers with are turned into JSON.

#ifndef RESOURCEMONITOR_LOG_LOG_RECORDS_H_
#define RESOURCEMONITOR_LOG_LOG_RECORDS_H_

#include <json/value.h>

#include <memory>
#include <string>
#include <string_view>
#include <vector>

// One entry: its level, time and event texts.
struct LogRecord {
  std::string_view level;
  std::string_view time;
  std::string_view event;
};

// Orders entries by the text of one member ("level", "time" or "event"), byte
// by byte, descending unless ascending is asked for. A missing member compares
// as an empty text.
class LogCompare {
 public:
  LogCompare(std::string sortField, bool ascending);
  bool operator()(const Json::Value& a, const Json::Value& b) const;

  // The compared text of an entry.
  std::string_view Text(const Json::Value& entry) const;
  std::string_view Text(const LogRecord& record) const;
  // Whether a text goes first, given how it compares byte by byte with another
  // (negative, 0 or positive).
  bool Precedes(int byte_order) const { return ascending_ ? byte_order < 0 : byte_order > 0; }

 private:
  std::string sortField_;
  bool ascending_;
  std::string_view LogRecord::*member_;  // null for a member records don't have
};

// The entries of one read of the log, owning their texts.
class LogRecords {
 public:
  LogRecords() = default;
  LogRecords(const LogRecords&) = delete;
  LogRecords& operator=(const LogRecords&) = delete;

  // Makes room for `count` records.
  void Reserve(size_t count);
  // Copies the three texts in.
  void Add(std::string_view level, std::string_view time, std::string_view event);
  // Forgets every entry and releases their memory.
  void Clear();
  // Puts the entries in `compare`'s order; entries that compare equal end up
  // in no defined order.
  void Sort(const LogCompare& compare);

  size_t size() const { return records_.size(); }
  const LogRecord& operator[](size_t index) const { return records_[index]; }
  // Entry `index` as a JSON log entry {"event", "level", "time"}.
  Json::Value Entry(size_t index) const;

 private:
  std::string_view Keep(std::string_view text);

  std::vector<std::unique_ptr<char[]>> blocks_;
  char* free_begin_ = nullptr;  // the unused end of the last block
  size_t free_size_ = 0;
  std::vector<LogRecord> records_;
};

#endif  // RESOURCEMONITOR_LOG_LOG_RECORDS_H_
