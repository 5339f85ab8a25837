// The kovaperfeventd program's command line. The program at work is tested
// end to end in perfeventd_e2e_test.cc.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include "src/test_root.h"

namespace perfeventd {
namespace {

using ::testing::HasSubstr;

// Runs the program with `args`, its standard error into `err_path`.
pid_t Start(const std::vector<std::string>& args, const std::string& err_path) {
  const pid_t pid = fork();
  if (pid == 0) {
    const int err = open(err_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    dup2(err, STDERR_FILENO);
    dup2(err, STDOUT_FILENO);
    std::vector<char*> argv = {const_cast<char*>(KOVAPERFEVENTD_PATH)};
    for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
    argv.push_back(nullptr);
    execv(argv[0], argv.data());
    _exit(127);
  }
  return pid;
}

// The exit status of `pid`, or -1 when it hasn't ended within two seconds.
int WaitExit(pid_t pid) {
  int status = 0;
  for (int i = 0; i < 200; ++i) {
    if (waitpid(pid, &status, WNOHANG) == pid) return WIFEXITED(status) ? WEXITSTATUS(status) : -2;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return -1;
}

TEST(DaemonTest, RefusesABadCommandLine) {
  kova::TestRoot root;
  const std::string err = root.Path("/tmp/err");
  const struct {
    std::vector<std::string> args;
    int status;
    const char* message;
  } cases[] = {
      {{"--help"}, 0, "usage: kovaperfeventd"},
      {{"--bogus"}, 2, "kovaperfeventd: unknown option --bogus\nusage:"},
      {{"--proc"}, 2, "--proc needs a value"},
      {{"--proc", root.Path("/none")}, 2, "/none: not a directory"},
      {{"--sys=" + err}, 2, "/tmp/err: not a directory"},
      {{"--time-scale", "0"}, 2, "--time-scale 0: not a number above 0"},
      {{"--time-scale=fast"}, 2, "--time-scale fast: not a number"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(WaitExit(Start(c.args, err)), c.status) << c.args[0];
    EXPECT_THAT(root.Read("/tmp/err"), HasSubstr(c.message)) << c.args[0];
  }
}

}  // namespace
}  // namespace perfeventd
