#include "log/log_records.h"

#include <sys/mman.h>

#include <algorithm>
#include <cstring>

namespace {

constexpr int kLengthBits = 12;  // a line read in a 4096-byte buffer is shorter
constexpr uint64_t kLengthMask = (uint64_t{1} << kLengthBits) - 1;
constexpr uint64_t kPackedTime = uint64_t{1} << 63;
constexpr int kLeadingFields = 5;  // id, level, time, user, source; the event text follows

// The members an entry is ordered by.
struct SortMember {
  const char* name;
  std::string_view LogFields::*member;
};

constexpr SortMember kSortMembers[] = {
    {"level", &LogFields::level},
    {"time", &LogFields::time},
    {"event", &LogFields::event},
    {nullptr, nullptr},
};

std::string_view LogFields::*FindMember(const std::string& name) {
  for (const SortMember* row = kSortMembers; row->name != nullptr; ++row) {
    if (name == row->name) return row->member;
  }
  return nullptr;
}

// A time text in the log's own shape, "YYYY/MM/DD HH:MM:SS", as kPackedTime and
// its 14 digits four bits each, first digit highest: two packed times compare
// as their texts do. Any other text packs to 0 and is compared as text.
uint64_t PackTime(std::string_view time) {
  static constexpr unsigned char kDigitAt[] = {0, 1, 2, 3, 5, 6, 8, 9, 11, 12, 14, 15, 17, 18};
  if (time.size() != 19 || time[4] != '/' || time[7] != '/' || time[10] != ' ' || time[13] != ':' ||
      time[16] != ':') {
    return 0;
  }
  uint64_t key = 0;
  for (const unsigned char at : kDigitAt) {
    const unsigned digit = static_cast<unsigned char>(time[at]) - unsigned{'0'};
    if (digit > 9) return 0;
    key = key << 4 | digit;
  }
  return kPackedTime | key;
}

// Entries whose times are all packed, put in the order of their keys by a
// radix sort, in as many passes as the keys' spread needs (a month of times
// takes three). That is the order a comparison sort gives; entries of one time
// end up in no defined order.
template <typename Place>
void SortByPackedTime(std::vector<Place>& entries, bool ascending) {
  constexpr int kDigitBits = 11;
  constexpr uint64_t kDigitMask = (uint64_t{1} << kDigitBits) - 1;
  uint64_t low = UINT64_MAX;
  uint64_t high = 0;
  for (const Place& entry : entries) {
    low = std::min(low, entry.time_key);
    high = std::max(high, entry.time_key);
  }
  if (entries.empty() || low == high) return;
  // Descending is ascending over the keys turned round.
  const auto key = [ascending, low, high](const Place& entry) {
    return ascending ? entry.time_key - low : high - entry.time_key;
  };
  const int bits = 64 - __builtin_clzll(high - low);
  std::vector<Place> buffer(entries.size());
  std::vector<Place>* from = &entries;
  std::vector<Place>* to = &buffer;
  std::vector<size_t> starts(kDigitMask + 2);
  for (int shift = 0; shift < bits; shift += kDigitBits) {
    std::fill(starts.begin(), starts.end(), 0);
    for (const Place& entry : *from) ++starts[((key(entry) >> shift) & kDigitMask) + 1];
    for (size_t digit = 1; digit < starts.size(); ++digit) starts[digit] += starts[digit - 1];
    for (const Place& entry : *from) (*to)[starts[(key(entry) >> shift) & kDigitMask]++] = entry;
    std::swap(from, to);
  }
  if (from != &entries) entries.swap(buffer);
}

Json::Value JsonText(std::string_view text) {
  return Json::Value(text.data(), text.data() + text.size());
}

}  // namespace

bool SplitLogLine(std::string_view line, LogFields& fields) {
  std::string_view found[kLeadingFields];
  size_t at = 0;
  for (std::string_view& field : found) {
    while (at < line.size() && line[at] == '\t') ++at;
    if (at == line.size()) return false;
    const size_t end = std::min(line.find('\t', at), line.size());
    field = line.substr(at, end - at);
    at = end < line.size() ? end + 1 : end;
  }
  fields = {found[1], found[2], line.substr(at)};
  return true;
}

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

std::string_view LogCompare::Text(const LogFields& fields) const {
  return member_ != nullptr ? fields.*member_ : std::string_view();
}

LogRecords::~LogRecords() { Clear(); }

void LogRecords::Reserve(size_t count) { entries_.reserve(count); }

void LogRecords::Add(uint64_t offset, size_t length, std::string_view time) {
  const uint64_t time_key = PackTime(time);
  entries_.push_back({time_key, offset << kLengthBits | (length & kLengthMask)});
  if (time_key == 0) ++unpacked_;
}

bool LogRecords::MapText(int fd, size_t size) {
  if (size == 0) return true;
  void* mapping = mmap(nullptr, size, PROT_READ, MAP_PRIVATE, fd, 0);
  if (mapping == MAP_FAILED) return false;
  mapping_ = mapping;
  mapping_size_ = size;
  text_ = std::string_view(static_cast<const char*>(mapping), size);
  return true;
}

void LogRecords::AddLine(std::string_view level, std::string_view time, std::string_view event) {
  const size_t offset = own_text_.size();
  own_text_.append("0\t").append(level).append("\t").append(time).append("\t-\t-\t").append(event);
  Add(offset, own_text_.size() - offset, time);
  text_ = own_text_;
}

void LogRecords::Clear() {
  std::vector<Place>().swap(entries_);
  unpacked_ = 0;
  std::string().swap(own_text_);
  if (mapping_ != nullptr) munmap(mapping_, mapping_size_);
  mapping_ = nullptr;
  mapping_size_ = 0;
  text_ = {};
}

std::string_view LogRecords::Line(const Place& place) const {
  return text_.substr(place.line >> kLengthBits, place.line & kLengthMask);
}

LogFields LogRecords::Fields(size_t index) const {
  LogFields fields;
  if (!SplitLogLine(Line(entries_[index]), fields)) fields = {};
  return fields;
}

void LogRecords::Sort(const LogCompare& compare) {
  // Times in the log's shape compare as numbers; other texts are read from
  // their lines.
  const bool by_time = compare.by_time();
  const auto byte_order = [this, &compare, by_time](const Place& a, const Place& b) {
    if (by_time && (a.time_key & b.time_key & kPackedTime) != 0) {
      return a.time_key < b.time_key ? -1 : a.time_key > b.time_key ? 1 : 0;
    }
    LogFields fields_a;
    LogFields fields_b;
    SplitLogLine(Line(a), fields_a);
    SplitLogLine(Line(b), fields_b);
    return compare.Text(fields_a).compare(compare.Text(fields_b));
  };
  const auto precedes = [&compare, &byte_order](const Place& a, const Place& b) {
    return compare.Precedes(byte_order(a, b));
  };
  // A log is written oldest first, so its entries usually arrive in the
  // reverse of the order asked for, and turning them round is enough.
  if (std::is_sorted(entries_.rbegin(), entries_.rend(), precedes)) {
    std::reverse(entries_.begin(), entries_.end());
    return;
  }
  if (by_time && unpacked_ == 0) return SortByPackedTime(entries_, compare.Precedes(-1));
  std::sort(entries_.begin(), entries_.end(), precedes);
}

Json::Value LogRecords::Entry(size_t index) const {
  const LogFields fields = Fields(index);
  Json::Value entry;
  entry["event"] = JsonText(fields.event);
  entry["time"] = JsonText(fields.time);
  entry["level"] = JsonText(fields.level);
  return entry;
}
