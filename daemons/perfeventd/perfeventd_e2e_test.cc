// kovaperfeventd as the platform service "kovaperfeventd" in a temporary
// system root, installed by install-service.sh and driven through the module
// KOVA.ResourceMonitor.so (loaded with dlopen over libkova.so): rules made with
// "EventRule" "set", the daemon started with "Setting" "set", the events found
// with "Log" "list". The daemon runs with a time scale, so a 30 s window takes
// well under a second, on recorded /proc files. host/webapid_e2e_test.cc runs
// it on the live /proc, over HTTP.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <sstream>
#include <thread>

#include "kova/perfevent.h"
#include "kova/service.h"
#include "kova/webapi.h"
#include "test_support/daemon_service.h"
#include "test_support/host_call.h"
#include "test_support/module_host.h"
#include "test_support/recorded_proc.h"
#include "test_support/test_root.h"

namespace perfeventd {

using kova_test::InstallDaemonService;
using kova_test::WriteProcess;
using kova_test::WriteSystem;
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

class PerfEventE2eTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.InstallTexts(KOVA_TEXTS_DIR);
    std::filesystem::create_directories(root_.Path("/run/kova"));
  }
  void TearDown() override { QLIBServiceStop("kovaperfeventd", 0); }

  // Installs the service: the daemon with `options`, its system-log lines
  // into /daemon.err.
  void InstallDaemon(const std::string& options) {
    ASSERT_TRUE(InstallDaemonService(KOVA_INSTALL_SERVICE, root_.path(), "kovaperfeventd",
                                     KOVAPERFEVENTD_PATH, options, root_.Path("/daemon.err")));
  }

  // The daemon's system-log lines, without the "kovaperfeventd[pid]: ".
  std::vector<std::string> DaemonLog() {
    std::vector<std::string> lines;
    std::istringstream err(root_.Read("/daemon.err"));
    for (std::string line; std::getline(err, line);) {
      lines.push_back(line.substr(line.find(' ') + 1));
    }
    return lines;
  }

  // Turns events on and waits until the daemon has read its rules: the
  // platform's start returns when the program runs, before it takes signals.
  void StartDaemon() {
    EnableEvents(true);
    for (int i = 0; i < 250 && DaemonLog().size() < 2; ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    ASSERT_THAT(DaemonLog(), Contains(HasSubstr("enabled rules")));
  }

  // Runs `body` in a child with the host's ids (unprivileged, saved ids 0),
  // over the loaded module.
  bool AsHost(const std::function<void()>& body) { return host_.Run(KOVA_MODULE_PATH, body); }

  KOVA::APIResponse Call(const char* api, const char* method, const std::string& params) {
    return host_.Call(api, method, params);
  }

  void SetRule(const std::string& rule) {
    EXPECT_EQ(Call("KOVA.ResourceMonitor.EventRule", "set", rule).GetState(),
              KOVA::APIResponse::State::kSuccess)
        << rule;
  }

  void EnableEvents(bool on) {
    EXPECT_EQ(Call("KOVA.ResourceMonitor.Setting", "set",
                   on ? R"({"enable_event": true})" : R"({"enable_event": false})")
                  .GetState(),
              KOVA::APIResponse::State::kSuccess);
  }

  // The entries "<level>: <text>" that "Log" "list" answers for `level` (""
  // for all), once there are at least `count` of them or after `seconds`.
  std::vector<std::string> Events(const char* level, size_t count, int seconds = 5) {
    std::vector<std::string> texts;
    for (int i = 0; i < seconds * 50 && texts.size() < count; ++i) {
      if (i > 0) std::this_thread::sleep_for(std::chrono::milliseconds(20));
      const Json::Value logs = Call("KOVA.ResourceMonitor.Log", "list",
                                    std::string(R"({"filter": {"loglevel": ")") + level + "\"}}")
                                   .GetData()["logs"];
      texts.clear();
      for (const Json::Value& entry : logs) {
        texts.push_back(entry["level"].asString() + ": " + entry["event"].asString());
      }
    }
    return texts;
  }

  kova_test::TestRoot root_;
  kova_test::ModuleHost host_;
};

TEST_F(PerfEventE2eTest, RecordedProcRaisesReloadsRecoversAndEndsCleanly) {
  // Memory 80% in use; the service "websrv" is process 4242 with a child, 30% together.
  const std::string proc = root_.Path("/snapshot/proc");
  WriteSystem(proc, 100, 1000, 1000000, 200000);
  const uint64_t pages = 300000 / (sysconf(_SC_PAGESIZE) / 1024);
  WriteProcess(proc, {4242, 1, 777, 10, pages / 2, "websrv"});
  WriteProcess(proc, {4300, 4242, 790, 10, pages / 2, "websrv-worker"});
  WriteProcess(proc, {4400, 1, 800, 10, pages, "other"});
  root_.Write("/run/kova/websrv.pid", "4242 777\n");
  root_.Write("/etc/kova/services/websrv.conf",
              "command=\"/bin/sleep 300\"\ndisplay_name=\"Web server\"\n");
  InstallDaemon("--proc " + proc + " --time-scale 0.01");
  EXPECT_TRUE(AsHost([&] {
    StartDaemon();
    // Rules made while the daemon runs reach it by the reload signal. The first
    // two can never be measured: every field left out, and a service's without
    // the service.
    SetRule(R"({"enable": true})");
    SetRule(R"({"type": 1, "resource": 1, "severity": 1, "enable": true})");
    SetRule(R"({"service": "", "type": 0, "resource": 2, "severity": 1, "threshold": 75,
                "enable": true})");
    SetRule(R"({"service": "websrv", "type": 1, "resource": 2, "severity": 2, "threshold": 29,
                "enable": true})");
    EXPECT_THAT(Events("Warning", 1),
                ElementsAre("Warning: Memory use of the system has been above 75% for 30 seconds "
                            "(average 80.0%)."));
    EXPECT_THAT(
        Events("Critical", 1),
        ElementsAre("Critical: Memory use of service \"Web server\" has been above 29% for 30 "
                    "seconds (average 30.0%)."));
    // A rule stored without a signal is found all the same.
    KOVAPERFEVENT_CONF_SETTING rule{};
    rule = {{}, PERFEVENT_TYPE_SYSTEM, "NAS", PERFEVENT_RESOURCE_MEMORY, 1, 60, 5, 30, 1};
    ASSERT_EQ(KOVAPerfEventConfAdd(&rule), 0);
    EXPECT_EQ(Events("Warning", 2).size(), 2u);
  }));
  // meminfo can't be read for a while, then the memory goes down.
  std::filesystem::rename(proc + "/meminfo", proc + "/meminfo.away");
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  WriteSystem(proc, 100, 1000, 1000000, 900000);
  EXPECT_TRUE(AsHost([&] {
    const std::vector<std::string> all = Events("", 5);
    EXPECT_THAT(all, Contains(HasSubstr("Info: Memory use of the system has been back at or "
                                        "below 75% for 30 seconds (average 10.0%).")));
    EXPECT_THAT(all, Contains(HasSubstr("Info: Memory use of the system \"NAS\" has been back")));
    EXPECT_EQ(all.size(), 5u);  // the service's memory stays high
    EnableEvents(false);
  }));
  const std::vector<std::string> lines = DaemonLog();
  ASSERT_FALSE(lines.empty());
  EXPECT_EQ(std::count(lines.begin(), lines.end(), "can't read " + proc + "/meminfo"), 1);
  EXPECT_EQ(std::count_if(lines.begin(), lines.end(),
                          [](const std::string& line) {
                            return line.find(") is skipped: the memory counters") !=
                                   std::string::npos;
                          }),
            3);  // once for each rule on the system's memory, not every cycle
  // Said once, though the rules were read again at each change.
  EXPECT_EQ(std::count(lines.begin(), lines.end(),
                       "rule 1 (resource 0 of the system) is skipped: unknown resource 0"),
            1);
  EXPECT_EQ(std::count(lines.begin(), lines.end(),
                       "rule 2 (CPU use of service \"\") is skipped: a service's rule needs the "
                       "service's name"),
            1);
  EXPECT_EQ(lines.back(), "stopped");  // SIGTERM ended it cleanly
}

}  // namespace
}  // namespace perfeventd
