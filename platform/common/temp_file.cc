#include "common/temp_file.h"

#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include <cstring>

#include "kova/error.h"

namespace kova {

int MakeTempFile(const std::string& prefix, char* name, size_t size) {
  if (name == nullptr || size == 0) return -1;
  name[0] = '\0';
  std::string path = prefix + "XXXXXX";
  if (path.size() >= size) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  const int fd = mkostemp(path.data(), O_CLOEXEC);
  if (fd < 0) {
    KOVA_SET_ERROR(KOVA_ERR_IO);
    return -1;
  }
  close(fd);
  memcpy(name, path.c_str(), path.size() + 1);
  return 0;
}

}  // namespace kova
