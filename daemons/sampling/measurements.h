// The resources of the system, services and block devices, measured from two
// consecutive passes over /proc.
//
// A measurement is a Reading: amount / base is the resource's value in its
// unit (percent, KiB per second, milliseconds per I/O). Over several cycles
// the sums of both give the value of the whole stretch, which is how a rule
// whose period spans several cycles is measured.

#ifndef KOVA_DAEMONS_SAMPLING_MEASUREMENTS_H_
#define KOVA_DAEMONS_SAMPLING_MEASUREMENTS_H_

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "sampling/proc_reader.h"

namespace sampling {

struct Reading {
  double amount = 0;
  double base = 0;

  Reading& operator+=(const Reading& other) {
    amount += other.amount;
    base += other.base;
    return *this;
  }
  // The value; 0 when nothing was counted (no CPU time passed, no I/O done).
  double value() const { return base > 0 ? amount / base : 0; }
};

// A measurement, or why there is none. No reading and no problem: nothing to
// compare with yet (the first pass).
struct Measured {
  std::optional<Reading> reading;
  std::string problem;
};

class Measurements {
 public:
  // `page_kib`: the size of a memory page in KiB.
  explicit Measurements(uint64_t page_kib);

  // Moves on to the pass `now`; the pass before becomes the base of rates.
  void Advance(Snapshot now);
  const Snapshot& current() const { return current_; }
  // The pass before the current one; nullptr until there were two.
  const Snapshot* previous() const { return passes_ >= 2 ? &previous_ : nullptr; }

  // The whole system's `resource`; for I/O, summed over the physical disks.
  Measured System(int32_t resource) const;
  // The process `pid` that started at `start_time` and its descendants.
  Measured Processes(pid_t pid, uint64_t start_time, int32_t resource) const;
  // Their resident memory in KiB (the reading's amount, over a base of 1).
  Measured Resident(pid_t pid, uint64_t start_time) const;
  // The block device `major`:`minor`.
  Measured Device(uint32_t major, uint32_t minor, int32_t resource) const;

  // Whether the current pass saw the process `pid` that started at `start_time`.
  bool HasProcess(pid_t pid, uint64_t start_time) const;

 private:
  // The index of `pid` in the current pass, -1 when absent.
  int IndexOf(pid_t pid) const;
  // The index of the process `pid` that started at `start_time`, or the
  // problem that it can't be found.
  int Find(pid_t pid, uint64_t start_time, const char** problem) const;
  // The CPU ticks since the pass before (`cpu`) or the resident pages of the
  // process at `root` and its descendants.
  uint64_t SumTree(int root, bool cpu) const;
  Measured Disks(const std::vector<const DiskSample*>& now,
                 const std::vector<const DiskSample*>& before, int32_t resource) const;

  uint64_t page_kib_;
  bool have_previous_ = false;
  uint64_t passes_ = 0;
  Snapshot previous_;
  Snapshot current_;
  bool deltas_ = false;                // whether `delta_ticks_` could be worked out
  std::vector<uint64_t> delta_ticks_;  // per process of the current pass
  std::vector<int> first_child_;       // per process: its first child's index, or -1
  std::vector<int> next_sibling_;      // per process: the next child of its parent, or -1
  // Per process: the walk that last counted it, so that a walk counts each once.
  mutable std::vector<uint32_t> seen_;
  mutable uint32_t generation_ = 0;
};

}  // namespace sampling

#endif  // KOVA_DAEMONS_SAMPLING_MEASUREMENTS_H_
