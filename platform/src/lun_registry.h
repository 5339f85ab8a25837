// The registry of iSCSI LUNs, /etc/kova/iscsi/luns.json:
//   {"luns": [{"uuid": "...", "name": "...", "size_mb": 1024, "location": "/volume1"}, ...]}

#ifndef KOVA_PLATFORM_SRC_LUN_REGISTRY_H_
#define KOVA_PLATFORM_SRC_LUN_REGISTRY_H_

#include <json/value.h>

#include <cstdint>
#include <string>
#include <vector>

namespace kova {

struct Lun {
  std::string uuid;      // 1 to 64 of A-Z a-z 0-9 -
  std::string name;      // 1 to 127 characters, no control characters
  int64_t size_mb = 0;   // not negative
  std::string location;  // the volume that holds it, may be empty
};

// Reads every LUN, in the order they were added. A missing registry has none.
// Returns 0, or -1 with the last platform error set when the file can't be
// read or is not in the expected form.
int ReadLuns(std::vector<Lun>& luns);

// Looks up the LUN `uuid`. Returns 1 with `lun` filled, 0 when there is no
// such LUN, or -1 with the last platform error set as ReadLuns does.
int FindLun(const std::string& uuid, Lun& lun);

// Adds `lun`. Returns 0, or -1 with the last platform error set: an invalid
// field (KOVA_ERR_INVALID), a uuid that is registered already
// (KOVA_ERR_INVALID), or a registry that can't be written.
int AddLun(const Lun& lun);

// Removes the LUN `uuid`. Returns 0, or -1 with KOVA_ERR_NOT_FOUND or the
// error of a registry that can't be written.
int RemoveLun(const std::string& uuid);

// The LUN as the web API answers it.
Json::Value LunToJson(const Lun& lun);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_LUN_REGISTRY_H_
