// When kovastatd takes its next sample: on whole multiples of the interval of
// its clock, whatever the clock does meanwhile.

#ifndef KOVA_DAEMONS_STATD_SCHEDULE_H_
#define KOVA_DAEMONS_STATD_SCHEDULE_H_

#include <cmath>

namespace statd {

// The time of the next sample, `planned` before `now` is looked at: `planned`
// itself, unless the clock moved under it. A sample late by a whole interval
// or more doesn't make up for the ones missed, and a clock set back by more
// than an interval doesn't wait for the old time to come round again: both
// start afresh at the first whole interval after `now`.
inline double NextSampleTime(double planned, double now, int interval) {
  if (planned > now - interval && planned <= now + 2.0 * interval) return planned;
  return (std::floor(now / interval) + 1) * interval;
}

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_SCHEDULE_H_
