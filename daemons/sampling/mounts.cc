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

}  // namespace sampling
