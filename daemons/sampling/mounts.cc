#include "sampling/mounts.h"

namespace sampling {
namespace {

// Whether `path` is `mount` or lies below it.
bool IsUnder(const std::string& path, const std::string& mount) {
  if (mount == "/") return !path.empty() && path[0] == '/';
  return path.compare(0, mount.size(), mount) == 0 &&
         (path.size() == mount.size() || path[mount.size()] == '/');
}

}  // namespace

const MountPoint* MountHolding(const std::vector<MountPoint>& mounts, const std::string& path) {
  const MountPoint* holder = nullptr;
  for (const MountPoint& mount : mounts) {
    if (IsUnder(path, mount.path) &&
        (holder == nullptr || mount.path.size() >= holder->path.size())) {
      holder = &mount;
    }
  }
  return holder;
}

Measured MeasureLun(ObjectDirectory& directory, const Measurements& measurements,
                    const std::string& uuid, int32_t resource) {
  const std::optional<std::string> volume = directory.LunVolume(uuid);
  if (!volume) return Measured{std::nullopt, "no LUN has this uuid"};
  if (volume->empty()) return Measured{std::nullopt, "the LUN names no volume"};
  const Snapshot& snapshot = measurements.current();
  if (!snapshot.mounts_read) return Measured{std::nullopt, "the mounts can't be read"};
  const MountPoint* holder = MountHolding(snapshot.mounts, directory.RealPath(*volume));
  if (holder == nullptr) return Measured{std::nullopt, "no mount holds its volume " + *volume};
  return measurements.Device(holder->major, holder->minor, resource);
}

}  // namespace sampling
