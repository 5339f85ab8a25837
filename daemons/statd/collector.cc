#include "statd/collector.h"

#include <ctime>

namespace statd {
namespace {

size_t Slots(int minutes, int interval) { return static_cast<size_t>(minutes * 60 / interval); }

}  // namespace

Collector::Collector(HistorySink& history, int interval)
    : history_(history),
      interval_(interval),
      store_(Slots(Settings{}.realtime_minutes, interval)) {}

bool Collector::Reload(std::string& error) {
  Settings settings;
  if (!ReadSettings(settings, error)) return false;
  std::lock_guard lock(mutex_);
  store_.Resize(Slots(settings.realtime_minutes, interval_));
  if (!settings.history.enabled) minutes_.Clear();
  history_.Configure(settings.history);
  settings_ = settings;
  return true;
}

void Collector::Record(int64_t time, const std::vector<SeriesValue>& values) {
  std::vector<MinuteRow> rows;
  {
    std::lock_guard lock(mutex_);
    if (!store_.Add(time, values)) {
      // The clock was set back: the samples it now shows as future go.
      store_.DropFrom(time);
      store_.Add(time, values);
    }
    if (settings_.history.enabled) rows = minutes_.Add(time, values);
  }
  if (!rows.empty()) history_.Add(std::move(rows));
}

void Collector::Flush() {
  std::vector<MinuteRow> rows;
  {
    std::lock_guard lock(mutex_);
    if (settings_.history.enabled) rows = minutes_.Close();
  }
  if (!rows.empty()) history_.Add(std::move(rows));
}

CatalogAnswer Collector::Catalog() const {
  CatalogAnswer answer;
  answer.interval = interval_;
  // The log's times are local texts; a client turns them into instants with this.
  const time_t now = time(nullptr);
  struct tm local;
  if (localtime_r(&now, &local) != nullptr) answer.utc_offset = static_cast<int>(local.tm_gmtoff);
  // Under the lock, so that the state belongs to the settings read with it.
  std::lock_guard lock(mutex_);
  answer.history_state = history_.State();
  answer.realtime_minutes = settings_.realtime_minutes;
  answer.history_enabled = settings_.history.enabled;
  answer.series = store_.Catalog();
  return answer;
}

void Collector::Realtime(const std::vector<std::string>& ids, int64_t since,
                         std::vector<RealtimeSeries>& found, std::vector<std::string>& unknown,
                         int64_t& now) const {
  std::lock_guard lock(mutex_);
  now = store_.newest();
  for (const std::string& id : ids) {
    RealtimeSeries series{id, {}, {}};
    if (store_.Read(id, since, series.times, series.values)) {
      found.push_back(std::move(series));
    } else {
      unknown.push_back(id);
    }
  }
}

bool Collector::HistoryEnabled() const {
  std::lock_guard lock(mutex_);
  return settings_.history.enabled;
}

Settings Collector::settings() const {
  std::lock_guard lock(mutex_);
  return settings_;
}

}  // namespace statd
