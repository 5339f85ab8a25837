#include "perfeventd/alerts.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include <sstream>

#include "kova/perfevent.h"
#include "perfeventd/alert_outbox.h"

namespace perfeventd {
namespace {

using ::testing::ElementsAreArray;

Json::Value Parse(const std::string& text) {
  Json::Value value;
  std::istringstream in(text);
  std::string errors;
  EXPECT_TRUE(Json::parseFromStream(Json::CharReaderBuilder(), in, &value, &errors)) << text;
  return value;
}

TEST(AlertsTest, JsonCarriesLabelsTextAndTimesInUtc) {
  const struct {
    Alert alert;
    const char* starts_at;
    const char* ends_at;  // nullptr: no endsAt
  } cases[] = {
      {{{{"alertname", "KovaCpuHigh"}, {"rule", "7"}}, "CPU use of \"x\" ü\n", 1700000000, 0},
       "2023-11-14T22:13:20Z",
       nullptr},
      {{{{"alertname", "KovaIoLatencyHigh"}}, "back", 0, 951782400},
       "1970-01-01T00:00:00Z",
       "2000-02-29T00:00:00Z"},
  };
  std::vector<Alert> alerts;
  for (const auto& c : cases) alerts.push_back(c.alert);
  const Json::Value array = Parse(AlertsJson(alerts));
  ASSERT_TRUE(array.isArray());
  ASSERT_EQ(array.size(), std::size(cases));
  for (Json::ArrayIndex i = 0; i < array.size(); ++i) {
    const Json::Value& item = array[i];
    const auto& c = cases[i];
    EXPECT_EQ(item["labels"].size(), c.alert.labels.size());
    for (const auto& [name, value] : c.alert.labels) EXPECT_EQ(item["labels"][name], value);
    EXPECT_EQ(item["annotations"]["summary"], c.alert.text);
    EXPECT_EQ(item["annotations"]["description"], c.alert.text);
    EXPECT_EQ(item["startsAt"], c.starts_at);
    if (c.ends_at == nullptr) {
      EXPECT_FALSE(item.isMember("endsAt"));
    } else {
      EXPECT_EQ(item["endsAt"], c.ends_at);
    }
  }
  EXPECT_EQ(AlertsJson({}), "[]");
}

TEST(AlertsTest, EndpointsTakeHttpUrlsOnceAndRefuseTheRest) {
  const struct {
    const char* setting;
    std::vector<std::string> endpoints;
    std::vector<std::string> refused;
  } cases[] = {
      {"", {}, {}},
      {" , ", {}, {}},
      {"http://127.0.0.1:9093", {"http://127.0.0.1:9093/api/v2/alerts"}, {}},
      {" http://a:9093/ ,HTTPS://b/am//, http://a:9093",
       {"http://a:9093/api/v2/alerts", "HTTPS://b/am/api/v2/alerts"},
       {}},
      {"ftp://a,http://,http:///x,a:9093,http://a b,https://a\"",
       {},
       {"ftp://a", "http://", "http:///x", "a:9093", "http://a b", "https://a\""}},
      {"file:///etc/passwd, https://am.example:443",
       {"https://am.example:443/api/v2/alerts"},
       {"file:///etc/passwd"}},
  };
  for (const auto& c : cases) {
    std::vector<std::string> refused = {"left over"};
    EXPECT_EQ(AlertmanagerEndpoints(c.setting, refused), c.endpoints) << c.setting;
    EXPECT_EQ(refused, c.refused) << c.setting;
  }
}

TEST(AlertsTest, UrlsForTheLogHideUserAndPassword) {
  const struct {
    const char* url;
    const char* shown;
  } cases[] = {
      {"http://127.0.0.1:9093/api/v2/alerts", "http://127.0.0.1:9093/api/v2/alerts"},
      {"https://kova:s3cret@am:9093/api/v2/alerts", "https://***@am:9093/api/v2/alerts"},
      {"http://a:b@c@am/x?to=u@v", "http://***@am/x?to=u@v"},
      {"http://am/path@x", "http://am/path@x"},
  };
  for (const auto& c : cases) EXPECT_EQ(UrlForLog(c.url), c.shown);
}

Event Change(const char* rule, int32_t resource, const char* level, bool raised, int64_t time) {
  return Event{time, level, std::string(raised ? "up\t" : "down ") + rule,
               EventOrigin{rule, std::string("obj-") + rule, resource, raised}};
}

// The alerts of one Due call as "<rule> firing since <startsAt>" or
// "<rule> resolved at <endsAt>".
std::vector<std::string> Summaries(const std::vector<Alert>& alerts) {
  std::vector<std::string> out;
  for (const Alert& alert : alerts) {
    out.push_back(alert.labels.at("rule") +
                  (alert.ends_at == 0 ? " firing since " + std::to_string(alert.starts_at)
                                      : " resolved at " + std::to_string(alert.ends_at)));
  }
  return out;
}

TEST(AlertBookTest, OpensResendsAndResolvesAlerts) {
  AlertBook book(60);
  book.SetInstance("nas1");
  const struct {
    std::vector<Event> events;
    std::set<std::string> firing;  // the rules raised after the cycle
    int64_t now;
    std::vector<std::string> due;
  } steps[] = {
      {{Change("1", PERFEVENT_RESOURCE_CPU, "Critical", true, 100)},
       {"1"},
       100,
       {"1 firing since 100"}},
      {{}, {"1"}, 130, {}},
      {{}, {"1"}, 160, {"1 firing since 100"}},  // re-sent a minute later
      {{Change("2", PERFEVENT_RESOURCE_MEMORY, "Warning", true, 170)},
       {"1", "2"},
       170,
       {"2 firing since 170"}},
      // A recovery is posted at once, whatever the re-send time.
      {{Change("1", PERFEVENT_RESOURCE_CPU, "Info", false, 200)},
       {"2"},
       200,
       {"1 resolved at 200"}},
      {{}, {"2"}, 229, {}},
      {{}, {"2"}, 230, {"2 firing since 170"}},
      // An entry read back from the waiting-events file has no rule.
      {{Event{240, "Warning", "old", {}}}, {"2"}, 240, {}},
      // The rule was removed, turned off or changed while raised.
      {{}, {}, 250, {"2 resolved at 250"}},
      {{}, {}, 400, {}},
      // A recovery of a rule without an alert changes nothing.
      {{Change("3", PERFEVENT_RESOURCE_IO_RATE, "Info", false, 410)}, {}, 410, {}},
  };
  for (size_t i = 0; i < std::size(steps); ++i) {
    book.Take(steps[i].events);
    book.KeepOnly(steps[i].firing, steps[i].now);
    EXPECT_THAT(Summaries(book.Due(static_cast<double>(steps[i].now))),
                ElementsAreArray(steps[i].due))
        << "step " << i;
    EXPECT_EQ(book.open(), steps[i].firing.size()) << "step " << i;
  }
}

// The burning-service end-to-end test has the CPU alert's labels.
TEST(AlertBookTest, LabelsNameTheRuleObjectAndBox) {
  const struct {
    int32_t resource;
    const char* level;
    std::map<std::string, std::string> labels;
  } cases[] = {
      {PERFEVENT_RESOURCE_MEMORY,
       "Warning",
       {{"alertname", "KovaMemoryHigh"}, {"severity", "warning"}, {"resource", "memory"}}},
      {PERFEVENT_RESOURCE_IO_RATE,
       "Warning",
       {{"alertname", "KovaIoRateHigh"}, {"severity", "warning"}, {"resource", "io_rate"}}},
      {PERFEVENT_RESOURCE_IO_LATENCY,
       "Critical",
       {{"alertname", "KovaIoLatencyHigh"}, {"severity", "critical"}, {"resource", "io_latency"}}},
  };
  for (const auto& c : cases) {
    AlertBook book(60);
    book.SetInstance("nas1");
    book.Take({Change("12", c.resource, c.level, true, 500)});
    const std::vector<Alert> due = book.Due(0);
    ASSERT_EQ(due.size(), 1u);
    std::map<std::string, std::string> labels = c.labels;
    labels.insert({{"object", "obj-12"}, {"instance", "nas1"}, {"rule", "12"}});
    EXPECT_EQ(due[0].labels, labels);
  }
}

Alert Labelled(const std::string& rule, int64_t ends_at = 0) {
  return Alert{{{"rule", rule}}, "t", 1, ends_at};
}

TEST(AlertOutboxTest, RetriesWithBackoffAndDropsOldestAndSpent) {
  AlertOutbox outbox(OutboxLimits{3, 2, 1, 4, 2});
  AlertOutbox::Batch batch;
  // op: "add" the alerts of `rules` ("r!" resolved); "take" at `now`, want the
  // batch's rules; "fail" or "ok" for the last batch taken at `now`, want the
  // alerts dropped. Then the alerts waiting and the next try (-1: none).
  const struct {
    const char* op;
    std::vector<std::string> rules;
    double now;
    std::vector<std::string> want;
    size_t dropped;
    size_t waiting;
    double next_try;
  } steps[] = {
      {"add", {"a", "b", "c"}, 0, {}, 0, 3, 0},
      {"add", {"d"}, 0, {}, 1, 3, 0},  // full: "a" goes
      {"take", {}, 0, {"b", "c"}, 0, 3, 0},
      {"fail", {}, 0, {}, 0, 3, 1},
      {"take", {}, 0.5, {}, 0, 3, 1},  // backing off
      {"take", {}, 1, {"b", "c"}, 0, 3, 1},
      {"fail", {}, 1, {}, 2, 1, 3},     // "b" and "c" out of attempts
      {"add", {"d!"}, 2, {}, 0, 1, 3},  // replaces the waiting "d"
      {"take", {}, 3, {"d!"}, 0, 1, 3},
      {"add", {"d"}, 3, {}, 0, 1, 3},  // while posting: newer, stays
      {"ok", {}, 3, {}, 0, 1, 3},
      {"take", {}, 3, {"d"}, 0, 1, 3},
      {"fail", {}, 3, {}, 0, 1, 4},  // the backoff started over
      {"take", {}, 4, {"d"}, 0, 1, 4},
      {"add", {"e"}, 4, {}, 0, 2, 4},
      {"ok", {}, 4, {}, 0, 1, 4},
      {"take", {}, 4, {"e"}, 0, 1, 4},
      {"fail", {}, 4, {}, 0, 1, 5},
      {"take", {}, 5, {"e"}, 0, 1, 5},
      {"fail", {}, 5, {}, 1, 0, -1},
      {"add", {"f"}, 6, {}, 0, 1, 7},  // still backing off
      {"take", {}, 7, {"f"}, 0, 1, 7},
      {"fail", {}, 7, {}, 0, 1, 11},
      {"take", {}, 11, {"f"}, 0, 1, 11},
      {"fail", {}, 11, {}, 1, 0, -1},
      {"add", {"g"}, 12, {}, 0, 1, 15},  // 8 s capped at 4
  };
  for (size_t i = 0; i < std::size(steps); ++i) {
    const auto& s = steps[i];
    const std::string op = s.op;
    size_t dropped = 0;
    if (op == "add") {
      std::vector<Alert> alerts;
      for (const std::string& rule : s.rules) {
        alerts.push_back(rule.back() == '!' ? Labelled(rule.substr(0, rule.size() - 1), 9)
                                            : Labelled(rule));
      }
      dropped = outbox.Add(alerts);
    } else if (op == "take") {
      batch = outbox.Take(s.now);
      std::vector<std::string> got;
      for (const Alert& alert : batch.alerts) {
        got.push_back(alert.labels.at("rule") + (alert.ends_at != 0 ? "!" : ""));
      }
      EXPECT_EQ(got, s.want) << "step " << i;
    } else {
      dropped = outbox.Done(batch, op == "ok", s.now);
    }
    EXPECT_EQ(dropped, s.dropped) << "step " << i;
    EXPECT_EQ(outbox.size(), s.waiting) << "step " << i;
    EXPECT_EQ(outbox.NextTry().value_or(-1), s.next_try) << "step " << i;
  }
}

}  // namespace
}  // namespace perfeventd
