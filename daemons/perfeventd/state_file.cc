#include "perfeventd/state_file.h"

#include <errno.h>
#include <syslog.h>
#include <unistd.h>

#include <cstring>
#include <utility>

#include "kova/log.h"
#include "src/atomic_file.h"
#include "src/system_root.h"

namespace perfeventd {

void EventCounts::Count(const std::vector<Event>& events) {
  for (const Event& event : events) {
    if (event.level == kLogLevelCritical) {
      ++critical;
    } else if (event.level == kLogLevelWarning) {
      ++warning;
    } else {
      ++info;
    }
  }
}

std::string StateText(const EventCounts& counts, const std::vector<Firing>& firings) {
  std::string text;
  for (const auto& [level, count] :
       {std::pair{kLogLevelInfo, counts.info}, std::pair{kLogLevelWarning, counts.warning},
        std::pair{kLogLevelCritical, counts.critical}}) {
    text += std::string("events_total\t") + level + '\t' + std::to_string(count) + '\n';
  }
  for (const Firing& firing : firings) {
    std::string object = firing.object;
    for (char& c : object) {
      if (c == '\t' || c == '\n' || c == '\r') c = ' ';
    }
    text +=
        "firing\t" + firing.rule_id + '\t' + object + '\t' + ResourceLabel(firing.resource) + '\n';
  }
  return text;
}

void StateFile::Publish(const std::string& text) {
  if (has_written_ && text == written_) return;
  const std::string directory = path_.substr(0, path_.rfind('/'));
  if (!kova::MakeDirectories(directory, 0755) || !kova::ReplaceFile(path_, text, 0644)) {
    if (!failing_) notify_(LOG_ERR, "can't write " + path_ + ": " + strerror(errno));
    failing_ = true;
    return;
  }
  if (failing_) notify_(LOG_INFO, path_ + " is written again");
  failing_ = false;
  written_ = text;
  has_written_ = true;
}

void StateFile::Remove() {
  if (unlink(path_.c_str()) != 0 && errno != ENOENT) {
    notify_(LOG_ERR, "can't remove " + path_ + ": " + strerror(errno));
  }
  has_written_ = false;
}

}  // namespace perfeventd
