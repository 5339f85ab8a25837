// The daemon's counters and firing rules for kovastatd's metrics, in
// /run/kova/perfeventd.state: one record a line, fields separated by a tab,
//   events_total<TAB><level><TAB><count>     (Info, Warning, Critical, always)
//   firing<TAB><rule id><TAB><object><TAB><resource>
// Written whole (a temporary file, then a rename) at the start and after each
// cycle that changed it, mode 0644; removed on a clean stop. A missing file
// means the daemon is not running.

#ifndef KOVA_DAEMONS_PERFEVENTD_STATE_FILE_H_
#define KOVA_DAEMONS_PERFEVENTD_STATE_FILE_H_

#include <cstdint>
#include <string>
#include <vector>

#include "perfeventd/event_text.h"
#include "perfeventd/monitor.h"

namespace perfeventd {

// Events decided since the daemon started, by level.
struct EventCounts {
  uint64_t info = 0;
  uint64_t warning = 0;
  uint64_t critical = 0;

  void Count(const std::vector<Event>& events);
};

// The file's text for `counts` and `firings`.
std::string StateText(const EventCounts& counts, const std::vector<Firing>& firings);

class StateFile {
 public:
  // `path`: the file's real path.
  StateFile(std::string path, Notify notify) : path_(std::move(path)), notify_(std::move(notify)) {}

  // Writes `text` unless the file already holds it. A failure is said once,
  // and again only after a write went through; the next call tries again.
  void Publish(const std::string& text);
  // Removes the file.
  void Remove();

 private:
  std::string path_;
  Notify notify_;
  std::string written_;
  bool has_written_ = false;
  bool failing_ = false;
};

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_STATE_FILE_H_
