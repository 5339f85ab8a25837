// The block device under a path: the mount that holds it, from the mount
// points of one pass, and the I/O of a LUN measured on the device that holds
// its volume.

#ifndef KOVA_DAEMONS_SAMPLING_MOUNTS_H_
#define KOVA_DAEMONS_SAMPLING_MOUNTS_H_

#include <cstdint>
#include <string>
#include <vector>

#include "sampling/measurements.h"
#include "sampling/object_directory.h"
#include "sampling/proc_reader.h"

namespace sampling {

// The deepest of `mounts` at or above the real path `path` (the last one of
// equal depth, as a later mount hides an earlier one on the same point);
// nullptr when none holds it.
const MountPoint* MountHolding(const std::vector<MountPoint>& mounts, const std::string& path);

// The I/O `resource` (rate or latency) of the LUN `uuid`, as `directory` names
// its volume: that of the device of the mount holding the volume in the pass
// of `measurements`, which must have read the mounts and disks. A problem when
// the LUN, its volume, the mount or the device can't be found.
Measured MeasureLun(ObjectDirectory& directory, const Measurements& measurements,
                    const std::string& uuid, int32_t resource);

}  // namespace sampling

#endif  // KOVA_DAEMONS_SAMPLING_MOUNTS_H_
