#include "sampling/service_processes.h"

namespace sampling {

std::optional<RecordedProcess> ServiceProcesses::Find(const std::string& name,
                                                      const Measurements& measurements) {
  auto known = known_.find(name);
  if (known != known_.end() &&
      measurements.HasProcess(known->second.pid, known->second.start_time)) {
    return known->second;
  }
  const std::optional<RecordedProcess> recorded = directory_.ServiceProcess(name);
  if (!recorded) {
    if (known != known_.end()) known_.erase(known);
    return std::nullopt;
  }
  known_.insert_or_assign(name, *recorded);
  return recorded;
}

void ServiceProcesses::KeepOnly(const std::unordered_set<std::string>& names) {
  std::erase_if(known_, [&](const auto& entry) { return !names.count(entry.first); });
}

}  // namespace sampling
