// The mount that holds a path: which block device a file or a volume lies on,
// from the mount points of one pass.

#ifndef KOVA_DAEMONS_SAMPLING_MOUNTS_H_
#define KOVA_DAEMONS_SAMPLING_MOUNTS_H_

#include <string>
#include <vector>

#include "sampling/proc_reader.h"

namespace sampling {

// The deepest of `mounts` at or above the real path `path` (the last one of
// equal depth, as a later mount hides an earlier one on the same point);
// nullptr when none holds it.
const MountPoint* MountHolding(const std::vector<MountPoint>& mounts, const std::string& path);

}  // namespace sampling

#endif  // KOVA_DAEMONS_SAMPLING_MOUNTS_H_
