// Whole-file replacement that readers never see half done, and the advisory
// lock that orders writers of one file across processes.

#ifndef KOVA_PLATFORM_SRC_ATOMIC_FILE_H_
#define KOVA_PLATFORM_SRC_ATOMIC_FILE_H_

#include <sys/types.h>

#include <string>

namespace kova {

// Holds an exclusive flock(2) on "<path>.lock" (created when missing) for the
// life of the object. The lock file stays, so that every writer locks one inode.
class FileLock {
 public:
  explicit FileLock(const std::string& path);
  ~FileLock();
  FileLock(const FileLock&) = delete;
  FileLock& operator=(const FileLock&) = delete;

  // False when the lock could not be taken (errno says why).
  bool locked() const { return fd_ >= 0; }

 private:
  int fd_ = -1;
};

// Reads the whole file at `path` into `content`. False with errno set on failure.
bool ReadWholeFile(const std::string& path, std::string& content);

// Replaces the file at `path` with `content`: writes a temporary file beside it,
// flushes it to disk and renames it over `path`, so that the file is the old one
// or the new one, never a part. A new file gets `mode`; an existing one keeps its
// mode and owner. False with errno set on failure, `path` then unchanged and no
// temporary file left.
bool ReplaceFile(const std::string& path, const std::string& content, mode_t mode);

// Removes the temporary files that writers of `path` killed before their rename
// left beside it. Only for a caller that holds the file's lock.
void RemoveStaleTemporaries(const std::string& path);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_ATOMIC_FILE_H_
