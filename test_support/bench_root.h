// For benchmarks: a temporary system root that KOVA_ROOT names while it lives,
// removed with everything in it afterwards. (Tests use TestRoot.)

#ifndef KOVA_TEST_SUPPORT_BENCH_ROOT_H_
#define KOVA_TEST_SUPPORT_BENCH_ROOT_H_

#include <ftw.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>

namespace kova_test {

class BenchRoot {
 public:
  BenchRoot() {
    char pattern[] = "/tmp/kova_bench.XXXXXX";
    if (mkdtemp(pattern) != nullptr) path_ = pattern;
    chmod(path_.c_str(), 0755);
    setenv("KOVA_ROOT", path_.c_str(), 1);
  }
  ~BenchRoot() {
    unsetenv("KOVA_ROOT");
    if (path_.empty()) return;
    nftw(
        path_.c_str(), [](const char* file, const struct stat*, int, FTW*) { return remove(file); },
        16, FTW_DEPTH | FTW_PHYS);
  }
  BenchRoot(const BenchRoot&) = delete;
  BenchRoot& operator=(const BenchRoot&) = delete;

  // Empty when no directory could be made.
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_BENCH_ROOT_H_
