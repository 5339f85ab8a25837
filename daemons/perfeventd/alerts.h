// Performance events as Alertmanager alerts: the alert of each raised rule,
// kept open while the rule stays raised and closed when it recovers, in the
// JSON of Alertmanager's v2 API (POST <url>/api/v2/alerts).
//
// Labels: alertname by resource (KovaCpuHigh, KovaMemoryHigh, KovaIoRateHigh,
// KovaIoLatencyHigh), severity ("warning", "critical"), resource, object,
// instance and rule (the rule id, so that two rules on one object stay two
// alerts). The annotations summary and description hold the event's text as
// logged (on one line).

#ifndef KOVA_DAEMONS_PERFEVENTD_ALERTS_H_
#define KOVA_DAEMONS_PERFEVENTD_ALERTS_H_

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "perfeventd/event_text.h"

namespace perfeventd {

struct Alert {
  std::map<std::string, std::string> labels;
  std::string text;       // summary and description
  int64_t starts_at = 0;  // seconds since the epoch
  int64_t ends_at = 0;    // when it was resolved; 0 while it fires

  bool operator==(const Alert&) const = default;
};

// `seconds` since the epoch in RFC 3339, UTC: "2023-11-14T22:13:20Z".
std::string Rfc3339(int64_t seconds);

// The body of a post: a JSON array of the alerts, each with labels,
// annotations, startsAt and, once resolved, endsAt.
std::string AlertsJson(const std::vector<Alert>& alerts);

// The alertname of a rule on `resource`, "KovaResourceHigh" for an unknown one.
std::string AlertName(int32_t resource);

// The URLs to post alerts to, from the comma-separated base URLs of the
// setting (blanks around each ignored): each http:// or https:// URL with a
// host becomes "<url>/api/v2/alerts", once. The others are put in `refused`.
std::vector<std::string> AlertmanagerEndpoints(const std::string& setting,
                                               std::vector<std::string>& refused);

// `url` as the system log may show it: a user and password in it made "***".
std::string UrlForLog(const std::string& url);

// The alerts of the raised rules, and which of them are due to be posted. A
// firing alert is posted when it opens and again every `resend_seconds`, so
// that Alertmanager, which times out an alert not heard of for its
// resolve_timeout, keeps it; a closed one is posted once with its endsAt.
class AlertBook {
 public:
  explicit AlertBook(double resend_seconds) : resend_seconds_(resend_seconds) {}

  // The instance label of the alerts opened from now on.
  void SetInstance(std::string instance) { instance_ = std::move(instance); }

  // Opens an alert for each raise among `events` and closes the rule's alert
  // at each recovery, at the event's time. Events without a rule id are passed
  // over.
  void Take(const std::vector<Event>& events);

  // Closes at `now` the open alerts of the rules not in `firing`: rules
  // removed, turned off or changed while raised.
  void KeepOnly(const std::set<std::string>& firing, int64_t now);

  // The alerts to post at `now` (seconds, any clock that only goes forward):
  // those opened or closed since the last call, and the open ones last posted
  // `resend_seconds` ago or more.
  std::vector<Alert> Due(double now);

  size_t open() const;

 private:
  struct Entry {
    Alert alert;
    bool posted = false;
    double posted_at = 0;
  };

  double resend_seconds_;
  std::string instance_;
  std::map<std::string, Entry> entries_;  // by rule id; closed ones until posted
};

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_ALERTS_H_
