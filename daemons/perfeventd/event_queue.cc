#include "perfeventd/event_queue.h"

#include <errno.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdlib>

#include "kova/log.h"
#include "src/atomic_file.h"
#include "src/log_store.h"
#include "src/system_root.h"

namespace perfeventd {
namespace {

constexpr char kUser[] = "SYSTEM";
constexpr char kSource[] = "kovaperfeventd";

}  // namespace

EventQueue::EventQueue(std::string spill_path, size_t capacity, Notify notify)
    : spill_path_(std::move(spill_path)), capacity_(capacity), notify_(std::move(notify)) {}

void EventQueue::Restore() {
  std::string text;
  if (!kova::ReadWholeFile(spill_path_, text)) {
    if (errno != ENOENT) notify_(LOG_ERR, "can't read the waiting events in " + spill_path_);
    return;
  }
  spilled_ = true;
  std::vector<Event> events;
  // Lines "<time>\t<level>\t<text>".
  for (size_t start = 0; start < text.size();) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) end = text.size();
    const std::string line = text.substr(start, end - start);
    start = end + 1;
    const size_t first = line.find('\t');
    const size_t second = first == std::string::npos ? first : line.find('\t', first + 1);
    if (second == std::string::npos) continue;
    Event event;
    event.time = strtoll(line.c_str(), nullptr, 10);
    event.level = line.substr(first + 1, second - first - 1);
    event.text = line.substr(second + 1);
    if (event.level == kLogLevelInfo || event.level == kLogLevelWarning ||
        event.level == kLogLevelCritical) {
      events.push_back(std::move(event));
    }
  }
  if (!events.empty()) {
    notify_(LOG_INFO,
            std::to_string(events.size()) + " events of an earlier run wait to be written");
  }
  Add(events);
}

void EventQueue::Add(const std::vector<Event>& events) {
  for (const Event& event : events) {
    events_.push_back(Event{event.time, event.level, OneLine(event.text)});
    changed_ = true;
  }
  while (events_.size() > capacity_) {
    events_.pop_front();
    ++dropped_;
  }
}

bool EventQueue::Flush() {
  if (events_.empty()) return true;
  // Kept in the file before the write, so that even a kill during the write
  // loses nothing; a crash after the write but before the file is removed
  // writes them twice rather than never.
  Spill();
  std::vector<kova::LogRecord> records;
  records.reserve(events_.size());
  for (const Event& event : events_) {
    records.push_back({event.level, event.time, kUser, kSource, event.text});
  }
  if (kova::AppendLogRecords(kLogTypePerfEvent, records) == 0) {
    if (failing_) {
      notify_(LOG_INFO, "the performance-event log is written again (" +
                            std::to_string(events_.size()) + " events had waited)");
    }
    if (dropped_ > 0) {
      notify_(LOG_ERR, std::to_string(dropped_) + " events were dropped while the log failed");
    }
    events_.clear();
    failing_ = false;
    dropped_ = 0;
    changed_ = false;
    if (spilled_ && unlink(spill_path_.c_str()) != 0 && errno != ENOENT) {
      notify_(LOG_ERR, "can't remove " + spill_path_);
    }
    spilled_ = false;
    return true;
  }
  if (!failing_) {
    notify_(LOG_ERR, "can't write the performance-event log; its events wait and are retried");
  }
  failing_ = true;
  return false;
}

void EventQueue::Spill() {
  if (!changed_) return;
  std::string text;
  for (const Event& event : events_) {
    text += std::to_string(event.time) + '\t' + event.level + '\t' + event.text + '\n';
  }
  const std::string directory = spill_path_.substr(0, spill_path_.rfind('/'));
  if (!kova::MakeDirectories(directory, 0755) || !kova::ReplaceFile(spill_path_, text, 0600)) {
    notify_(LOG_ERR, "can't keep the waiting events in " + spill_path_);
    return;
  }
  spilled_ = true;
  changed_ = false;
}

}  // namespace perfeventd
