// A system root of its own for each test: a temporary directory named by
// KOVA_ROOT while the test runs, removed with everything in it afterwards.

#ifndef KOVA_TEST_SUPPORT_TEST_ROOT_H_
#define KOVA_TEST_SUPPORT_TEST_ROOT_H_

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "test_support/temp_root.h"

namespace kova_test {

class TestRoot : public TempRoot {
 public:
  TestRoot() {
    if (path().empty()) {
      ADD_FAILURE() << "no temporary root";
      return;
    }
    for (const char* dir : {"/etc", "/tmp", "/run", "/var"}) {
      std::filesystem::create_directories(Path(dir));
    }
    chmod(Path("/tmp").c_str(), 01777);
  }

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
};

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_TEST_ROOT_H_
