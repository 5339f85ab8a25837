#include "perfeventd/alerts.h"

#include <json/json.h>

#include <strings.h>

#include <cctype>
#include <ctime>

#include "kova/log.h"
#include "kova/perfevent.h"

namespace perfeventd {
namespace {

constexpr char kAlertsPath[] = "/api/v2/alerts";

// The alertname of each resource a rule can watch.
const struct {
  int32_t resource;
  const char* name;
} kAlertNames[] = {
    {PERFEVENT_RESOURCE_CPU, "KovaCpuHigh"},
    {PERFEVENT_RESOURCE_MEMORY, "KovaMemoryHigh"},
    {PERFEVENT_RESOURCE_IO_RATE, "KovaIoRateHigh"},
    {PERFEVENT_RESOURCE_IO_LATENCY, "KovaIoLatencyHigh"},
    {0, nullptr},
};

std::string Trim(const std::string& text) {
  size_t begin = 0, end = text.size();
  while (begin < end && isspace(static_cast<unsigned char>(text[begin]))) ++begin;
  while (end > begin && isspace(static_cast<unsigned char>(text[end - 1]))) --end;
  return text.substr(begin, end - begin);
}

// Whether `url` is an http:// or https:// URL with a host and nothing a
// request line can't carry.
bool IsHttpUrl(const std::string& url) {
  size_t scheme = 0;
  for (const char* prefix : {"http://", "https://"}) {
    const size_t length = std::char_traits<char>::length(prefix);
    if (url.size() >= length && strncasecmp(url.c_str(), prefix, length) == 0) scheme = length;
  }
  if (scheme == 0 || scheme == url.size() || url[scheme] == '/') return false;
  for (char c : url) {
    const unsigned char u = static_cast<unsigned char>(c);
    if (u <= ' ' || u == 0x7f || c == '"' || c == '<' || c == '>' || c == '\\') return false;
  }
  return true;
}

}  // namespace

std::string Rfc3339(int64_t seconds) {
  const time_t t = static_cast<time_t>(seconds);
  tm utc{};
  char text[32] = "";
  if (gmtime_r(&t, &utc) == nullptr ||
      strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%SZ", &utc) == 0)
    return "1970-01-01T00:00:00Z";
  return text;
}

std::string AlertsJson(const std::vector<Alert>& alerts) {
  Json::Value array(Json::arrayValue);
  for (const Alert& alert : alerts) {
    Json::Value item(Json::objectValue);
    for (const auto& [name, value] : alert.labels) item["labels"][name] = value;
    item["annotations"]["summary"] = alert.text;
    item["annotations"]["description"] = alert.text;
    item["startsAt"] = Rfc3339(alert.starts_at);
    if (alert.ends_at != 0) item["endsAt"] = Rfc3339(alert.ends_at);
    array.append(std::move(item));
  }
  Json::StreamWriterBuilder writer;
  writer["indentation"] = "";
  writer["emitUTF8"] = true;
  return Json::writeString(writer, array);
}

std::string AlertName(int32_t resource) {
  for (size_t i = 0; kAlertNames[i].name != nullptr; ++i) {
    if (kAlertNames[i].resource == resource) return kAlertNames[i].name;
  }
  return "KovaResourceHigh";
}

std::vector<std::string> AlertmanagerEndpoints(const std::string& setting,
                                               std::vector<std::string>& refused) {
  std::vector<std::string> endpoints;
  refused.clear();
  size_t start = 0;
  while (start <= setting.size()) {
    size_t comma = setting.find(',', start);
    if (comma == std::string::npos) comma = setting.size();
    std::string url = Trim(setting.substr(start, comma - start));
    start = comma + 1;
    if (url.empty()) continue;
    if (!IsHttpUrl(url)) {
      refused.push_back(url);
      continue;
    }
    while (url.back() == '/') url.pop_back();
    url += kAlertsPath;
    bool known = false;
    for (const std::string& endpoint : endpoints) known |= endpoint == url;
    if (!known) endpoints.push_back(url);
  }
  return endpoints;
}

std::string UrlForLog(const std::string& url) {
  const size_t host = url.find("://");
  if (host == std::string::npos) return url;
  const size_t end = url.find_first_of("/?#", host + 3);
  const size_t at = url.rfind('@', end == std::string::npos ? url.size() : end);
  if (at == std::string::npos || at < host + 3) return url;
  return url.substr(0, host + 3) + "***" + url.substr(at);
}

void AlertBook::Take(const std::vector<Event>& events) {
  for (const Event& event : events) {
    const EventOrigin& origin = event.origin;
    if (origin.rule_id.empty()) continue;
    if (!origin.raised) {
      const auto found = entries_.find(origin.rule_id);
      if (found != entries_.end() && found->second.alert.ends_at == 0) {
        found->second.alert.ends_at = event.time;
        found->second.posted = false;
      }
      continue;
    }
    Entry entry;
    entry.alert.labels = {
        {"alertname", AlertName(origin.resource)},
        {"severity", event.level == kLogLevelCritical ? "critical" : "warning"},
        {"resource", ResourceLabel(origin.resource)},
        {"object", origin.object},
        {"instance", instance_},
        {"rule", origin.rule_id},
    };
    entry.alert.text = OneLine(event.text);  // as the log holds it
    entry.alert.starts_at = event.time;
    entries_[origin.rule_id] = std::move(entry);
  }
}

void AlertBook::KeepOnly(const std::set<std::string>& firing, int64_t now) {
  for (auto& [rule_id, entry] : entries_) {
    if (entry.alert.ends_at != 0 || firing.count(rule_id)) continue;
    entry.alert.ends_at = now < entry.alert.starts_at ? entry.alert.starts_at : now;
    entry.posted = false;
  }
}

std::vector<Alert> AlertBook::Due(double now) {
  std::vector<Alert> due;
  for (auto it = entries_.begin(); it != entries_.end();) {
    Entry& entry = it->second;
    if (entry.alert.ends_at != 0) {
      due.push_back(entry.alert);
      it = entries_.erase(it);
      continue;
    }
    if (!entry.posted || now - entry.posted_at >= resend_seconds_) {
      due.push_back(entry.alert);
      entry.posted = true;
      entry.posted_at = now;
    }
    ++it;
  }
  return due;
}

size_t AlertBook::open() const {
  size_t count = 0;
  for (const auto& [rule_id, entry] : entries_) count += entry.alert.ends_at == 0;
  return count;
}

}  // namespace perfeventd
