// The processes of started services, as their records in /run/kova name them.
// A record is read again only when the process last read from it is gone, so
// that a pass over many services reads few files.

#ifndef KOVA_DAEMONS_SAMPLING_SERVICE_PROCESSES_H_
#define KOVA_DAEMONS_SAMPLING_SERVICE_PROCESSES_H_

#include <map>
#include <optional>
#include <string>
#include <unordered_set>

#include "sampling/measurements.h"
#include "sampling/object_directory.h"

namespace sampling {

class ServiceProcesses {
 public:
  explicit ServiceProcesses(ObjectDirectory& directory) : directory_(directory) {}

  // The recorded process of the service `name`: the one known, while the pass
  // of `measurements` still holds it, or else the one its record names now
  // (which the pass may not hold: it ended or the processes weren't read).
  // nullopt when the service has no record: it is not running.
  std::optional<RecordedProcess> Find(const std::string& name, const Measurements& measurements);

  // Forgets the services not in `names`.
  void KeepOnly(const std::unordered_set<std::string>& names);

 private:
  ObjectDirectory& directory_;
  std::map<std::string, RecordedProcess> known_;  // the last known process of each service
};

}  // namespace sampling

#endif  // KOVA_DAEMONS_SAMPLING_SERVICE_PROCESSES_H_
