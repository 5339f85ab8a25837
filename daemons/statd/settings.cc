#include "statd/settings.h"

#include <cstdlib>
#include <string>
#include <utility>

#include "kova/conf.h"
#include "src/conf_file.h"
#include "src/system_root.h"

namespace statd {
namespace {

// A whole number of days from 1 to 100 years, or `fallback`.
int Days(const std::string& text, int fallback) {
  char* end = nullptr;
  const long days = strtol(text.c_str(), &end, 10);
  return !text.empty() && *end == '\0' && days >= 1 && days <= 36525 ? static_cast<int>(days)
                                                                     : fallback;
}

}  // namespace

bool ReadSettings(Settings& settings, std::string& error) {
  settings = Settings{};
  const std::string path = kova::RootPath(kKovaInfoConf);
  std::string minutes, history, minute_days, hour_days;
  for (auto [key, value] : {std::pair{"resourcemonitor_realtime_max", &minutes},
                            std::pair{"resourcemonitor_history", &history},
                            std::pair{"resourcemonitor_history_minute_days", &minute_days},
                            std::pair{"resourcemonitor_history_hour_days", &hour_days},
                            std::pair{"statd_metrics_listen", &settings.metrics_listen},
                            std::pair{"statd_metrics_token_file", &settings.metrics_token_file}}) {
    if (kova::ConfRead(path, key, *value) < 0) {
      error = "can't read " + path;
      return false;
    }
  }
  settings.realtime_minutes = minutes == "30"    ? 30
                              : minutes == "60"  ? 60
                              : minutes == "120" ? 120
                                                 : 15;
  settings.history.enabled = history == "yes";
  settings.history.minute_days = Days(minute_days, settings.history.minute_days);
  settings.history.hour_days = Days(hour_days, settings.history.hour_days);
  return true;
}

}  // namespace statd
