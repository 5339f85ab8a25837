#include "host/private_tmp.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <vector>

namespace kova_host {
namespace {

// Empties the folder open at `dir` (which it closes), depth first.
bool EmptyFolder(int dir, int depth) {
  DIR* stream = fdopendir(dir);
  if (stream == nullptr) {
    close(dir);
    return false;
  }
  std::vector<std::string> names;
  while (const dirent* entry = readdir(stream)) {
    const std::string name = entry->d_name;
    if (name != "." && name != "..") names.push_back(name);
  }
  bool emptied = true;
  for (const std::string& name : names) {
    if (unlinkat(dirfd(stream), name.c_str(), 0) == 0) continue;
    if (errno != EISDIR || depth > 64) {
      emptied = false;
      continue;
    }
    const int child =
        openat(dirfd(stream), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    emptied = child >= 0 && EmptyFolder(child, depth + 1) &&
              unlinkat(dirfd(stream), name.c_str(), AT_REMOVEDIR) == 0 && emptied;
  }
  closedir(stream);
  return emptied;
}

}  // namespace

std::string MakePrivateTmp(const std::string& tmp, std::string& root, std::string& error) {
  std::string outer = tmp + "/kova-webapid-XXXXXX";
  if (mkdtemp(outer.data()) == nullptr) {
    error = "cannot make a folder in " + tmp + ": " + strerror(errno);
    return "";
  }
  const std::string inner = std::string(outer) + "/tmp";
  if (mkdir(inner.c_str(), 0700) != 0 || chmod(inner.c_str(), 01777) != 0) {
    error = "cannot make " + inner + ": " + strerror(errno);
    RemovePrivateTmp(outer);
    return "";
  }
  root = outer;
  return inner;
}

bool RemovePrivateTmp(const std::string& root) {
  const int dir = open(root.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  return dir >= 0 && EmptyFolder(dir, 0) && rmdir(root.c_str()) == 0;
}

}  // namespace kova_host
