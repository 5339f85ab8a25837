// A system root of its own for each test: a temporary directory named by
// KOVA_ROOT while the test runs, removed with everything in it afterwards.

#ifndef KOVA_TEST_SUPPORT_TEST_ROOT_H_
#define KOVA_TEST_SUPPORT_TEST_ROOT_H_

#include <ftw.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

namespace kova_test {

class TestRoot {
 public:
  TestRoot() {
    char pattern[] = "/tmp/kova_root.XXXXXX";
    if (mkdtemp(pattern) == nullptr) {
      ADD_FAILURE() << "no temporary root";
      return;
    }
    path_ = pattern;
    chmod(pattern, 0755);  // for tests that run part of their work as another user
    setenv("KOVA_ROOT", path_.c_str(), 1);
    for (const char* dir : {"/etc", "/tmp", "/run", "/var"}) {
      std::filesystem::create_directories(Path(dir));
    }
    chmod(Path("/tmp").c_str(), 01777);
  }
  ~TestRoot() {
    if (getpid() != owner_ || path_.empty()) return;
    unsetenv("KOVA_ROOT");
    nftw(
        path_.c_str(), [](const char* file, const struct stat*, int, FTW*) { return remove(file); },
        16, FTW_DEPTH | FTW_PHYS);
  }
  TestRoot(const TestRoot&) = delete;
  TestRoot& operator=(const TestRoot&) = delete;

  const std::string& path() const { return path_; }
  // The real path of a system path.
  std::string Path(const std::string& system_path) const { return path_ + system_path; }

  // Writes `content` to the system path `system_path`, making its directories.
  void Write(const std::string& system_path, const std::string& content, mode_t mode = 0644) const {
    const std::string real = Path(system_path);
    std::error_code ignored;
    std::filesystem::create_directories(real.substr(0, real.rfind('/')), ignored);
    std::ofstream(real, std::ios::trunc) << content;
    chmod(real.c_str(), mode);
  }

  // Copies the string tables of the source tree, `texts_dir`, to where the
  // platform looks them up.
  void InstallTexts(const std::string& texts_dir) const {
    std::filesystem::create_directories(Path("/usr/share/kova"));
    std::filesystem::copy(texts_dir, Path("/usr/share/kova/texts"),
                          std::filesystem::copy_options::recursive);
  }

  // The content of the system path `system_path`, empty when it can't be read.
  std::string Read(const std::string& system_path) const {
    std::ifstream in(Path(system_path));
    return std::string(std::istreambuf_iterator<char>(in), {});
  }

 private:
  pid_t owner_ = getpid();
  std::string path_;
};

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_TEST_ROOT_H_
