// Shared folders: /var/services/<link> is a symbolic link into a volume.

#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "kova/error.h"
#include "kova/service.h"
#include "src/system_root.h"

namespace {

// `path` with "." and ".." components and repeated slashes resolved by text;
// ".." never climbs above "/", as on a real root.
std::string Normalize(const std::string& path) {
  std::string out;
  size_t start = 0;
  while (start <= path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    const std::string part = path.substr(start, end - start);
    if (part == "..") {
      out.erase(out.empty() ? 0 : out.rfind('/'));
    } else if (!part.empty() && part != ".") {
      out += "/" + part;
    }
    start = end + 1;
  }
  return out.empty() ? "/" : out;
}

}  // namespace

int KOVAShareServiceVolumeGetbyLink(const char* link, char* volume, size_t size) {
  if (link == nullptr || volume == nullptr || size == 0 || !kova::IsPlainName(link)) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  char target[PATH_MAX];
  const ssize_t length = readlink(kova::RootPath(std::string("/var/services/") + link).c_str(),
                                  target, sizeof(target) - 1);
  if (length <= 0) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return 0;
  }
  target[length] = '\0';
  // The link names a system path; its first component is the volume.
  const std::string system_path =
      Normalize(target[0] == '/' ? target : std::string("/var/services/") + target);
  struct stat info;
  if (stat(kova::RootPath(system_path).c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return 0;
  }
  const std::string path = kova::RootPath(system_path.substr(0, system_path.find('/', 1)));
  if (path.size() >= size) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  memcpy(volume, path.c_str(), path.size() + 1);
  return 1;
}
