// Temporary file names under the system root.

#include "common/temp_file.h"
#include "kova/conf.h"
#include "kova/error.h"
#include "src/system_root.h"

int QLIBCFileITmpName(const char* prefix, char* name, size_t size) {
  if (prefix == nullptr || name == nullptr || size == 0) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    if (name != nullptr && size > 0) name[0] = '\0';
    return -1;
  }
  return kova::MakeTempFile(kova::RootPath(prefix), name, size);
}
