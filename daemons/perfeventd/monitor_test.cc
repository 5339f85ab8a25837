#include "perfeventd/monitor.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <memory>

#include "kova/perfevent.h"

namespace perfeventd {

using sampling::CpuTimes;
using sampling::Measurements;
using sampling::ObjectDirectory;
using sampling::RecordedProcess;
using sampling::Snapshot;
namespace {

using ::testing::ElementsAre;

class FakeDirectory : public ObjectDirectory {
 public:
  std::optional<RecordedProcess> ServiceProcess(const std::string& name) override {
    auto it = services.find(name);
    return it != services.end() ? std::optional(it->second) : std::nullopt;
  }
  std::optional<std::string> LunVolume(const std::string& uuid) override {
    return uuid == "lun-1" ? std::optional<std::string>("/volume1") : std::nullopt;
  }
  std::string RealPath(const std::string& path) override { return "/root" + path; }
  std::string DisplayName(int32_t, const std::string& object) override {
    return object.empty() ? "" : "N-" + object;
  }

  std::map<std::string, RecordedProcess> services;
};

// Rules with a period of 5 s; `duration` 10 makes a window of two samples.
Rule MakeRule(const std::string& id, int32_t type, const std::string& object, int32_t resource,
              int32_t severity, int32_t threshold, int32_t period = 5, int32_t duration = 10) {
  return Rule{id, type, object, resource, severity, threshold, period, duration};
}

class MonitorTest : public ::testing::Test {
 protected:
  // One cycle in which the system's memory, and the memory of the process 10
  // (the service "smb"), are at `percent`, and the disk 8:0 did 5 ms per I/O.
  std::vector<std::string> Cycle(int percent, bool service_runs = true) {
    Snapshot snapshot;
    snapshot.cpu = CpuTimes{busy_ += 10, total_ += 100};
    snapshot.memory_total_kib = 1000;
    snapshot.memory_available_kib = 1000 - 10 * percent;
    snapshot.processes_read = true;
    if (service_runs) snapshot.processes = {{10, 1, 50, 0, static_cast<uint64_t>(10 * percent)}};
    snapshot.disks_read = snapshot.mounts_read = true;
    snapshot.disks = {{8, 0, "vda", ios_ += 10, 0, io_ms_ += 50, true}};
    snapshot.mounts = {{8, 0, "/"}, {9, 0, "/root/volume"}};
    measurements_.Advance(snapshot);
    std::vector<std::string> out;
    for (const Event& event : monitor_->Cycle(measurements_, 1000)) {
      out.push_back(event.level + " " + event.text.substr(0, event.text.find(" for ")));
    }
    return out;
  }

  FakeDirectory directory_;
  std::vector<std::string> notices_;
  std::unique_ptr<Monitor> monitor_ = std::make_unique<Monitor>(
      directory_, [this](int, const std::string& text) { notices_.push_back(text); });
  Measurements measurements_{1};
  uint64_t busy_ = 0;
  uint64_t total_ = 0;
  uint64_t ios_ = 0;
  uint64_t io_ms_ = 0;
};

TEST_F(MonitorTest, RulesOnOneObjectKeepWindowsOfTheirOwn) {
  monitor_->SetRules({MakeRule("1", 0, "", PERFEVENT_RESOURCE_MEMORY, 1, 50),
                      MakeRule("2", 0, "", PERFEVENT_RESOURCE_MEMORY, 2, 90)});
  EXPECT_THAT(Cycle(95), ElementsAre());
  EXPECT_THAT(Cycle(95), ElementsAre("Warning Memory use of the system has been above 50%",
                                     "Critical Memory use of the system has been above 90%"));
  EXPECT_THAT(Cycle(60), ElementsAre());
  EXPECT_THAT(Cycle(60),
              ElementsAre("Info Memory use of the system has been back at or below 90%"));
  EXPECT_THAT(Cycle(60), ElementsAre());
  EXPECT_TRUE(notices_.empty());
}

TEST_F(MonitorTest, SwitchingOrChangingARuleStartsAFreshWindow) {
  const Rule rule = MakeRule("1", 0, "", PERFEVENT_RESOURCE_MEMORY, 1, 50, 5, 15);
  Rule changed = rule;
  changed.threshold = 40;
  const Rule other = MakeRule("2", 0, "", PERFEVENT_RESOURCE_MEMORY, 2, 90);
  const struct {
    const char* name;
    std::vector<Rule> between;  // the rules set after two high samples
    size_t events;              // after one more high sample
  } cases[] = {
      {"unchanged, beside a new rule", {rule, other}, 1},
      {"switched off and on", {}, 0},
      {"changed", {changed}, 0},
      {"deleted", {other}, 0},
  };
  for (const auto& c : cases) {
    monitor_ = std::make_unique<Monitor>(directory_, [](int, const std::string&) {});
    monitor_->SetRules({rule});
    Cycle(70);
    Cycle(70);
    monitor_->SetRules(c.between);
    if (c.between.empty()) monitor_->SetRules({rule});
    EXPECT_EQ(Cycle(70).size(), c.events) << c.name;
  }
}

TEST_F(MonitorTest, AProblemIsSaidOnceUntilTheRuleIsMeasuredAgain) {
  const std::vector<Rule> rules = {MakeRule("1", 1, "smb", PERFEVENT_RESOURCE_MEMORY, 1, 50),
                                   MakeRule("2", 1, "smb", PERFEVENT_RESOURCE_CPU, 1, 50),
                                   MakeRule("3", 2, "gone", PERFEVENT_RESOURCE_IO_RATE, 1, 50),
                                   MakeRule("4", 1, "smb", PERFEVENT_RESOURCE_IO_RATE, 1, 50)};
  monitor_->SetRules(rules);
  EXPECT_TRUE(monitor_->Needs().processes && monitor_->Needs().mounts);
  for (int i = 0; i < 3; ++i) {
    EXPECT_THAT(Cycle(80), ElementsAre());
    monitor_->SetRules(rules);  // a reload says nothing again
  }
  directory_.services["smb"] = {10, 50};
  Cycle(80);
  EXPECT_THAT(Cycle(80), ElementsAre("Warning Memory use of service \"N-smb\" has been above 50%"));
  directory_.services.clear();  // stopped
  Cycle(80, false);
  EXPECT_THAT(
      notices_,
      ElementsAre(
          "rule 4 (I/O rate of service \"smb\") is skipped: a service's rule can watch only "
          "CPU or memory",
          "rule 1 (Memory use of service \"smb\") is skipped: the service is not running",
          "rule 2 (CPU use of service \"smb\") is skipped: the service is not running",
          "rule 3 (I/O rate of LUN \"gone\") is skipped: no LUN has this uuid",
          "rule 1 (Memory use of service \"smb\") is measured again",
          "rule 2 (CPU use of service \"smb\") is measured again",
          "rule 1 (Memory use of service \"smb\") is skipped: the service is not running",
          "rule 2 (CPU use of service \"smb\") is skipped: the service is not running"));
}

// Rules stored with fields left out: nothing of them is sampled, and each is
// said once, named as far as it can be.
TEST_F(MonitorTest, RulesThatCanNeverBeMeasuredAreSkippedAndSaidOnce) {
  const std::vector<Rule> rules = {MakeRule("1", 0, "", 0, 0, 0),
                                   MakeRule("2", 1, "", PERFEVENT_RESOURCE_CPU, 1, 0),
                                   MakeRule("3", 2, "", PERFEVENT_RESOURCE_IO_RATE, 1, 0),
                                   MakeRule("4", 7, "x", PERFEVENT_RESOURCE_CPU, 1, 0)};
  monitor_->SetRules(rules);
  const sampling::SampleNeeds needs = monitor_->Needs();
  EXPECT_FALSE(needs.processes || needs.disks || needs.mounts || needs.whole_disks);
  for (int i = 0; i < 3; ++i) {
    EXPECT_THAT(Cycle(80), ElementsAre());
    monitor_->SetRules(rules);
  }
  EXPECT_THAT(
      notices_,
      ElementsAre("rule 1 (resource 0 of the system) is skipped: unknown resource 0",
                  "rule 2 (CPU use of service \"\") is skipped: a service's rule needs the "
                  "service's name",
                  "rule 3 (I/O rate of LUN \"\") is skipped: a LUN's rule needs the LUN's uuid",
                  "rule 4 (CPU use of object \"x\" of type 7) is skipped: unknown object type 7"));
}

TEST_F(MonitorTest, PeriodsOfSeveralCyclesAndLunDevices) {
  // A 10 s period on a 5 s cycle: each sample averages two cycles.
  monitor_->SetRules({MakeRule("1", 0, "", PERFEVENT_RESOURCE_MEMORY, 1, 50, 10, 10),
                      MakeRule("2", 2, "lun-1", PERFEVENT_RESOURCE_IO_LATENCY, 2, 4, 5, 5)});
  EXPECT_EQ(monitor_->CycleSeconds(), 5);
  EXPECT_THAT(Cycle(20), ElementsAre());
  EXPECT_THAT(Cycle(70),
              ElementsAre("Critical I/O latency of LUN \"N-lun-1\" has been above 4 ms"));
  EXPECT_THAT(Cycle(90), ElementsAre());
  EXPECT_THAT(Cycle(20), ElementsAre("Warning Memory use of the system has been above 50%"));
  monitor_->SetRules({MakeRule("1", 0, "", PERFEVENT_RESOURCE_MEMORY, 1, 50, 6, 30),
                      MakeRule("2", 0, "", PERFEVENT_RESOURCE_CPU, 1, 50, 9, 30)});
  EXPECT_EQ(monitor_->CycleSeconds(), 3);
}

TEST_F(MonitorTest, FiringRulesAreTheRaisedOnesWithTheirObjects) {
  directory_.services["smb"] = RecordedProcess{10, 50};
  const Rule system = MakeRule("1", 0, "NAS", PERFEVENT_RESOURCE_MEMORY, 1, 50);
  const Rule service = MakeRule("2", 1, "smb", PERFEVENT_RESOURCE_MEMORY, 2, 50);
  Rule changed = service;
  changed.threshold = 60;
  monitor_->SetRules({system, service});
  Cycle(70);
  EXPECT_THAT(monitor_->Firings(), ElementsAre());
  std::vector<EventOrigin> origins;
  for (const Event& event : monitor_->Cycle(measurements_, 1000)) origins.push_back(event.origin);
  EXPECT_THAT(origins, ElementsAre(EventOrigin{"1", "system", PERFEVENT_RESOURCE_MEMORY, true},
                                   EventOrigin{"2", "N-smb", PERFEVENT_RESOURCE_MEMORY, true}));
  const struct {
    const char* name;
    std::vector<Rule> rules;
    std::vector<Firing> firings;
  } cases[] = {
      {"kept",
       {system, service},
       {{"1", "system", PERFEVENT_RESOURCE_MEMORY}, {"2", "N-smb", PERFEVENT_RESOURCE_MEMORY}}},
      {"one changed", {system, changed}, {{"1", "system", PERFEVENT_RESOURCE_MEMORY}}},
      {"all removed", {}, {}},
  };
  for (const auto& c : cases) {
    monitor_->SetRules(c.rules);
    EXPECT_EQ(monitor_->Firings(), c.firings) << c.name;
  }
}

}  // namespace
}  // namespace perfeventd
