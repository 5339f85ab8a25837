// For tests and benchmarks: a temporary system root that KOVA_ROOT names while
// it lives, removed with everything in it afterwards.

#ifndef KOVA_TEST_SUPPORT_TEMP_ROOT_H_
#define KOVA_TEST_SUPPORT_TEMP_ROOT_H_

#include <ftw.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>

namespace kova_test {

// Removes the tree at `path`, links themselves and not what they lead to.
inline void RemoveTree(const std::string& path) {
  nftw(
      path.c_str(), [](const char* file, const struct stat*, int, FTW*) { return remove(file); },
      16, FTW_DEPTH | FTW_PHYS);
}

class TempRoot {
 public:
  // A new directory named `prefix` and six random letters, mode 0755 so that
  // work run as another user reaches it; path() is empty when none could be made.
  explicit TempRoot(const char* prefix = "/tmp/kova_root") {
    std::string pattern = std::string(prefix) + ".XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) return;
    path_ = pattern;
    chmod(path_.c_str(), 0755);
    setenv("KOVA_ROOT", path_.c_str(), 1);
  }
  // Only the process that made the root removes it, not its forked children.
  ~TempRoot() {
    if (getpid() != owner_ || path_.empty()) return;
    unsetenv("KOVA_ROOT");
    RemoveTree(path_);
  }
  TempRoot(const TempRoot&) = delete;
  TempRoot& operator=(const TempRoot&) = delete;

  const std::string& path() const { return path_; }
  // The real path of a system path.
  std::string Path(const std::string& system_path) const { return path_ + system_path; }

 private:
  pid_t owner_ = getpid();
  std::string path_;
};

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_TEMP_ROOT_H_
