// Volumes and shared folders. A volume is a directory /volume<N> (N a whole
// number) under the system root, usually a mount point of its own; a shared
// folder is reached through /var/services/<link>, a symbolic link into one
// (KOVAShareServiceVolumeGetbyLink in kova/service.h).

#ifndef KOVA_PLATFORM_SRC_VOLUMES_H_
#define KOVA_PLATFORM_SRC_VOLUMES_H_

#include <string>
#include <vector>

namespace kova {

// The volumes as system paths ("/volume1"), in the order of their numbers;
// empty when the root can't be listed. Only the root's own directory is read:
// a hung mount on a volume doesn't stall the listing.
std::vector<std::string> ListVolumes();

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_VOLUMES_H_
