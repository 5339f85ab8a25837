#include "perfeventd/monitor.h"

#include <syslog.h>

#include <numeric>
#include <unordered_map>
#include <unordered_set>

#include "kova/perfevent.h"
#include "sampling/mounts.h"

namespace perfeventd {

using sampling::Measured;
using sampling::Measurements;
using sampling::Reading;
using sampling::SampleNeeds;
namespace {

constexpr int kDefaultCycleSeconds = 5;

bool IsIo(int32_t resource) {
  return resource == PERFEVENT_RESOURCE_IO_RATE || resource == PERFEVENT_RESOURCE_IO_LATENCY;
}

}  // namespace

Monitor::Monitor(sampling::ObjectDirectory& directory, Notify notify)
    : directory_(directory), notify_(std::move(notify)), services_(directory) {}

void Monitor::SetRules(const std::vector<Rule>& rules) {
  std::unordered_map<std::string, size_t> old_index;
  for (size_t i = 0; i < states_.size(); ++i) old_index.emplace(states_[i].rule.id, i);
  std::vector<RuleState> states;
  states.reserve(rules.size());
  int cycle = 0;
  for (const Rule& rule : rules) {
    const auto found = old_index.find(rule.id);
    const auto kept = found != old_index.end() ? states_.begin() + found->second : states_.end();
    if (kept != states_.end() && kept->rule == rule) {
      states.push_back(std::move(*kept));
    } else {
      RuleState state(rule);
      state.key =
          std::to_string(rule.type) + '/' + std::to_string(rule.resource) + '/' + rule.object;
      if (kept != states_.end()) state.said = kept->said;
      states.push_back(std::move(state));
    }
    RuleState& state = states.back();
    if (state.fixed_problem.empty()) {
      cycle = std::gcd(cycle, rule.period);
    } else {
      Say(state, state.fixed_problem);
    }
  }
  states_ = std::move(states);
  // Forget the processes of services that no rule watches any more.
  std::unordered_set<std::string> watched;
  for (const RuleState& state : states_) {
    if (state.rule.type == PERFEVENT_TYPE_SERVICE) watched.insert(state.rule.object);
  }
  services_.KeepOnly(watched);
  cycle_seconds_ = cycle > 0 ? cycle : kDefaultCycleSeconds;
  for (RuleState& state : states_) {
    const int per_sample = state.rule.period / cycle_seconds_;
    if (per_sample != state.cycles_per_sample) {
      // The cycle changed under a sample being gathered: gather it anew.
      state.cycles_per_sample = per_sample > 0 ? per_sample : 1;
      state.cycles = 0;
      state.sum = Reading{};
      state.missing = false;
    }
  }
}

SampleNeeds Monitor::Needs() const {
  SampleNeeds needs;
  for (const RuleState& state : states_) {
    if (!state.fixed_problem.empty()) continue;
    const int32_t type = state.rule.type;
    const bool io = IsIo(state.rule.resource);
    needs.processes |= type == PERFEVENT_TYPE_SERVICE;
    needs.disks |= io;
    needs.mounts |= type == PERFEVENT_TYPE_ISCSI_LUN;
    needs.whole_disks |= io && type == PERFEVENT_TYPE_SYSTEM;
  }
  return needs;
}

std::vector<Event> Monitor::Cycle(const Measurements& measurements, int64_t now) {
  directory_.Refresh();
  std::vector<Event> events;
  // Rules on one object and resource share one measurement.
  std::unordered_map<std::string, Measured> measured;
  for (RuleState& state : states_) {
    if (!state.fixed_problem.empty()) continue;
    auto found = measured.find(state.key);
    if (found == measured.end()) {
      found = measured.emplace(state.key, Measure(state.rule, measurements)).first;
    }
    const Measured& result = found->second;
    if (result.reading) {
      Say(state, "");
      state.sum += *result.reading;
    } else {
      if (!result.problem.empty()) Say(state, result.problem);
      state.missing = true;
    }
    if (++state.cycles < state.cycles_per_sample) continue;
    const std::optional<double> sample =
        state.missing ? std::nullopt : std::optional<double>(state.sum.value());
    state.cycles = 0;
    state.sum = Reading{};
    state.missing = false;
    const RuleWindow::Change change = state.window.Feed(sample);
    if (change == RuleWindow::Change::kNone) continue;
    const bool raised = change == RuleWindow::Change::kRaised;
    const std::string name = directory_.DisplayName(state.rule.type, state.rule.object);
    Event event = DescribeChange(state.rule, name, raised, state.window.average(), now);
    if (raised) state.shown = ObjectLabel(state.rule, name);
    event.origin = {state.rule.id, state.shown, state.rule.resource, raised};
    events.push_back(std::move(event));
  }
  return events;
}

std::vector<Firing> Monitor::Firings() const {
  std::vector<Firing> firings;
  for (const RuleState& state : states_) {
    if (state.window.raised()) firings.push_back({state.rule.id, state.shown, state.rule.resource});
  }
  return firings;
}

Measured Monitor::Measure(const Rule& rule, const Measurements& measurements) {
  switch (rule.type) {
    case PERFEVENT_TYPE_SERVICE:
      return MeasureService(rule.object, rule.resource, measurements);
    case PERFEVENT_TYPE_ISCSI_LUN:
      return sampling::MeasureLun(directory_, measurements, rule.object, rule.resource);
    default:
      return measurements.System(rule.resource);
  }
}

Measured Monitor::MeasureService(const std::string& name, int32_t resource,
                                 const Measurements& measurements) {
  const std::optional<sampling::RecordedProcess> process = services_.Find(name, measurements);
  if (!process) return Measured{std::nullopt, "the service is not running"};
  Measured result = measurements.Processes(process->pid, process->start_time, resource);
  if (result.problem == "its process is gone") result.problem = "the service is not running";
  return result;
}

void Monitor::Say(RuleState& state, const std::string& problem) {
  if (problem == state.said) return;
  const std::string subject =
      "rule " + state.rule.id + " (" + RuleSubject(state.rule, state.rule.object) + ")";
  if (problem.empty()) {
    notify_(LOG_INFO, subject + " is measured again");
  } else {
    notify_(LOG_WARNING, subject + " is skipped: " + problem);
  }
  state.said = problem;
}

}  // namespace perfeventd
