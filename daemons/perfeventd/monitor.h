// The rules at work: each cycle every enabled rule is measured, its samples
// are fed to its window, and the windows' changes become events. A rule that
// can't be measured is said once in the system log, and again only after it
// could be measured in between.

#ifndef KOVA_DAEMONS_PERFEVENTD_MONITOR_H_
#define KOVA_DAEMONS_PERFEVENTD_MONITOR_H_

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "perfeventd/event_text.h"
#include "perfeventd/rule.h"
#include "perfeventd/rule_window.h"
#include "sampling/measurements.h"
#include "sampling/object_directory.h"
#include "sampling/service_processes.h"

namespace perfeventd {

// Receives a line for the system log at a syslog priority.
using Notify = std::function<void(int priority, const std::string& text)>;

// A rule whose condition holds now: raised and not recovered since.
struct Firing {
  std::string rule_id;
  std::string object;  // ObjectLabel of the rule when it was raised
  int32_t resource = 0;

  bool operator==(const Firing&) const = default;
};

class Monitor {
 public:
  Monitor(sampling::ObjectDirectory& directory, Notify notify);

  // Replaces the rules. A rule whose id and fields are unchanged keeps its
  // window; a new, changed or switched-on rule starts a fresh one.
  void SetRules(const std::vector<Rule>& rules);

  // Seconds between two cycles: the greatest common divisor of the rules'
  // periods, so that every rule is sampled on time; 5 without rules.
  int CycleSeconds() const { return cycle_seconds_; }
  // What the pass over /proc of each cycle must read for these rules.
  sampling::SampleNeeds Needs() const;
  size_t rule_count() const { return states_.size(); }
  // The rules raised and not recovered, in the store's order. A rule changed,
  // removed or turned off is not among them any more.
  std::vector<Firing> Firings() const;

  // Runs one cycle over `measurements`, which were advanced to this cycle's
  // pass, and returns the events decided, stamped `now`.
  std::vector<Event> Cycle(const sampling::Measurements& measurements, int64_t now);

 private:
  struct RuleState {
    explicit RuleState(const Rule& r)
        : rule(r), window(r.threshold, SamplesPerWindow(r)), fixed_problem(RuleProblem(r)) {}

    Rule rule;
    RuleWindow window;
    std::string key;            // the object and resource: rules that share it share a measurement
    std::string fixed_problem;  // why the rule can never be measured, empty when it can
    int cycles_per_sample = 1;
    int cycles = 0;         // cycles of the sample being gathered
    sampling::Reading sum;  // their readings
    bool missing = false;   // whether one of them had none
    std::string said;       // the problem last said of the rule, empty when none
    std::string shown;      // ObjectLabel when the rule was last raised
  };

  sampling::Measured Measure(const Rule& rule, const sampling::Measurements& measurements);
  sampling::Measured MeasureService(const std::string& name, int32_t resource,
                                    const sampling::Measurements& measurements);
  // Says `problem` of the rule unless it was said last; an empty problem says
  // that a rule with a problem said is measured again.
  void Say(RuleState& state, const std::string& problem);

  sampling::ObjectDirectory& directory_;
  Notify notify_;
  std::vector<RuleState> states_;  // in the store's order
  int cycle_seconds_ = 5;
  sampling::ServiceProcesses services_;
};

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_MONITOR_H_
