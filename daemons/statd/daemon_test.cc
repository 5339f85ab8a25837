// kovastatd run as a program over this machine's /proc in a temporary system
// root, asked through the platform's client of its socket.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "test_support/collector_client.h"
#include "test_support/host_call.h"
#include "test_support/test_root.h"

namespace {

using kova_test::AskCollector;
using kova_test::AskCollectorUntil;
using ::testing::HasSubstr;

// kovastatd started with `args`, its standard error into `log`; killed when
// still running at the end.
class Statd {
 public:
  Statd(const std::vector<std::string>& args, const std::string& log) {
    std::vector<std::string> argv = {KOVASTATD_PATH};
    argv.insert(argv.end(), args.begin(), args.end());
    pid_ = fork();
    if (pid_ == 0) {
      freopen(log.c_str(), "w", stderr);
      freopen("/dev/null", "w", stdout);
      std::vector<char*> raw;
      for (std::string& arg : argv) raw.push_back(arg.data());
      raw.push_back(nullptr);
      execv(raw[0], raw.data());
      _exit(127);
    }
  }
  ~Statd() {
    if (Wait(std::chrono::seconds(0)) != -1) return;
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  Statd(const Statd&) = delete;
  Statd& operator=(const Statd&) = delete;

  pid_t pid() const { return pid_; }
  // Its exit status once it ended within `limit`, -1 while it runs (or died of a signal).
  int Wait(std::chrono::milliseconds limit) {
    if (ended_) return status_;
    const auto deadline = std::chrono::steady_clock::now() + limit;
    int status = 0;
    for (;;) {
      if (waitpid(pid_, &status, WNOHANG) == pid_) {
        ended_ = true;
        status_ = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
        return status_;
      }
      if (std::chrono::steady_clock::now() >= deadline) return -1;
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
  }

 private:
  pid_t pid_ = -1;
  bool ended_ = false;
  int status_ = -1;
};

std::string Read(const std::string& path) {
  std::ifstream in(path);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

TEST(StatdProgram, RefusesABadCommandLine) {
  kova_test::TestRoot root;
  const std::string log = root.Path("/err");
  const struct {
    std::vector<std::string> args;
    const char* says;
  } cases[] = {
      {{"--interval", "0"}, "--interval 0: not a whole number from 1 to 60"},
      {{"--interval=1.5"}, "--interval 1.5"},
      {{"--time-scale", "0"}, "--time-scale 0: not a number above 0"},
      {{"--spool-max", "-1"}, "--spool-max -1"},
      {{"--proc", root.Path("/none")}, "not a directory"},
      {{"--database"}, "--database needs a value"},
      {{"--metrics-listen", "nowhere:1"}, "--metrics-listen \"nowhere:1\" is not ADDRESS:PORT"},
      {{"--metrics-token-file"}, "--metrics-token-file needs a value"},
      {{"--bogus"}, "unknown option --bogus"},
  };
  for (const auto& [args, says] : cases) {
    EXPECT_EQ(Statd(args, log).Wait(std::chrono::seconds(10)), 2) << args[0];
    EXPECT_THAT(Read(log), HasSubstr(says));
    EXPECT_THAT(Read(log), HasSubstr("usage: kovastatd"));
  }
}

TEST(StatdDaemon, AnswersOnItsSocketFollowsItsSettingsAndStopsCleanly) {
  kova_test::TestRoot root;
  root.Write("/etc/kovainfo.conf", "resourcemonitor_realtime_max=\"15\"\n");
  const std::string log = root.Path("/statd.err");
  // No database: history waits for one.
  Statd statd({"--log-stderr", "--database", "host=" + root.Path("/nowhere") + " dbname=none"},
              log);
  const Json::Value catalog = AskCollectorUntil(
      R"({"request":"catalog"})",
      [](const Json::Value& reply) { return reply["data"]["series"].size() > 0; });
  ASSERT_EQ(catalog["success"], true) << Read(log);
  EXPECT_EQ(catalog["data"]["realtime_minutes"], 15);
  EXPECT_EQ(catalog["data"]["history"]["state"], "off");
  bool has_memory = false;
  for (const Json::Value& series : catalog["data"]["series"]) {
    has_memory |= series["id"] == "mem.total" && series["unit"] == "B";
  }
  EXPECT_TRUE(has_memory) << catalog;

  // A request it can't take gets an error, and the collector goes on.
  EXPECT_EQ(AskCollector(R"({"request":"realtime","series":"mem.total"})")["error"]["code"],
            "bad_request");
  const Json::Value samples = AskCollector(R"({"request":"realtime","series":["mem.total"]})");
  ASSERT_EQ(samples["data"]["series"].size(), 1u) << samples;
  EXPECT_GT(samples["data"]["series"][0]["values"][0].asDouble(), 0);

  // SIGHUP reads the settings again; so does a reload request.
  root.Write("/etc/kovainfo.conf",
             "resourcemonitor_realtime_max=\"60\"\nresourcemonitor_history=\"yes\"\n");
  kill(statd.pid(), SIGHUP);
  const Json::Value reloaded = AskCollectorUntil(
      R"({"request":"catalog"})",
      [](const Json::Value& reply) { return reply["data"]["realtime_minutes"] == 60; });
  EXPECT_EQ(reloaded["data"]["history"],
            kova_test::ParseJson(R"({"enabled":true,"state":"waiting"})"))
      << reloaded;
  root.Write("/etc/kovainfo.conf", "resourcemonitor_realtime_max=\"30\"\n");
  EXPECT_EQ(AskCollector(R"({"request":"reload"})"), kova_test::ParseJson(R"({"success":true})"));
  EXPECT_EQ(AskCollector(R"({"request":"catalog"})")["data"]["realtime_minutes"], 30);
  // A setting written without a signal or request (as the module writes the
  // real-time range) counts at the next sample.
  root.Write("/etc/kovainfo.conf", "resourcemonitor_realtime_max=\"120\"\n");
  EXPECT_EQ(AskCollectorUntil(R"({"request":"catalog"})",
                              [](const Json::Value& reply) {
                                return reply["data"]["realtime_minutes"] == 120;
                              })["data"]["realtime_minutes"],
            120);

  kill(statd.pid(), SIGTERM);
  EXPECT_EQ(statd.Wait(std::chrono::seconds(5)), 0) << Read(log);
  EXPECT_NE(access(root.Path("/run/kova/statd.sock").c_str(), F_OK), 0);
  EXPECT_THAT(Read(log), HasSubstr("stopped"));
}

}  // namespace
