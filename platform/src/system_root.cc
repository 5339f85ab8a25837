#include "src/system_root.h"

#include <errno.h>
#include <sys/stat.h>

#include <cstdlib>

namespace kova {

std::string SystemRoot() {
  const char* root = getenv("KOVA_ROOT");
  std::string path = root != nullptr ? root : "";
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path.empty() ? "/" : path;
}

std::string RootPath(std::string_view path) {
  const std::string root = SystemRoot();
  std::string out = root == "/" ? "" : root;
  if (path.empty() || path.front() != '/') out += '/';
  out += path;
  return out;
}

bool MakeDirectories(const std::string& path, mode_t mode) {
  for (size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
    const std::string part = path.substr(0, end);
    if (!part.empty() && mkdir(part.c_str(), mode) != 0 && errno != EEXIST) return false;
    if (end == std::string::npos) break;
  }
  struct stat info;
  if (stat(path.c_str(), &info) != 0) return false;
  if (!S_ISDIR(info.st_mode)) {
    errno = ENOTDIR;
    return false;
  }
  return true;
}

bool IsPlainName(std::string_view name) {
  if (name.empty() || name.size() > 64 || name.front() == '.') return false;
  for (char c : name) {
    const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                    c == '.' || c == '_' || c == '-' || c == '@';
    if (!ok) return false;
  }
  return true;
}

}  // namespace kova
