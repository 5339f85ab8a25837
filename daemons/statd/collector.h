// The collector's state between the sampling loop and the protocol's threads:
// the real-time ring, the minute being gathered for the history, and the
// settings. Every method is safe to call from any thread.

#ifndef KOVA_DAEMONS_STATD_COLLECTOR_H_
#define KOVA_DAEMONS_STATD_COLLECTOR_H_

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include "statd/history_sink.h"
#include "statd/minute_rows.h"
#include "statd/realtime_store.h"
#include "statd/sampler.h"
#include "statd/settings.h"

namespace statd {

// One series of a real-time answer: parallel arrays, oldest first.
struct RealtimeSeries {
  std::string id;
  std::vector<int64_t> times;
  std::vector<double> values;
};

struct CatalogAnswer {
  int interval = 1;
  int realtime_minutes = 15;
  bool history_enabled = false;
  HistoryState history_state = HistoryState::kOff;
  int utc_offset = 0;  // seconds east of UTC of the machine's local time now
  std::vector<SeriesInfo> series;
};

class Collector {
 public:
  // A collector sampled every `interval` seconds that hands its minutes to
  // `history`, with the default settings until the first Reload.
  Collector(HistorySink& history, int interval);

  // Reads the system settings again and applies them: the ring's reach (the
  // newest samples stay) and the history's settings. False with `error` when
  // they can't be read; the settings before then stay.
  bool Reload(std::string& error);

  // Adds the values of second `time` to the ring and, while history is on, to
  // the minute being gathered; a finished minute's rows go to the history.
  void Record(int64_t time, const std::vector<SeriesValue>& values);

  // Hands the minute gathered so far, while history is on, to the history: at
  // a stop, so that a restart loses none of it.
  void Flush();

  CatalogAnswer Catalog() const;

  // The samples of each known id of `ids` after `since`, in the order asked;
  // the other ids go to `unknown`. `now` gets the newest sample's time.
  void Realtime(const std::vector<std::string>& ids, int64_t since,
                std::vector<RealtimeSeries>& found, std::vector<std::string>& unknown,
                int64_t& now) const;

  bool HistoryEnabled() const;
  // The settings of the last Reload that read them.
  Settings settings() const;
  int interval() const { return interval_; }
  HistorySink& history() { return history_; }

 private:
  HistorySink& history_;
  const int interval_;
  mutable std::mutex mutex_;
  Settings settings_;
  RealtimeStore store_;
  MinuteRows minutes_;
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_COLLECTOR_H_
