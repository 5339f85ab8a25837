// The events decided and not yet in the performance-event log.
//
// A write that fails keeps the events, in order, for the next try. Until they
// are in the log they are also kept in a file, so that a stop or a crash loses
// none: the next start reads them back. Each event keeps the time it was
// decided.

#ifndef KOVA_DAEMONS_PERFEVENTD_EVENT_QUEUE_H_
#define KOVA_DAEMONS_PERFEVENTD_EVENT_QUEUE_H_

#include <cstddef>
#include <deque>
#include <string>
#include <vector>

#include "perfeventd/event_text.h"
#include "perfeventd/monitor.h"

namespace perfeventd {

class EventQueue {
 public:
  // `spill_path`: the real path of the file that keeps waiting events. At most
  // `capacity` events wait; beyond that the oldest are dropped, and said.
  EventQueue(std::string spill_path, size_t capacity, Notify notify);

  // Takes in the events that an earlier run left in the file.
  void Restore();
  void Add(const std::vector<Event>& events);
  // Writes every waiting event into the log in one transaction. True when
  // none wait afterwards.
  bool Flush();
  size_t size() const { return events_.size(); }

 private:
  // Keeps the waiting events in the file when they changed since last kept.
  void Spill();

  std::string spill_path_;
  size_t capacity_;
  Notify notify_;
  std::deque<Event> events_;
  bool spilled_ = false;  // whether the file may hold events
  bool changed_ = false;  // whether the events changed since they were kept
  bool failing_ = false;  // whether the last write failed
  size_t dropped_ = 0;    // events dropped while writes failed
};

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_EVENT_QUEUE_H_
