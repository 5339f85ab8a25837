// The real-time series in memory: one time ring shared by every series, and per
// series a ring of single-precision values (NaN where a second has no sample),
// so that a full two hours of every series of a large box fits in a few MB.
// Not thread-safe: the collector holds its lock around every call.

#ifndef KOVA_DAEMONS_STATD_REALTIME_STORE_H_
#define KOVA_DAEMONS_STATD_REALTIME_STORE_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <unordered_map>
#include <vector>

#include "statd/sampler.h"

namespace statd {

class RealtimeStore {
 public:
  // A store of `slots` samples per series (at least 1).
  explicit RealtimeStore(size_t slots);

  // Keeps `slots` samples per series from now on; the newest ones stay.
  void Resize(size_t slots);
  size_t slots() const { return times_.size(); }

  // Adds the sample of second `time` with `values`; series without a value get
  // none for it. A time not after the newest is ignored (false). A series
  // seen for the first time joins the catalog; one whose last sample has left
  // the ring leaves it. A series' labels follow its latest value.
  bool Add(int64_t time, const std::vector<SeriesValue>& values);

  // Forgets the samples of `time` and after (the clock was set back before them).
  void DropFrom(int64_t time);

  // Every series with a sample in the ring: those of the newest second in
  // their order, then the others.
  std::vector<SeriesInfo> Catalog() const;

  // Appends the samples of series `id` after `since` to `times` and `values`,
  // oldest first. False when no series has that id.
  bool Read(const std::string& id, int64_t since, std::vector<int64_t>& times,
            std::vector<double>& values) const;

  // The time of the newest sample, 0 before the first.
  int64_t newest() const { return count_ > 0 ? times_[Slot(count_ - 1)] : 0; }

 private:
  struct Series {
    SeriesInfo info;
    std::vector<float> values;  // parallel to times_
    int64_t last = 0;           // the time of its newest sample
    size_t rank = 0;            // its place among the values of its newest second
  };

  // The ring index of the i-th oldest sample.
  size_t Slot(size_t i) const { return (start_ + i) % times_.size(); }
  // Drops the series whose samples have all left the ring.
  void Prune();

  std::vector<int64_t> times_;  // ring of sample times
  size_t start_ = 0;            // the oldest sample's index
  size_t count_ = 0;            // samples held
  std::vector<Series> series_;
  std::unordered_map<std::string, size_t> index_;  // id -> place in series_
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_REALTIME_STORE_H_
