// kovastatd's settings, read from the system settings file at start and on
// every reload: how far back the real-time series reach, and the history's.

#ifndef KOVA_DAEMONS_STATD_SETTINGS_H_
#define KOVA_DAEMONS_STATD_SETTINGS_H_

#include "statd/history_sink.h"

namespace statd {

struct Settings {
  int realtime_minutes = 15;  // 15, 30, 60 or 120
  HistorySettings history;
  std::string metrics_listen;      // "ADDR:PORT" of the metrics endpoint; empty: off
  std::string metrics_token_file;  // the bearer token's file; empty: no token
};

// Reads /etc/kovainfo.conf under the system root: "resourcemonitor_realtime_max"
// (anything but 30, 60 or 120 counts as 15), "resourcemonitor_history" (on only
// when exactly "yes"), "resourcemonitor_history_minute_days" and
// "resourcemonitor_history_hour_days" (whole numbers of days from 1; the
// defaults otherwise), "statd_metrics_listen" and "statd_metrics_token_file"
// (as written). False, with the defaults in `settings` and `error` set,
// when the file exists but can't be read.
bool ReadSettings(Settings& settings, std::string& error);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_SETTINGS_H_
