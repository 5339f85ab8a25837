#include "src/log_folder.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/file.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <memory>

#include "src/system_root.h"

namespace kova {
namespace {

constexpr char kLockName[] = "lock";
constexpr char kSegmentSuffix[] = ".log";
constexpr size_t kIdDigits = 20;
constexpr size_t kCopyBufferSize = 1 << 20;
constexpr int64_t kMinSegmentLines = 1;
constexpr int64_t kMaxSegmentLines = 1 << 17;

// Closes a descriptor when it goes out of scope, keeping errno.
class Fd {
 public:
  explicit Fd(int fd) : fd_(fd) {}
  ~Fd() {
    if (fd_ >= 0) {
      const int saved = errno;
      close(fd_);
      errno = saved;
    }
  }
  Fd(const Fd&) = delete;
  Fd& operator=(const Fd&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};

std::string SegmentName(int64_t first_id) {
  char name[kIdDigits + sizeof(kSegmentSuffix)];
  snprintf(name, sizeof(name), "%020lld%s", static_cast<long long>(first_id), kSegmentSuffix);
  return name;
}

// The first id a segment's name carries; false for any other name.
bool ParseSegmentName(const char* name, int64_t& first_id) {
  if (strlen(name) != kIdDigits + strlen(kSegmentSuffix) ||
      strcmp(name + kIdDigits, kSegmentSuffix) != 0) {
    return false;
  }
  int64_t id = 0;
  for (size_t i = 0; i < kIdDigits; ++i) {
    if (name[i] < '0' || name[i] > '9' || id > (INT64_MAX - 9) / 10) return false;
    id = id * 10 + (name[i] - '0');
  }
  first_id = id;
  return id > 0;
}

bool ReadAllAt(int fd, char* data, size_t size, off_t offset) {
  while (size > 0) {
    const ssize_t got = pread(fd, data, size, offset);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) {
      if (got == 0) errno = EIO;
      return false;
    }
    data += got;
    size -= static_cast<size_t>(got);
    offset += got;
  }
  return true;
}

bool WriteAll(int fd, const char* data, size_t size) {
  while (size > 0) {
    const ssize_t wrote = write(fd, data, size);
    if (wrote < 0 && errno == EINTR) continue;
    if (wrote <= 0) {
      if (wrote == 0) errno = EIO;
      return false;
    }
    data += wrote;
    size -= static_cast<size_t>(wrote);
  }
  return true;
}

// In the first `size` bytes of `fd`: `end`, the offset just past the last line
// feed (0 when there is none), and `start`, where the line that ends there
// begins.
bool FindLastLine(int fd, off_t size, off_t& start, off_t& end) {
  char buffer[1 << 16];
  start = 0;
  end = -1;
  for (off_t to = size; to > 0;) {
    const off_t from = std::max<off_t>(0, to - static_cast<off_t>(sizeof(buffer)));
    if (!ReadAllAt(fd, buffer, static_cast<size_t>(to - from), from)) return false;
    for (off_t i = to - from; i-- > 0;) {
      if (buffer[i] != '\n') continue;
      if (end >= 0) {
        start = from + i + 1;
        return true;
      }
      end = from + i + 1;
    }
    to = from;
  }
  if (end < 0) end = 0;
  return true;
}

// The offset just past the last whole line of a segment of `size` bytes.
bool WholeLinesEnd(int fd, off_t size, off_t& end) {
  char last = '\n';
  if (size == 0 || !ReadAllAt(fd, &last, 1, size - 1)) return size == 0;
  if (last == '\n') {
    end = size;
    return true;
  }
  off_t start;
  return FindLastLine(fd, size, start, end);
}

// The id at the start of the line at `start`, or -1 when it holds none.
int64_t IdAt(int fd, off_t start, off_t end) {
  char text[kIdDigits + 1];
  const size_t size = static_cast<size_t>(std::min<off_t>(end - start, sizeof(text)));
  if (!ReadAllAt(fd, text, size, start)) return -1;
  int64_t id = 0;
  size_t i = 0;
  for (; i < size && text[i] >= '0' && text[i] <= '9' && i < 18; ++i) id = id * 10 + text[i] - '0';
  return i > 0 && i < size && text[i] == '\t' ? id : -1;
}

int64_t CountLines(int fd, off_t end) {
  const std::unique_ptr<char[]> buffer(new char[kCopyBufferSize]);
  int64_t lines = 0;
  for (off_t at = 0; at < end;) {
    const size_t size = static_cast<size_t>(std::min<off_t>(end - at, kCopyBufferSize));
    if (!ReadAllAt(fd, buffer.get(), size, at)) return -1;
    lines += std::count(buffer.get(), buffer.get() + size, '\n');
    at += static_cast<off_t>(size);
  }
  return lines;
}

// Copies bytes [0, size) of `in` to `out` at its offset: in the kernel where it
// can, through a buffer where it can't (a pipe, another file system).
bool CopyRange(int in, off_t size, int out) {
  off_t at = 0;
  // In the kernel: within a file system, then to any file (another file system,
  // a pipe); through a buffer where neither can.
  for (const bool same_file_system : {true, false}) {
    while (at < size) {
      const size_t left = static_cast<size_t>(size - at);
      const ssize_t copied = same_file_system ? copy_file_range(in, &at, out, nullptr, left, 0)
                                              : sendfile(out, in, &at, left);
      if (copied > 0) continue;
      if (copied < 0 && errno == EINTR) continue;
      if (copied == 0) return true;  // the segment shrank: what is there is copied
      if (errno != EXDEV && errno != EINVAL && errno != ENOSYS && errno != EOPNOTSUPP &&
          errno != EBADF) {
        return false;
      }
      break;
    }
  }
  const std::unique_ptr<char[]> buffer(new char[kCopyBufferSize]);
  while (at < size) {
    const size_t chunk = static_cast<size_t>(std::min<off_t>(size - at, kCopyBufferSize));
    if (!ReadAllAt(in, buffer.get(), chunk, at) || !WriteAll(out, buffer.get(), chunk)) {
      return false;
    }
    at += static_cast<off_t>(chunk);
  }
  return true;
}

// Removes a folder this process made and the files in it.
void RemoveFolder(const std::string& path) {
  const int fd = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd >= 0) {
    DIR* dir = fdopendir(fd);
    if (dir == nullptr) {
      close(fd);
    } else {
      while (const dirent* entry = readdir(dir)) {
        if (strcmp(entry->d_name, ".") != 0 && strcmp(entry->d_name, "..") != 0) {
          unlinkat(dirfd(dir), entry->d_name, 0);
        }
      }
      closedir(dir);
    }
  }
  rmdir(path.c_str());
}

}  // namespace

int64_t SegmentLines(int64_t max_records) {
  return std::clamp(max_records / 8, kMinSegmentLines, kMaxSegmentLines);
}

LogFolder::~LogFolder() { Close(); }

void LogFolder::Close() {
  if (lock_fd_ >= 0) close(lock_fd_);  // also lets the lock go
  if (dir_fd_ >= 0) close(dir_fd_);
  lock_fd_ = dir_fd_ = -1;
  segments_.clear();
}

bool LogFolder::Open(const std::string& path, Access access) {
  return OpenIn(AT_FDCWD, path.c_str(), access);
}

bool LogFolder::OpenIn(int parent_fd, const char* name, Access access) {
  Close();
  dir_fd_ = openat(parent_fd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (dir_fd_ < 0) return false;
  lock_fd_ = openat(dir_fd_, kLockName, O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
  int locked = -1;
  while (lock_fd_ >= 0 &&
         (locked = flock(lock_fd_, access == Access::kWrite ? LOCK_EX : LOCK_SH)) != 0 &&
         errno == EINTR) {
  }
  if (locked != 0 || !ReadSegments() || (access == Access::kWrite && !FindNextId())) {
    const int saved = errno;
    Close();
    errno = saved;
    return false;
  }
  return true;
}

bool LogFolder::ReadSegments() {
  const int fd = dup(dir_fd_);
  DIR* dir = fd >= 0 ? fdopendir(fd) : nullptr;
  if (dir == nullptr) {
    if (fd >= 0) close(fd);
    return false;
  }
  segments_.clear();
  while (const dirent* entry = readdir(dir)) {
    int64_t first_id;
    if (ParseSegmentName(entry->d_name, first_id)) segments_.push_back(first_id);
  }
  closedir(dir);
  std::sort(segments_.begin(), segments_.end());
  return true;
}

bool LogFolder::FindNextId() {
  next_id_ = 1;
  if (segments_.empty()) return true;
  const int64_t first = segments_.back();
  const Fd segment(openat(dir_fd_, SegmentName(first).c_str(), O_RDWR | O_NOFOLLOW | O_CLOEXEC));
  struct stat info;
  off_t start;
  off_t end;
  if (segment.get() < 0 || fstat(segment.get(), &info) != 0 ||
      !FindLastLine(segment.get(), info.st_size, start, end)) {
    return false;
  }
  // A torn last line was never a record: cut it off before anything follows it.
  if (end < info.st_size && ftruncate(segment.get(), end) != 0) return false;
  if (end == 0) {
    next_id_ = first;
    return true;
  }
  int64_t last = IdAt(segment.get(), start, end);
  if (last < first) {
    // An id that doesn't read: count the lines, which carry consecutive ids.
    const int64_t lines = CountLines(segment.get(), end);
    if (lines < 0) return false;
    last = first + lines - 1;
  }
  next_id_ = last + 1;
  return true;
}

bool LogFolder::BeginSegment(int64_t first_id) {
  if (first_id < next_id_) {
    errno = EINVAL;
    return false;
  }
  if (!segments_.empty() && segments_.back() == first_id) return true;  // begun, still empty
  const Fd segment(openat(dir_fd_, SegmentName(first_id).c_str(),
                          O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (segment.get() < 0) return false;
  segments_.push_back(first_id);
  next_id_ = first_id;
  return true;
}

bool LogFolder::Append(std::string_view text, int64_t count, int64_t segment_lines) {
  const int64_t last_lines = segments_.empty() ? -1 : next_id_ - segments_.back();
  if ((last_lines < 0 || last_lines >= segment_lines) && !BeginSegment(next_id_)) return false;
  const Fd segment(openat(dir_fd_, SegmentName(segments_.back()).c_str(),
                          O_WRONLY | O_APPEND | O_NOFOLLOW | O_CLOEXEC));
  struct stat info;
  if (segment.get() < 0 || fstat(segment.get(), &info) != 0) return false;
  if (!WriteAll(segment.get(), text.data(), text.size())) {
    const int saved = errno;
    if (ftruncate(segment.get(), info.st_size) != 0) {
      // The torn line is cut off by the next writer.
    }
    errno = saved;
    return false;
  }
  next_id_ += count;
  return true;
}

bool LogFolder::Trim(int64_t keep) {
  int64_t total = segments_.empty() ? 0 : next_id_ - segments_.front();
  while (segments_.size() > 1) {
    const int64_t oldest = segments_[1] - segments_[0];
    if (total - oldest < keep) break;
    if (unlinkat(dir_fd_, SegmentName(segments_[0]).c_str(), 0) != 0) return false;
    segments_.erase(segments_.begin());
    total -= oldest;
  }
  return true;
}

bool LogFolder::Clear() {
  // The empty segment comes first, so that the ids go on after a crash here.
  if (!BeginSegment(next_id_)) return false;
  while (segments_.size() > 1) {
    if (unlinkat(dir_fd_, SegmentName(segments_[0]).c_str(), 0) != 0) return false;
    segments_.erase(segments_.begin());
  }
  return true;
}

bool LogFolder::CopyTo(int fd) const {
  struct Segment {
    int fd;
    off_t end;
  };
  std::vector<Segment> segments;
  bool ok = true;
  off_t total = 0;
  for (size_t i = 0; ok && i < segments_.size(); ++i) {
    Segment segment{
        openat(dir_fd_, SegmentName(segments_[i]).c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC), 0};
    struct stat info;
    ok = segment.fd >= 0 && fstat(segment.fd, &info) == 0 &&
         WholeLinesEnd(segment.fd, info.st_size, segment.end);
    if (segment.fd >= 0) segments.push_back(segment);
    total += segment.end;
  }
  // Blocks reserved at once spare the file system a reservation per page; an
  // output that can't take it (a pipe) is written all the same.
  const off_t start = ok ? lseek(fd, 0, SEEK_CUR) : -1;
  if (start >= 0 && total > 0) fallocate(fd, FALLOC_FL_KEEP_SIZE, start, total);
  for (const Segment& segment : segments) ok = ok && CopyRange(segment.fd, segment.end, fd);
  const int saved = errno;
  for (const Segment& segment : segments) close(segment.fd);
  errno = saved;
  return ok;
}

bool LogFolder::Create(const std::string& path, int64_t first_id,
                       const std::function<bool(LogFolder&)>& fill) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos || !MakeDirectories(path.substr(0, slash), 0755)) return false;
  std::string temp = path + ".new-XXXXXX";
  if (mkdtemp(temp.data()) == nullptr) return false;
  bool ok = false;
  {
    const Fd lock(open((temp + "/" + kLockName).c_str(),
                       O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
    LogFolder folder;
    ok = lock.get() >= 0 && folder.OpenIn(AT_FDCWD, temp.c_str(), Access::kWrite) &&
         folder.BeginSegment(first_id) && (!fill || fill(folder));
    // What was copied in is on disk before the store is put in place.
    for (size_t i = 0; ok && i < folder.segments_.size(); ++i) {
      const Fd segment(openat(folder.dir_fd_, SegmentName(folder.segments_[i]).c_str(),
                              O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
      ok = segment.get() >= 0 && fsync(segment.get()) == 0;
    }
    ok = ok && fsync(folder.dir_fd_) == 0;
  }
  if (ok && rename(temp.c_str(), path.c_str()) == 0) {
    const Fd parent(open(path.substr(0, slash).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (parent.get() >= 0) fsync(parent.get());
    return true;
  }
  const int saved = errno;
  RemoveFolder(temp);
  if (ok && (saved == EEXIST || saved == ENOTEMPTY)) return true;  // made by another process
  errno = saved;
  return false;
}

}  // namespace kova
