// The kovaperfeventd program on a temporary system root, fed recorded /proc
// files and run with a time scale of 0.01: a 5 s period takes 50 ms.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include "kova/perfevent.h"
#include "perfeventd/test_support.h"
#include "src/test_root.h"

namespace perfeventd {
namespace {

using ::testing::Contains;
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

template <typename Done>
bool Eventually(Done done) {
  for (int i = 0; i < 250 && !done(); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return done();
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
      {{"--time-scale=1e9"}, 2, "--time-scale 1e9: not a number above 0"},
      {{"--time-scale", "fast"}, 2, "--time-scale fast: not a number"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(WaitExit(Start(c.args, err)), c.status) << c.args[0];
    EXPECT_THAT(root.Read("/tmp/err"), HasSubstr(c.message)) << c.args[0];
  }
}

class RunningDaemonTest : public ::testing::Test {
 protected:
  void SetUp() override {
    WriteSystem(proc_, 100, 1000, 1000000, 200000);  // memory 80% in use
    std::filesystem::create_directories(root_.Path("/sys/block"));
  }
  void TearDown() override {
    if (pid_ > 0 && WaitExit(pid_) == -1) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
  }

  // Adds a rule on the system's memory with a 5 s period and a 30 s window.
  void AddRule(const char* object, int32_t severity, int32_t threshold) {
    KOVAPERFEVENT_CONF_SETTING rule{};
    snprintf(rule.service, sizeof(rule.service), "%s", object);
    rule.type = PERFEVENT_TYPE_SYSTEM;
    rule.resource = PERFEVENT_RESOURCE_MEMORY;
    rule.severity = severity;
    rule.threshold = threshold;
    rule.preset_a = 5;
    rule.preset_b = 30;
    rule.enable = 1;
    ASSERT_EQ(KOVAPerfEventConfAdd(&rule), 0);
  }

  bool Logged(const std::string& level, const std::string& text) {
    return Eventually([&] {
      for (const std::string& line : LogLines(root_.Path("/tmp/dump"))) {
        if (line.rfind(level + "\t", 0) == 0 && line.find(text) != std::string::npos) return true;
      }
      return false;
    });
  }

  kova::TestRoot root_;
  const std::string proc_ = root_.Path("/snapshot/proc");
  pid_t pid_ = -1;
};

TEST_F(RunningDaemonTest, RaisesReloadsRecoversAndEndsCleanly) {
  AddRule("", PERFEVENT_SEVERITY_WARNING, 50);
  pid_ =
      Start({"--proc", proc_, "--sys", root_.Path("/sys"), "--time-scale", "0.01", "--log-stderr"},
            root_.Path("/tmp/err"));
  EXPECT_TRUE(Logged("Warning",
                     "Memory use of the system has been above 50% for 30 seconds "
                     "(average 80.0%)."));

  // A rule added with a reload signal, and one added without.
  AddRule("", PERFEVENT_SEVERITY_CRITICAL, 70);
  kill(pid_, SIGHUP);
  EXPECT_TRUE(Logged("Critical", "Memory use of the system has been above 70%"));
  AddRule("NAS", PERFEVENT_SEVERITY_WARNING, 60);
  EXPECT_TRUE(Logged("Warning", "Memory use of the system \"NAS\" has been above 60%"));

  // An unreadable file is said once; then the memory goes down.
  std::filesystem::rename(proc_ + "/meminfo", proc_ + "/meminfo.away");
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  WriteSystem(proc_, 100, 1000, 1000000, 900000);
  EXPECT_TRUE(Logged("Info", "Memory use of the system has been back at or below 50%"));
  EXPECT_TRUE(Logged("Info", "Memory use of the system \"NAS\" has been back at or below 60%"));

  kill(pid_, SIGTERM);
  EXPECT_EQ(WaitExit(pid_), 0);
  pid_ = -1;
  std::vector<std::string> lines;
  std::istringstream err(root_.Read("/tmp/err"));
  for (std::string line; std::getline(err, line);) lines.push_back(line.substr(line.find(' ') + 1));
  EXPECT_EQ(std::count(lines.begin(), lines.end(), "can't read " + proc_ + "/meminfo"), 1);
  EXPECT_EQ(std::count_if(lines.begin(), lines.end(),
                          [](const std::string& line) {
                            return line.find("(Memory use of the system) is skipped") !=
                                   std::string::npos;
                          }),
            2);  // once for each rule on it
  EXPECT_THAT(lines, Contains("stopped"));
  EXPECT_EQ(LogLines(root_.Path("/tmp/dump")).size(), 6u);  // three raised, three recovered
}

}  // namespace
}  // namespace perfeventd
