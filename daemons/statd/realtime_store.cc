#include "statd/realtime_store.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <limits>

namespace statd {
namespace {

constexpr float kNoSample = std::numeric_limits<float>::quiet_NaN();

// The double nearest to the shortest decimal that reads back as `value`, so
// that 12.3f goes out as 12.3 and not as 12.300000190734863.
double Widen(float value) {
  char text[32];
  const auto written = std::to_chars(text, text + sizeof(text), value);
  double wide = value;
  std::from_chars(text, written.ptr, wide);
  return wide;
}

}  // namespace

RealtimeStore::RealtimeStore(size_t slots) : times_(std::max<size_t>(slots, 1), 0) {}

void RealtimeStore::Resize(size_t slots) {
  slots = std::max<size_t>(slots, 1);
  if (slots == times_.size()) return;
  const size_t keep = std::min(count_, slots);
  const size_t first = count_ - keep;
  std::vector<int64_t> times(slots, 0);
  for (size_t i = 0; i < keep; ++i) times[i] = times_[Slot(first + i)];
  for (Series& series : series_) {
    std::vector<float> values(slots, kNoSample);
    for (size_t i = 0; i < keep; ++i) values[i] = series.values[Slot(first + i)];
    series.values = std::move(values);
  }
  times_ = std::move(times);
  start_ = 0;
  count_ = keep;
  Prune();
}

void RealtimeStore::DropFrom(int64_t time) {
  while (count_ > 0 && times_[Slot(count_ - 1)] >= time) {
    const size_t slot = Slot(--count_);
    for (Series& series : series_) series.values[slot] = kNoSample;
  }
  // A series' newest sample may have gone: find the one before, if any.
  for (Series& series : series_) {
    if (series.last <= newest()) continue;
    series.last = 0;
    for (size_t i = count_; i-- > 0;) {
      if (!std::isnan(series.values[Slot(i)])) {
        series.last = times_[Slot(i)];
        break;
      }
    }
  }
  Prune();
}

bool RealtimeStore::Add(int64_t time, const std::vector<SeriesValue>& values) {
  if (count_ > 0 && time <= newest()) return false;
  size_t slot;
  if (count_ < times_.size()) {
    slot = Slot(count_++);
  } else {
    slot = start_;
    start_ = (start_ + 1) % times_.size();
  }
  times_[slot] = time;
  for (Series& series : series_) series.values[slot] = kNoSample;
  size_t rank = 0;
  for (const SeriesValue& value : values) {
    if (!std::isfinite(value.value)) continue;
    const auto [at, added] = index_.try_emplace(value.info.id, series_.size());
    if (added) series_.push_back(Series{value.info, std::vector<float>(times_.size(), kNoSample)});
    Series& series = series_[at->second];
    if (!added && !(series.info == value.info)) series.info = value.info;
    series.values[slot] = static_cast<float>(value.value);
    series.last = time;
    series.rank = rank++;
  }
  Prune();
  return true;
}

void RealtimeStore::Prune() {
  const int64_t oldest = count_ > 0 ? times_[start_] : 0;
  const size_t before = series_.size();
  std::erase_if(series_, [&](const Series& series) { return series.last < oldest; });
  if (series_.size() == before) return;
  index_.clear();
  for (size_t i = 0; i < series_.size(); ++i) index_.emplace(series_[i].info.id, i);
}

std::vector<SeriesInfo> RealtimeStore::Catalog() const {
  std::vector<const Series*> order;
  for (const Series& series : series_) order.push_back(&series);
  const int64_t now = newest();
  // Those of the newest second first, in the sampler's order; then the others
  // in the order they last had.
  std::stable_sort(order.begin(), order.end(), [now](const Series* a, const Series* b) {
    return std::pair(a->last != now, a->rank) < std::pair(b->last != now, b->rank);
  });
  std::vector<SeriesInfo> catalog;
  catalog.reserve(order.size());
  for (const Series* series : order) catalog.push_back(series->info);
  return catalog;
}

bool RealtimeStore::Read(const std::string& id, int64_t since, std::vector<int64_t>& times,
                         std::vector<double>& values) const {
  const auto found = index_.find(id);
  if (found == index_.end()) return false;
  const Series& series = series_[found->second];
  // The first sample after `since`: times only grow along the ring.
  size_t low = 0;
  size_t high = count_;
  while (low < high) {
    const size_t middle = (low + high) / 2;
    if (times_[Slot(middle)] > since) {
      high = middle;
    } else {
      low = middle + 1;
    }
  }
  for (size_t i = low; i < count_; ++i) {
    const float value = series.values[Slot(i)];
    if (std::isnan(value)) continue;
    times.push_back(times_[Slot(i)]);
    values.push_back(Widen(value));
  }
  return true;
}

}  // namespace statd
