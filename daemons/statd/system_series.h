// The series of the system as a whole, from two passes over /proc: CPU
// states, load, memory, network interfaces and physical disks. A rate needs
// both passes and counters that only grew between them; anything else gives
// no value rather than a wrong one.

#ifndef KOVA_DAEMONS_STATD_SYSTEM_SERIES_H_
#define KOVA_DAEMONS_STATD_SYSTEM_SERIES_H_

#include <string>
#include <vector>

#include "sampling/proc_reader.h"
#include "statd/sampler.h"

namespace statd {

// Appends the value `value` of the series of `metric` (in `unit`) for
// `object`, "" for a series of the whole system.
void AddValue(std::vector<SeriesValue>& out, const char* metric, const char* unit,
              const std::string& object, const Labels& labels, double value);

// Appends the values of the system's series between the passes `before`
// (nullptr on the first pass: levels only) and `now`, in the catalog's order:
// CPU (all CPUs, then each), load, memory, interfaces, disks; each object's
// metrics together.
void AddSystemValues(const sampling::Snapshot* before, const sampling::Snapshot& now,
                     std::vector<SeriesValue>& out);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_SYSTEM_SERIES_H_
