// Parsed files kept between calls (key-value files, the LUN registry), so that
// a burst of look-ups reads and parses each file once. Every use compares the
// file's stat() with the one it was parsed from, so a file written in place or
// replaced is read again at once.

#ifndef KOVA_PLATFORM_SRC_FILE_CACHE_H_
#define KOVA_PLATFORM_SRC_FILE_CACHE_H_

#include <sys/stat.h>
#include <unistd.h>

#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>

namespace kova {

// What tells one version of a file from another.
struct CacheStamp {
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;
  mode_t mode = 0;
  timespec modified{};
  timespec changed{};

  bool operator==(const CacheStamp& other) const;
};

// The stamp of the file at the real path `path`; false when it can't be stat'ed.
bool StampFile(const std::string& path, CacheStamp& stamp);

// Whether the file's last change is old enough that a later write within the
// file system's timestamp granularity can't leave the same stamp.
bool IsSettled(const CacheStamp& stamp);

// Whether the caches keep anything; on unless switched off, to measure them.
bool FileCacheEnabled();
void SetFileCacheEnabled(bool enabled);

// Up to `capacity` parsed files of type T, by path (and the caller's effective
// ids for a file that not everyone may read).
template <typename T>
class FileCache {
 public:
  explicit FileCache(size_t capacity) : capacity_(capacity) {}

  // The content of the file at the real path `path`, parsed by
  // `parse(path, T&)` when it isn't kept or has changed since; nullptr when
  // `parse` fails (it sets errno and the platform error).
  template <typename Parse>
  std::shared_ptr<const T> Get(const std::string& path, Parse parse) {
    CacheStamp before;
    if (!FileCacheEnabled() || !StampFile(path, before)) {
      auto value = std::make_shared<T>();
      return parse(path, *value) ? value : nullptr;
    }
    // A file anyone may read is kept once for every caller; another one per
    // effective ids, so that content read with raised privileges isn't
    // answered to a caller without them.
    std::string key = path;
    if ((before.mode & S_IROTH) == 0) {
      key += '\0' + std::to_string(geteuid()) + ':' + std::to_string(getegid());
    }
    {
      std::lock_guard<std::mutex> lock(mutex_);
      const auto it = entries_.find(key);
      if (it != entries_.end() && it->second.stamp == before) return it->second.value;
    }
    auto value = std::make_shared<T>();
    if (!parse(path, *value)) return nullptr;
    // Kept only when no write came between the two looks and none can hide
    // behind the same timestamp later.
    CacheStamp after;
    const bool keep = StampFile(path, after) && after == before && IsSettled(after);
    std::lock_guard<std::mutex> lock(mutex_);
    if (!keep) {
      entries_.erase(key);
    } else {
      if (entries_.size() >= capacity_) entries_.clear();
      entries_[key] = Entry{after, value};
    }
    return value;
  }

 private:
  struct Entry {
    CacheStamp stamp;
    std::shared_ptr<const T> value;
  };

  const size_t capacity_;
  std::mutex mutex_;
  std::unordered_map<std::string, Entry> entries_;
};

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_FILE_CACHE_H_
