// The kovaperfeventd program's command line. The program at work is tested
// end to end in perfeventd_e2e_test.cc.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdio>

#include "test_support/test_root.h"

namespace perfeventd {
namespace {

using ::testing::HasSubstr;

TEST(DaemonTest, RefusesABadCommandLine) {
  kova_test::TestRoot root;
  const struct {
    std::string args;
    int status;
    const char* message;
  } cases[] = {
      {"--help", 0, "usage: kovaperfeventd"},
      {"--bogus", 2, "kovaperfeventd: unknown option --bogus\nusage:"},
      {"--proc", 2, "--proc needs a value"},
      {"--proc " + root.Path("/none"), 2, "/none: not a directory"},
      {"--sys=" + root.Path("/tmp/file"), 2, "/tmp/file: not a directory"},
      {"--time-scale 0", 2, "--time-scale 0: not a number above 0"},
      {"--time-scale=fast", 2, "--time-scale fast: not a number"},
  };
  root.Write("/tmp/file", "");
  for (const auto& c : cases) {
    FILE* out = popen((KOVAPERFEVENTD_PATH " " + c.args + " 2>&1").c_str(), "r");
    ASSERT_NE(out, nullptr);
    std::string text;
    char buffer[256];
    while (fgets(buffer, sizeof(buffer), out) != nullptr) text += buffer;
    const int status = pclose(out);
    EXPECT_EQ(WIFEXITED(status) ? WEXITSTATUS(status) : -1, c.status) << c.args;
    EXPECT_THAT(text, HasSubstr(c.message)) << c.args;
  }
}

}  // namespace
}  // namespace perfeventd
