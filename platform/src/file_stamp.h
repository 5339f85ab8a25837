// A file's identity and last change, to tell cheaply whether it was written or
// replaced since it was last read (a daemon's settings, a store).

#ifndef KOVA_PLATFORM_SRC_FILE_STAMP_H_
#define KOVA_PLATFORM_SRC_FILE_STAMP_H_

#include <sys/stat.h>

#include <string>

namespace kova {

struct FileStamp {
  bool exists = false;
  ino_t inode = 0;
  off_t size = 0;
  timespec modified{};

  bool operator==(const FileStamp& other) const {
    return exists == other.exists && inode == other.inode && size == other.size &&
           modified.tv_sec == other.modified.tv_sec && modified.tv_nsec == other.modified.tv_nsec;
  }
};

// The stamp of the file at the real path `path`; one that doesn't exist (or
// can't be looked at) has the empty stamp.
inline FileStamp StampOf(const std::string& path) {
  struct stat info {};
  FileStamp stamp;
  if (stat(path.c_str(), &info) != 0) return stamp;
  stamp.exists = true;
  stamp.inode = info.st_ino;
  stamp.size = info.st_size;
  stamp.modified = info.st_mtim;
  return stamp;
}

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_FILE_STAMP_H_
