// What the daemons learn about the objects they measure outside /proc: the
// recorded process of a started service, the volume of a LUN, display names.

#ifndef KOVA_DAEMONS_SAMPLING_OBJECT_DIRECTORY_H_
#define KOVA_DAEMONS_SAMPLING_OBJECT_DIRECTORY_H_

#include <sys/types.h>

#include <cstdint>
#include <ctime>
#include <optional>
#include <string>
#include <vector>

#include "src/lun_registry.h"

namespace sampling {

// A process as a service's record names it: its id and start time in clock
// ticks since boot, which tell it from a later process with the same id.
struct RecordedProcess {
  pid_t pid = 0;
  uint64_t start_time = 0;
};

class ObjectDirectory {
 public:
  virtual ~ObjectDirectory() = default;

  // Called once at the start of every cycle, before the lookups of the cycle.
  virtual void Refresh() {}
  // The recorded process of the started service `name`; nullopt when none is.
  virtual std::optional<RecordedProcess> ServiceProcess(const std::string& name) = 0;
  // The system path of the volume that holds the LUN `uuid`, empty when the
  // LUN names none; nullopt when no LUN has that uuid.
  virtual std::optional<std::string> LunVolume(const std::string& uuid) = 0;
  // The real path of the system path `path`, as mount points show it.
  virtual std::string RealPath(const std::string& path) = 0;
  // The name of a rule's object as events show it.
  virtual std::string DisplayName(int32_t type, const std::string& object) = 0;
};

// The directory of the system under the system root (KOVA_ROOT): service
// records under /run/kova, service descriptions, the LUN registry.
class SystemDirectory : public ObjectDirectory {
 public:
  void Refresh() override;
  std::optional<RecordedProcess> ServiceProcess(const std::string& name) override;
  std::optional<std::string> LunVolume(const std::string& uuid) override;
  std::string RealPath(const std::string& path) override;
  std::string DisplayName(int32_t type, const std::string& object) override;

  // The LUNs of the registry as the last Refresh read it.
  const std::vector<kova::Lun>& luns() const { return luns_; }

 private:
  // The LUN registry as last read, and the change time of its file then.
  std::vector<kova::Lun> luns_;
  bool luns_read_ = false;
  timespec luns_changed_{};
  ino_t luns_inode_ = 0;
};

}  // namespace sampling

#endif  // KOVA_DAEMONS_SAMPLING_OBJECT_DIRECTORY_H_
