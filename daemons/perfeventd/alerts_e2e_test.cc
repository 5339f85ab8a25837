// kovaperfeventd posting to a real Alertmanager (Debian's
// prometheus-alertmanager) on a free loopback port, over a temporary system
// root: a service that burns CPU raises an alert, which Alertmanager lists
// with its labels and the logged text, and which is resolved once the load
// stops. An Alertmanager that can't be reached, or never answers, holds up no
// cycle.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <httplib.h>
#include <json/json.h>
#include <netinet/in.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <fstream>
#include <functional>
#include <sstream>
#include <thread>

#include "kova/perfevent.h"
#include "test_support/free_port.h"
#include "test_support/perfevent_log.h"
#include "test_support/perfevent_rule.h"
#include "test_support/recorded_proc.h"
#include "test_support/test_root.h"

extern char** environ;

namespace perfeventd {
namespace {

using ::testing::HasSubstr;
using Clock = std::chrono::steady_clock;

// A program started with `args`, its standard output and error appended to
// `log`; stopped with SIGTERM (then SIGKILL) when the object goes.
class Child {
 public:
  Child(const std::vector<std::string>& args, const std::string& log) {
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    posix_spawn_file_actions_adddup2(&actions, 1, 2);
    std::vector<char*> argv;
    for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
    argv.push_back(nullptr);
    if (posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(), environ) != 0) pid_ = -1;
    posix_spawn_file_actions_destroy(&actions);
  }
  ~Child() {
    if (pid_ <= 0) return;
    kill(pid_, SIGCONT);
    kill(pid_, SIGTERM);
    for (int i = 0; i < 100 && Wait(WNOHANG) == 0; ++i) usleep(20000);
    if (pid_ > 0) {
      kill(pid_, SIGKILL);
      Wait(0);
    }
  }

  pid_t pid() const { return pid_; }
  // Sends SIGTERM and waits for the end: the exit status, -1 when killed.
  int Stop() {
    kill(pid_, SIGTERM);
    const int status = Wait(0);
    return status;
  }

 private:
  int Wait(int flags) {
    int status = 0;
    const pid_t got = waitpid(pid_, &status, flags);
    if (got == 0) return 0;
    pid_ = -1;
    return got > 0 && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

  pid_t pid_ = -1;
};

// Waits up to `seconds` for `done`; true when it came.
bool WaitFor(double seconds, const std::function<bool()>& done) {
  const auto end = Clock::now() + std::chrono::duration<double>(seconds);
  while (!done()) {
    if (Clock::now() > end) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  return true;
}

// The start time of the process `pid`, as /proc/<pid>/stat gives it.
std::string StartTime(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(in)), {});
  std::istringstream fields(text.substr(text.rfind(')') + 2));
  std::string field;
  for (int i = 3; i <= 22 && fields >> field; ++i) {
  }
  return field;
}

class AlertsE2eTest : public ::testing::Test {
 protected:
  // Starts Alertmanager with a receiver that sends nowhere, and waits until it
  // is ready.
  void StartAlertmanager() {
    am_port_ = kova_test::FreePort();
    root_.Write("/am/alertmanager.yml",
                "route:\n  receiver: \"null\"\n  group_wait: 1s\nreceivers:\n  - name: \"null\"\n");
    std::filesystem::create_directories(root_.Path("/am/data"));
    alertmanager_ = std::make_unique<Child>(
        std::vector<std::string>{"/usr/bin/prometheus-alertmanager",
                                 "--config.file=" + root_.Path("/am/alertmanager.yml"),
                                 "--storage.path=" + root_.Path("/am/data"),
                                 "--web.listen-address=127.0.0.1:" + std::to_string(am_port_),
                                 "--cluster.listen-address="},
        root_.Path("/am/log"));
    ASSERT_GT(alertmanager_->pid(), 0) << "prometheus-alertmanager is a dependency";
    httplib::Client client("127.0.0.1", am_port_);
    const bool ready = WaitFor(20, [&] {
      const httplib::Result result = client.Get("/-/ready");
      return result && result->status == 200;
    });
    ASSERT_TRUE(ready) << root_.Read("/am/log");
  }

  // The alert of rule `rule_id` among those Alertmanager lists as active (the
  // default), null when none; `answer` is the raw answer.
  Json::Value AlertOf(const std::string& rule_id, std::string& answer) {
    const httplib::Result result = httplib::Client("127.0.0.1", am_port_).Get("/api/v2/alerts");
    answer = result ? result->body : "(no answer)";
    Json::Value alerts;
    std::istringstream in(answer);
    std::string errors;
    if (result && Json::parseFromStream(Json::CharReaderBuilder(), in, &alerts, &errors)) {
      for (const Json::Value& alert : alerts) {
        if (alert["labels"]["rule"].asString() == rule_id) return alert;
      }
    }
    return Json::Value();
  }

  std::string AddRule(int32_t type, const char* object, int32_t resource, int32_t severity,
                      int32_t threshold) {
    KOVAPERFEVENT_CONF_SETTING rule = kova_test::PerfEventRule(
        static_cast<KOVAPERFEVENT_EVENT_TYPE>(type), object, resource, severity, threshold);
    EXPECT_EQ(KOVAPerfEventConfAdd(&rule), 0);
    return rule.id;
  }

  void StartDaemon(const std::vector<std::string>& options) {
    std::vector<std::string> args = {KOVAPERFEVENTD_PATH, "--log-stderr"};
    args.insert(args.end(), options.begin(), options.end());
    daemon_ = std::make_unique<Child>(args, root_.Path("/daemon.err"));
    ASSERT_GT(daemon_->pid(), 0);
  }

  std::vector<std::string> Events() { return kova_test::LogLines(root_.Path("/tmp/dump")); }
  // The entries of `level` in the events log.
  size_t Logged(const std::string& level) {
    const std::vector<std::string> events = Events();
    return std::count_if(events.begin(), events.end(), [&](const std::string& line) {
      return line.find(level + "\t") != std::string::npos;
    });
  }

  kova_test::TestRoot root_;
  int am_port_ = 0;
  std::unique_ptr<Child> alertmanager_;
  std::unique_ptr<Child> daemon_;
};

TEST_F(AlertsE2eTest, BurningServiceRaisesAnAlertThatResolvesWhenTheLoadStops) {
  ASSERT_NO_FATAL_FAILURE(StartAlertmanager());
  std::filesystem::create_directories(root_.Path("/run/kova"));
  root_.Write("/etc/kova/services/burner.conf",
              "command=\"/bin/sh\"\ndisplay_name=\"CPU burner\"\n");
  Child burner({"/bin/sh", "-c", "while :; do :; done"}, "/dev/null");
  ASSERT_GT(burner.pid(), 0);
  root_.Write("/run/kova/burner.pid",
              std::to_string(burner.pid()) + " " + StartTime(burner.pid()) + "\n");
  root_.Write("/etc/kovainfo.conf",
              "perfevent_alertmanager_urls=\"http://127.0.0.1:" + std::to_string(am_port_) +
                  "/\"\nperfevent_alert_instance=\"box-e2e\"\n");
  // A whole core busy is half of two CPUs: far above 5%.
  const std::string id = AddRule(PERFEVENT_TYPE_SERVICE, "burner", PERFEVENT_RESOURCE_CPU,
                                 PERFEVENT_SEVERITY_CRITICAL, 5);
  // Samples every 100 ms, a window of six.
  ASSERT_NO_FATAL_FAILURE(StartDaemon({"--time-scale", "0.02"}));

  std::string answer;
  Json::Value alert;
  WaitFor(20, [&] { return !(alert = AlertOf(id, answer)).isNull(); });
  ASSERT_FALSE(alert.isNull()) << answer << "\n" << root_.Read("/daemon.err");
  const std::vector<std::string> events = Events();
  std::string raised;
  for (const std::string& line : events) {
    if (line.find("Critical\t") != std::string::npos) raised = line.substr(line.rfind('\t') + 1);
  }
  EXPECT_THAT(raised, HasSubstr("CPU use of service \"CPU burner\" has been above 5% for 30 "
                                "seconds (average"));
  // The labels that the daemon's settings and the service's record name.
  Json::Value labels;
  labels["alertname"] = "KovaCpuHigh";
  labels["severity"] = "critical";
  labels["resource"] = "cpu";
  labels["object"] = "CPU burner";
  labels["instance"] = "box-e2e";
  labels["rule"] = id;
  EXPECT_EQ(alert["labels"], labels) << answer;
  EXPECT_EQ(alert["annotations"]["summary"].asString(), raised);
  EXPECT_THAT(root_.Read("/run/kova/perfeventd.state"),
              HasSubstr("events_total\tCritical\t1\nfiring\t" + id + "\tCPU burner\tcpu\n"));

  // The load stops; the process stays, idle.
  ASSERT_EQ(kill(burner.pid(), SIGSTOP), 0);
  WaitFor(20, [&] { return AlertOf(id, answer).isNull(); });
  EXPECT_TRUE(AlertOf(id, answer).isNull()) << answer << "\n" << root_.Read("/daemon.err");
  EXPECT_EQ(Logged("Info"), 1u);
  EXPECT_EQ(root_.Read("/run/kova/perfeventd.state"),
            "events_total\tInfo\t1\nevents_total\tWarning\t0\nevents_total\tCritical\t1\n");

  EXPECT_EQ(daemon_->Stop(), 0);
  EXPECT_FALSE(std::filesystem::exists(root_.Path("/run/kova/perfeventd.state")));
}

TEST_F(AlertsE2eTest, UnreachableAlertmanagersHoldUpNoCycle) {
  // A listener that takes connections and never answers, and a closed port.
  const int silent = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t size = sizeof(address);
  ASSERT_EQ(bind(silent, reinterpret_cast<sockaddr*>(&address), size), 0);
  ASSERT_EQ(listen(silent, 16), 0);
  ASSERT_EQ(getsockname(silent, reinterpret_cast<sockaddr*>(&address), &size), 0);
  const std::string silent_url = "http://127.0.0.1:" + std::to_string(ntohs(address.sin_port));
  const std::string closed_url = "http://127.0.0.1:" + std::to_string(kova_test::FreePort());
  root_.Write("/etc/kovainfo.conf", "perfevent_alertmanager_urls=\"" + silent_url + ", " +
                                        closed_url + ",ftp://127.0.0.1/\"\n");
  // The system's memory is 80% in use on a recorded /proc.
  const std::string proc = root_.Path("/proc");
  kova_test::WriteSystem(proc, 100, 1000, 1000000, 200000);
  AddRule(PERFEVENT_TYPE_SYSTEM, "", PERFEVENT_RESOURCE_MEMORY, PERFEVENT_SEVERITY_WARNING, 50);
  // A window is 300 ms.
  ASSERT_NO_FATAL_FAILURE(StartDaemon({"--proc", proc, "--time-scale", "0.01"}));
  ASSERT_TRUE(WaitFor(10, [&] { return Logged("Warning"); })) << root_.Read("/daemon.err");

  // The raise is being posted now, to the silent listener for 5 s; the
  // recovery and the raise after it, each a cycle after the one before has
  // posted, must not wait for it.
  kova_test::WriteSystem(proc, 100, 1000, 1000000, 900000);
  const auto switched = Clock::now();
  ASSERT_TRUE(WaitFor(10, [&] { return Logged("Info") == 1; })) << root_.Read("/daemon.err");
  kova_test::WriteSystem(proc, 100, 1000, 1000000, 200000);
  ASSERT_TRUE(WaitFor(10, [&] { return Logged("Warning") == 2; })) << root_.Read("/daemon.err");
  EXPECT_LT(Clock::now() - switched, std::chrono::milliseconds(2500));

  const std::string log = root_.Read("/daemon.err");
  EXPECT_THAT(log, HasSubstr("perfevent_alertmanager_urls: \"ftp://127.0.0.1/\" is not an "
                             "http:// or https:// URL; ignored"));
  EXPECT_THAT(log, HasSubstr("can't post alerts to " + closed_url + "/api/v2/alerts"));
  // The settings are read again on SIGHUP; the post still hanging is given up
  // at once.
  root_.Write("/etc/kovainfo.conf", "perfevent_alertmanager_urls=\"\"\n");
  const auto reloading = Clock::now();
  ASSERT_EQ(kill(daemon_->pid(), SIGHUP), 0);
  EXPECT_TRUE(WaitFor(5, [&] {
    return root_.Read("/daemon.err").find("alerts are posted nowhere") != std::string::npos;
  })) << root_.Read("/daemon.err");
  EXPECT_LT(Clock::now() - reloading, std::chrono::milliseconds(1500));
  EXPECT_EQ(daemon_->Stop(), 0);
  close(silent);
}

}  // namespace
}  // namespace perfeventd
