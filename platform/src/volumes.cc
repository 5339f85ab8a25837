// Volumes, and shared folders: /var/services/<link> is a symbolic link into a volume.

#include "src/volumes.h"

#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
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

// The N of a directory entry named "volume<N>", 0 when it names no volume.
// Leading zeros are refused, so that one number names one volume.
unsigned long VolumeNumber(const char* name) {
  constexpr char kPrefix[] = "volume";
  if (strncmp(name, kPrefix, sizeof(kPrefix) - 1) != 0) return 0;
  const char* digits = name + sizeof(kPrefix) - 1;
  const size_t length = strlen(digits);
  if (length == 0 || length > 9 || digits[0] == '0' || strspn(digits, "0123456789") != length) {
    return 0;
  }
  return strtoul(digits, nullptr, 10);
}

}  // namespace

namespace kova {

std::vector<std::string> ListVolumes() {
  std::vector<std::pair<unsigned long, std::string>> found;
  DIR* dir = opendir(SystemRoot().c_str());
  if (dir == nullptr) return {};
  while (const dirent* entry = readdir(dir)) {
    const unsigned long number = VolumeNumber(entry->d_name);
    if (number == 0) continue;
    // The entry's type comes from the root's directory, while stat would ask
    // the volume's own file system, which may hang; only a root file system
    // that gives no types is asked.
    struct stat info;
    const bool directory = entry->d_type == DT_DIR ||
                           (entry->d_type == DT_UNKNOWN &&
                            fstatat(dirfd(dir), entry->d_name, &info, AT_SYMLINK_NOFOLLOW) == 0 &&
                            S_ISDIR(info.st_mode));
    if (directory) found.emplace_back(number, std::string("/") + entry->d_name);
  }
  closedir(dir);
  std::sort(found.begin(), found.end());
  std::vector<std::string> volumes;
  for (auto& [number, path] : found) volumes.push_back(std::move(path));
  return volumes;
}

}  // namespace kova

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
