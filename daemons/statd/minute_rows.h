// Each series' samples of the current minute, gathered into one history row
// per series (average, minimum, maximum, count) when the next minute begins.

#ifndef KOVA_DAEMONS_STATD_MINUTE_ROWS_H_
#define KOVA_DAEMONS_STATD_MINUTE_ROWS_H_

#include <cstdint>
#include <string>
#include <unordered_map>
#include <vector>

#include "statd/history_sink.h"
#include "statd/sampler.h"

namespace statd {

class MinuteRows {
 public:
  // Adds the values of second `time` (Unix seconds). When `time` lies in a later
  // minute than the samples gathered so far, returns their rows, one per series
  // in the order the series first came, and starts the new minute with these
  // values; otherwise returns nothing. A time in an earlier minute (the clock
  // set back) closes the minute as well.
  std::vector<MinuteRow> Add(int64_t time, const std::vector<SeriesValue>& values);

  // Returns the rows of what was gathered so far (a minute not yet whole: its
  // rows count fewer samples), and forgets it.
  std::vector<MinuteRow> Close();

  // Forgets what was gathered.
  void Clear();

 private:
  struct Sums {
    std::string series;
    int samples = 0;
    double sum = 0;
    double min = 0;
    double max = 0;
  };

  int64_t minute_ = -1;  // the minute gathered, -1 when none
  std::vector<Sums> sums_;
  std::unordered_map<std::string, size_t> index_;  // series id -> place in sums_
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_MINUTE_ROWS_H_
