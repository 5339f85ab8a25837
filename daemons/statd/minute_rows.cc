#include "statd/minute_rows.h"

#include <algorithm>
#include <cmath>

namespace statd {

std::vector<MinuteRow> MinuteRows::Add(int64_t time, const std::vector<SeriesValue>& values) {
  const int64_t minute = time - ((time % 60) + 60) % 60;
  std::vector<MinuteRow> rows;
  if (minute != minute_) {
    rows = Close();
    minute_ = minute;
  }
  for (const SeriesValue& value : values) {
    if (!std::isfinite(value.value)) continue;
    const auto [at, added] = index_.try_emplace(value.info.id, sums_.size());
    if (added) {
      sums_.push_back(Sums{value.info.id, 1, value.value, value.value, value.value});
      continue;
    }
    Sums& sums = sums_[at->second];
    ++sums.samples;
    sums.sum += value.value;
    sums.min = std::min(sums.min, value.value);
    sums.max = std::max(sums.max, value.value);
  }
  return rows;
}

std::vector<MinuteRow> MinuteRows::Close() {
  std::vector<MinuteRow> rows;
  rows.reserve(sums_.size());
  for (const Sums& sums : sums_) {
    rows.push_back(
        MinuteRow{sums.series, minute_, sums.samples, sums.sum / sums.samples, sums.min, sums.max});
  }
  Clear();
  return rows;
}

void MinuteRows::Clear() {
  minute_ = -1;
  sums_.clear();
  index_.clear();
}

}  // namespace statd
