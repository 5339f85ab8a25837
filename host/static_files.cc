#include "host/static_files.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>

#include "host/params.h"

namespace kova_host {
namespace {

constexpr off_t kMaxFile = off_t{64} << 20;

// Media types of the static folder's files, with the charset where it is text.
struct StaticType {
  const char* extension;
  const char* mime;
};
constexpr StaticType kStaticTypes[] = {
    {"html", "text/html; charset=utf-8"},
    {"js", "text/javascript; charset=utf-8"},
    {"css", "text/css; charset=utf-8"},
    {"json", "application/json; charset=utf-8"},
    {"svg", "image/svg+xml"},
    {"png", "image/png"},
    {"ico", "image/x-icon"},
    {"woff2", "font/woff2"},
    {"txt", "text/plain; charset=utf-8"},
    {nullptr, nullptr},
};

const char* MediaType(std::string_view path) {
  const size_t dot = path.rfind('.');
  if (dot != std::string_view::npos && path.find('/', dot) == std::string_view::npos) {
    const std::string_view extension = path.substr(dot + 1);
    for (const StaticType* type = kStaticTypes; type->extension != nullptr; ++type) {
      if (extension == type->extension) return type->mime;
    }
  }
  return "application/octet-stream";
}

// The path decoded and relative to the folder, or false when it is malformed,
// holds a NUL or steps up with "..".
bool RelativePath(std::string_view raw, std::string& relative) {
  if (raw.empty() || raw[0] != '/') return false;
  std::string path;
  if (!PercentDecode(raw, false, path) || path.find('\0') != std::string::npos) return false;
  for (size_t start = 0; start <= path.size();) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    if (path.compare(start, end - start, "..") == 0) return false;
    start = end + 1;
  }
  if (path.back() == '/') path += "index.html";
  relative = path.substr(path.find_first_not_of('/'));
  return true;
}

}  // namespace

StaticFiles::~StaticFiles() {
  if (folder_ >= 0) close(folder_);
}

bool StaticFiles::Open(const std::string& folder) {
  char real[PATH_MAX];
  if (realpath(folder.c_str(), real) == nullptr) return false;
  const int fd = open(real, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return false;
  if (folder_ >= 0) close(folder_);
  folder_ = fd;
  real_folder_ = real;
  return true;
}

int StaticFiles::OpenBeneath(const std::string& relative) const {
  constexpr int kFlags = O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK;
  open_how how{};
  how.flags = kFlags;
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS;
  const long fd = syscall(SYS_openat2, folder_, relative.c_str(), &how, sizeof(how));
  if (fd >= 0 || (errno != ENOSYS && errno != EPERM)) return static_cast<int>(fd);
  // No openat2 here: resolve every link, then check that the file is still inside.
  char real[PATH_MAX];
  const std::string path = real_folder_ + "/" + relative;
  if (realpath(path.c_str(), real) == nullptr) return -1;
  const std::string resolved = real;
  if (resolved.compare(0, real_folder_.size() + 1, real_folder_ + "/") != 0) return -1;
  return open(real, kFlags | O_NOFOLLOW);
}

bool StaticFiles::Find(std::string_view raw_path, StaticFile& file) const {
  std::string relative;
  if (folder_ < 0 || !RelativePath(raw_path, relative)) return false;
  const int fd = OpenBeneath(relative);
  if (fd < 0) return false;
  struct stat about {};
  bool found = fstat(fd, &about) == 0 && S_ISREG(about.st_mode) && about.st_size <= kMaxFile;
  if (found) {
    file.content.resize(static_cast<size_t>(about.st_size));
    size_t done = 0;
    while (done < file.content.size()) {
      const ssize_t got = read(fd, file.content.data() + done, file.content.size() - done);
      if (got < 0 && errno == EINTR) continue;
      if (got <= 0) break;
      done += static_cast<size_t>(got);
    }
    file.content.resize(done);
    found = done == static_cast<size_t>(about.st_size);
    file.content_type = MediaType(relative);
  }
  close(fd);
  return found;
}

}  // namespace kova_host
