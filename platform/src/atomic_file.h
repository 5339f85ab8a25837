// Whole-file replacement that readers never see half done, and the advisory
// lock that orders writers of one file across processes.

#ifndef KOVA_PLATFORM_SRC_ATOMIC_FILE_H_
#define KOVA_PLATFORM_SRC_ATOMIC_FILE_H_

#include <sys/types.h>

#include <string>

#include "kova/error.h"
#include "src/system_root.h"

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

// Read-modify-write of the file at `path` under its lock, its folder made when
// missing: `read` fills a Data, `change` edits it and, when `change` returns 0,
// `write` stores it. Returns what `change` returned, or -1 with the platform
// error set (KOVA_ERR_IO for the folder or the lock; `read` and `write` set
// their own). The caller holds whatever privileges the file needs.
template <typename Data, typename Read, typename Change, typename Write>
int UpdateFile(const std::string& path, Read read, Change change, Write write) {
  if (!MakeDirectories(path.substr(0, path.rfind('/')), 0755)) {
    KOVA_SET_ERROR(KOVA_ERR_IO);
    return -1;
  }
  FileLock lock(path);
  if (!lock.locked()) {
    KOVA_SET_ERROR(KOVA_ERR_IO);
    return -1;
  }
  Data data;
  if (!read(data)) return -1;
  const int result = change(data);
  if (result != 0) return result;
  return write(static_cast<const Data&>(data)) ? 0 : -1;
}

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_ATOMIC_FILE_H_
