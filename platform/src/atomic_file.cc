#include "src/atomic_file.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

namespace kova {

FileLock::FileLock(const std::string& path) {
  const std::string lock_path = path + ".lock";
  fd_ = open(lock_path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
  if (fd_ < 0) return;
  int result;
  do {
    result = flock(fd_, LOCK_EX);
  } while (result != 0 && errno == EINTR);
  if (result != 0) {
    const int saved = errno;
    close(fd_);
    fd_ = -1;
    errno = saved;
  }
}

FileLock::~FileLock() {
  if (fd_ >= 0) close(fd_);  // closing releases the lock
}

bool ReadWholeFile(const std::string& path, std::string& content) {
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  content.clear();
  char buffer[65536];
  for (;;) {
    const ssize_t got = read(fd, buffer, sizeof(buffer));
    if (got == 0) break;
    if (got < 0) {
      if (errno == EINTR) continue;
      const int saved = errno;
      close(fd);
      errno = saved;
      return false;
    }
    content.append(buffer, static_cast<size_t>(got));
  }
  close(fd);
  return true;
}

namespace {

bool WriteAll(int fd, const std::string& content) {
  size_t done = 0;
  while (done < content.size()) {
    const ssize_t wrote = write(fd, content.data() + done, content.size() - done);
    if (wrote < 0 && errno == EINTR) continue;
    if (wrote <= 0) return false;
    done += static_cast<size_t>(wrote);
  }
  return true;
}

// Flushes the directory holding `path`, so that a rename in it is on disk.
void SyncDirectory(const std::string& path) {
  const size_t slash = path.rfind('/');
  const std::string dir = slash == std::string::npos ? "."
                          : slash == 0               ? "/"
                                                     : path.substr(0, slash);
  const int fd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return;
  fsync(fd);
  close(fd);
}

}  // namespace

void RemoveStaleTemporaries(const std::string& path) {
  const size_t slash = path.rfind('/');
  const std::string dir = slash == std::string::npos ? "."
                          : slash == 0               ? "/"
                                                     : path.substr(0, slash);
  const std::string prefix = path.substr(slash + 1) + ".";
  DIR* stream = opendir(dir.c_str());
  if (stream == nullptr) return;
  while (const dirent* entry = readdir(stream)) {
    const std::string name = entry->d_name;
    // mkostemp's names: the prefix and six characters (the lock file has four).
    if (name.size() == prefix.size() + 6 && name.compare(0, prefix.size(), prefix) == 0) {
      unlinkat(dirfd(stream), name.c_str(), 0);
    }
  }
  closedir(stream);
}

bool ReplaceFile(const std::string& path, const std::string& content, mode_t mode) {
  std::string temp = path + ".XXXXXX";
  const int fd = mkostemp(temp.data(), O_CLOEXEC);
  if (fd < 0) return false;
  struct stat old;
  bool ok = true;
  if (stat(path.c_str(), &old) == 0) {
    // fchown may be refused to an unprivileged writer; the mode is what matters.
    if (fchown(fd, old.st_uid, old.st_gid) != 0 && geteuid() == 0) ok = false;
    mode = old.st_mode & 07777;
  }
  ok = ok && fchmod(fd, mode) == 0 && WriteAll(fd, content) && fsync(fd) == 0;
  const int saved = errno;
  if (close(fd) != 0) ok = false;
  if (ok && rename(temp.c_str(), path.c_str()) == 0) {
    SyncDirectory(path);
    return true;
  }
  const int reason = ok ? errno : saved;
  unlink(temp.c_str());
  errno = reason;
  return false;
}

}  // namespace kova
