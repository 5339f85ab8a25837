#include "log/log_records.h"

#include <algorithm>
#include <cstring>

namespace {

// Texts are copied into blocks of this size, or of the text's size when larger.
constexpr size_t kBlockSize = 1 << 20;

// The members an entry is ordered by.
struct SortMember {
  const char* name;
  std::string_view LogRecord::*member;
};

constexpr SortMember kSortMembers[] = {
    {"level", &LogRecord::level},
    {"time", &LogRecord::time},
    {"event", &LogRecord::event},
    {nullptr, nullptr},
};

std::string_view LogRecord::*FindMember(const std::string& name) {
  for (const SortMember* row = kSortMembers; row->name != nullptr; ++row) {
    if (name == row->name) return row->member;
  }
  return nullptr;
}

// An entry's place in the order: the first 16 bytes of its text packed big-end
// first, so that most comparisons touch neither the entry nor its text.
struct SortKey {
  uint64_t head[2];
  std::string_view text;
  size_t index;
};

SortKey MakeSortKey(std::string_view text, size_t index) {
  unsigned char bytes[16] = {};
  memcpy(bytes, text.data(), std::min(text.size(), sizeof(bytes)));
  SortKey key{{0, 0}, text, index};
  for (size_t i = 0; i < sizeof(bytes); ++i) key.head[i / 8] = key.head[i / 8] << 8 | bytes[i];
  return key;
}

// How two texts compare byte by byte. Zero padding makes heads equal only when
// the texts share their first 16 bytes or one is a prefix of the other; the
// texts decide then.
int ByteOrder(const SortKey& a, const SortKey& b) {
  for (int i = 0; i < 2; ++i) {
    if (a.head[i] != b.head[i]) return a.head[i] < b.head[i] ? -1 : 1;
  }
  return a.text.compare(b.text);
}

Json::Value JsonText(std::string_view text) {
  return Json::Value(text.data(), text.data() + text.size());
}

}  // namespace

LogCompare::LogCompare(std::string sortField, bool ascending)
    : sortField_(std::move(sortField)), ascending_(ascending), member_(FindMember(sortField_)) {}

bool LogCompare::operator()(const Json::Value& a, const Json::Value& b) const {
  return Precedes(Text(a).compare(Text(b)));
}

std::string_view LogCompare::Text(const Json::Value& entry) const {
  if (!entry.isObject()) return {};
  const Json::Value* member = entry.find(sortField_.data(), sortField_.data() + sortField_.size());
  const char* begin = nullptr;
  const char* end = nullptr;
  if (member == nullptr || !member->getString(&begin, &end)) return {};
  return std::string_view(begin, static_cast<size_t>(end - begin));
}

std::string_view LogCompare::Text(const LogRecord& record) const {
  return member_ != nullptr ? record.*member_ : std::string_view();
}

void LogRecords::Add(std::string_view level, std::string_view time, std::string_view event) {
  records_.push_back({Keep(level), Keep(time), Keep(event)});
}

std::string_view LogRecords::Keep(std::string_view text) {
  if (text.size() > free_size_) {
    const size_t size = std::max(kBlockSize, text.size());
    blocks_.push_back(std::make_unique_for_overwrite<char[]>(size));
    free_begin_ = blocks_.back().get();
    free_size_ = size;
  }
  char* kept = free_begin_;
  if (!text.empty()) memcpy(kept, text.data(), text.size());
  free_begin_ += text.size();
  free_size_ -= text.size();
  return std::string_view(kept, text.size());
}

void LogRecords::Reserve(size_t count) { records_.reserve(count); }

void LogRecords::Clear() {
  std::vector<LogRecord>().swap(records_);
  blocks_.clear();
  blocks_.shrink_to_fit();
  free_begin_ = nullptr;
  free_size_ = 0;
}

void LogRecords::Sort(const LogCompare& compare) {
  const auto precedes = [&compare](const LogRecord& a, const LogRecord& b) {
    return compare.Precedes(compare.Text(a).compare(compare.Text(b)));
  };
  // A log is written oldest first, so its records usually arrive in the
  // reverse of the order asked for, and turning them round is enough.
  if (std::is_sorted(records_.rbegin(), records_.rend(), precedes)) {
    std::reverse(records_.begin(), records_.end());
    return;
  }
  // Otherwise the texts are read once into a compact array of keys, which is
  // sorted; the records then move to their places.
  std::vector<SortKey> keys;
  keys.reserve(records_.size());
  for (size_t i = 0; i < records_.size(); ++i) {
    keys.push_back(MakeSortKey(compare.Text(records_[i]), i));
  }
  std::sort(keys.begin(), keys.end(), [&compare](const SortKey& a, const SortKey& b) {
    return compare.Precedes(ByteOrder(a, b));
  });
  std::vector<LogRecord> sorted;
  sorted.reserve(records_.size());
  for (const SortKey& key : keys) sorted.push_back(records_[key.index]);
  records_.swap(sorted);
}

Json::Value LogRecords::Entry(size_t index) const {
  const LogRecord& record = records_[index];
  Json::Value entry;
  entry["event"] = JsonText(record.event);
  entry["time"] = JsonText(record.time);
  entry["level"] = JsonText(record.level);
  return entry;
}
