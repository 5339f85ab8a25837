#include "src/file_cache.h"

#include <time.h>

#include <algorithm>
#include <atomic>

namespace kova {
namespace {

// Longer than the coarsest timestamp step of the file systems the platform
// runs on (one second), plus the lag of the kernel's coarse clock.
constexpr long long kSettleNanoseconds = 1'100'000'000;

std::atomic<bool> enabled{true};

long long Nanoseconds(const timespec& time) {
  return static_cast<long long>(time.tv_sec) * 1'000'000'000 + time.tv_nsec;
}

bool SameTime(const timespec& a, const timespec& b) {
  return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

}  // namespace

bool CacheStamp::operator==(const CacheStamp& other) const {
  return device == other.device && inode == other.inode && size == other.size &&
         mode == other.mode && SameTime(modified, other.modified) &&
         SameTime(changed, other.changed);
}

bool StampFile(const std::string& path, CacheStamp& stamp) {
  struct stat info {};
  if (stat(path.c_str(), &info) != 0 || !S_ISREG(info.st_mode)) return false;
  stamp.device = info.st_dev;
  stamp.inode = info.st_ino;
  stamp.size = info.st_size;
  stamp.mode = info.st_mode;
  stamp.modified = info.st_mtim;
  stamp.changed = info.st_ctim;
  return true;
}

bool IsSettled(const CacheStamp& stamp) {
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  const long long latest = std::max(Nanoseconds(stamp.modified), Nanoseconds(stamp.changed));
  return Nanoseconds(now) - latest >= kSettleNanoseconds;
}

bool FileCacheEnabled() { return enabled.load(std::memory_order_relaxed); }

void SetFileCacheEnabled(bool on) { enabled.store(on, std::memory_order_relaxed); }

}  // namespace kova
