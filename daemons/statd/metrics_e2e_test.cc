// kovastatd's metrics endpoint with real programs: kovastatd over this
// machine's /proc in temporary system roots, promtool on its scrape, a real
// Prometheus scraping two collectors, a flood of scrapes against sampling.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <httplib.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <mutex>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "test_support/collector_client.h"
#include "test_support/free_port.h"
#include "test_support/host_call.h"
#include "test_support/test_root.h"

namespace {

using ::testing::HasSubstr;
using ::testing::Not;

std::string Read(const std::string& path) {
  std::ifstream in(path);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

// A program run with `argv` and KOVA_ROOT=`root` (none when empty), its
// standard output and error into `log`; ended with SIGTERM (SIGKILL after 5 s)
// when still running at the end.
class Program {
 public:
  Program(std::vector<std::string> argv, const std::string& root, const std::string& log) {
    pid_ = fork();
    if (pid_ == 0) {
      if (!root.empty()) setenv("KOVA_ROOT", root.c_str(), 1);
      if (freopen(log.c_str(), "w", stderr) == nullptr) _exit(127);
      dup2(fileno(stderr), STDOUT_FILENO);
      std::vector<char*> raw;
      for (std::string& arg : argv) raw.push_back(arg.data());
      raw.push_back(nullptr);
      execvp(raw[0], raw.data());
      _exit(127);
    }
  }
  ~Program() { Stop(); }
  Program(const Program&) = delete;
  Program& operator=(const Program&) = delete;

  pid_t pid() const { return pid_; }
  // Its exit status after SIGTERM, -1 when it had to be killed.
  int Stop() {
    if (pid_ <= 0) return -1;
    kill(pid_, SIGTERM);
    int status = 0;
    for (int i = 0; i < 250; ++i) {
      if (waitpid(pid_, &status, WNOHANG) == pid_) {
        pid_ = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    pid_ = -1;
    return -1;
  }

 private:
  pid_t pid_ = -1;
};

// kovastatd over this machine's /proc in the root `root`, with `args`; its
// metrics port read from its log once it says it, within 10 s (0 when not).
class Collector {
 public:
  Collector(const kova_test::TestRoot& root, std::vector<std::string> args,
            const std::string& log = "/statd.err")
      : log_(root.Path(log)) {
    args.insert(args.begin(), {KOVASTATD_PATH, "--log-stderr", "--database",
                               "host=" + root.Path("/nowhere") + " dbname=none"});
    program_ = std::make_unique<Program>(args, root.path(), log_);
  }
  int WaitForPort() {
    const std::regex listening("metrics on http://127\\.0\\.0\\.1:([0-9]+)/metrics");
    for (int i = 0; i < 200; ++i) {
      std::smatch match;
      const std::string log = Log();
      if (std::regex_search(log, match, listening)) return std::stoi(match[1]);
      std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return 0;
  }
  std::string Log() const { return Read(log_); }
  pid_t pid() const { return program_->pid(); }
  int Stop() { return program_->Stop(); }

 private:
  std::string log_;
  std::unique_ptr<Program> program_;
};

// GET /metrics on `port` with `headers` until it answers 200, for up to 10 s.
httplib::Result Scrape(int port, const httplib::Headers& headers = {}) {
  httplib::Client client("127.0.0.1", port);
  httplib::Result result = client.Get("/metrics", headers);
  for (int i = 0; i < 100 && (!result || result->status == 503); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    result = client.Get("/metrics", headers);
  }
  return result;
}

// The start time of process `pid` in clock ticks since boot, as its record holds it.
std::string StartTime(pid_t pid) {
  const std::string stat = Read("/proc/" + std::to_string(pid) + "/stat");
  std::istringstream fields(stat.substr(stat.rfind(')') + 2));
  std::string field;
  for (int i = 3; i <= 22; ++i) fields >> field;
  return field;
}

TEST(StatdMetrics, ARealScrapeHasTheMachinesAndTheSystemsSeriesPassesPromtoolAndNeedsTheToken) {
  kova_test::TestRoot root;
  root.Write("/etc/kovainfo.conf",
             "statd_metrics_listen=\"127.0.0.1:0\"\nstatd_metrics_token_file=\"/etc/kova/t\"\n");
  root.Write("/etc/kova/t", "first-token\n", 0600);
  // A running service and a package's, their records naming sleeping processes.
  Program service({"sh", "-c", "while :; do :; done"}, "", root.Path("/busy.log"));
  Program package({"sleep", "60"}, "", root.Path("/sleep2.log"));
  root.Write("/etc/kova/services/web.conf", "command=\"/bin/true\"\ndisplay_name=\"Web UI\"\n");
  root.Write("/var/packages/Media/INFO", "package=\"Media\"\ndisplayname=\"Media Server\"\n");
  std::this_thread::sleep_for(std::chrono::milliseconds(100));  // both have started
  root.Write("/run/kova/web.pid", std::to_string(service.pid()) + " " + StartTime(service.pid()));
  root.Write("/run/kova/pkgctl-Media.pid",
             std::to_string(package.pid()) + " " + StartTime(package.pid()));
  root.Write("/run/kova/perfeventd.state",
             "events_total\tInfo\t4\nevents_total\tWarning\t2\nevents_total\tCritical\t1\n"
             "firing\tcpu-high\tWeb \"UI\"\tcpu\n");

  Collector statd(root, {});
  const int port = statd.WaitForPort();
  ASSERT_NE(port, 0) << statd.Log();
  // Two samples: the services' CPU needs one before.
  std::this_thread::sleep_for(std::chrono::milliseconds(2200));
  const httplib::Headers first = {{"Authorization", "Bearer first-token"}};
  const httplib::Result scrape = Scrape(port, first);
  ASSERT_TRUE(scrape);
  ASSERT_EQ(scrape->status, 200) << scrape->body;
  const std::string& text = scrape->body;
  const char* const wanted[] = {
      "node_cpu_seconds_total{cpu=\"0\",mode=\"idle\"} ",
      "node_memory_MemTotal_bytes ",
      "node_memory_MemAvailable_bytes ",
      "node_load1 ",
      "node_network_receive_bytes_total{device=\"lo\"} ",
      "node_boot_time_seconds ",
      "node_time_seconds ",
      "kova_service_cpu_seconds_total{service=\"web\",display_name=\"Web UI\"} ",
      "kova_service_resident_bytes{service=\"web\",display_name=\"Web UI\"} ",
      "kova_package_cpu_seconds_total{package=\"Media\",display_name=\"Media Server\"} ",
      "kova_perf_events_total{level=\"Warning\"} 2\n",
      "kova_perf_event_rule_firing{rule=\"cpu-high\",object=\"Web \\\"UI\\\"\",resource=\"cpu\"} "
      "1\n",
  };
  for (const char* line : wanted) EXPECT_NE(text.find(line), std::string::npos) << line;
  // The busy service's CPU time counts up.
  std::smatch cpu;
  const std::regex counter("kova_service_cpu_seconds_total\\{[^}]*\\} ([0-9.e+]+)");
  ASSERT_TRUE(std::regex_search(text, cpu, counter));
  EXPECT_GT(std::stod(cpu[1]), 0.3);

  // promtool parses it and has nothing to say but that node_exporter's
  // node_memory_* names, kept as they are for its dashboards, are camelCase.
  const std::string file = root.Path("/scrape.prom");
  std::ofstream(file) << text;
  const int status = WEXITSTATUS(
      std::system(("promtool check metrics < " + file + " > " + file + ".out 2>&1").c_str()));
  EXPECT_TRUE(status == 0 || status == 3) << status << Read(file + ".out");
  std::istringstream lines(Read(file + ".out"));
  std::string line;
  const std::regex allowed(
      "node_memory_[A-Za-z]+_bytes metric names should be written in 'snake_case' not "
      "'camelCase'");
  while (std::getline(lines, line)) EXPECT_TRUE(std::regex_match(line, allowed)) << line;

  // kovaperfeventd stopped: its series go.
  std::filesystem::remove(root.Path("/run/kova/perfeventd.state"));
  std::this_thread::sleep_for(std::chrono::milliseconds(1500));
  EXPECT_EQ(Scrape(port, first)->body.find("kova_perf"), std::string::npos);

  // The server's own test has the other ways a token is wrong.
  const httplib::Result wrong = Scrape(port, {{"Authorization", "Bearer wrong"}});
  ASSERT_TRUE(wrong);
  EXPECT_EQ(wrong->status, 401);
  EXPECT_EQ(wrong->get_header_value("WWW-Authenticate"), "Bearer");
  // The token file is read again on SIGHUP.
  root.Write("/etc/kova/t", "second\n", 0600);
  kill(statd.pid(), SIGHUP);
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  EXPECT_EQ(Scrape(port, first)->status, 401);
  EXPECT_EQ(Scrape(port, {{"Authorization", "Bearer second"}})->status, 200);

  // An empty token file: no metrics at all, and the log says why.
  root.Write("/etc/kova/t", "\n", 0600);
  kill(statd.pid(), SIGHUP);
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  EXPECT_FALSE(httplib::Client("127.0.0.1", port).Get("/metrics"));
  EXPECT_THAT(statd.Log(), HasSubstr("metrics not served: the token file " +
                                     root.Path("/etc/kova/t") + " is empty"));
  EXPECT_EQ(statd.Stop(), 0);

  // Options win over the settings: a missing token file named on the command line.
  Collector missing(root,
                    {"--metrics-listen", "127.0.0.1:0", "--metrics-token-file", root.Path("/none")},
                    "/statd2.err");
  std::this_thread::sleep_for(std::chrono::milliseconds(1500));
  EXPECT_THAT(missing.Log(), HasSubstr("metrics not served: can't read the token file"));
  EXPECT_THAT(missing.Log(), Not(HasSubstr("metrics on")));
}

TEST(StatdMetrics, AFloodOfScrapesLeavesSamplingOnTime) {
  kova_test::TestRoot root;
  root.Write("/etc/kovainfo.conf", "resourcemonitor_realtime_max=\"15\"\n");
  Collector statd(root, {"--metrics-listen", "127.0.0.1:0"});
  const int port = statd.WaitForPort();
  ASSERT_NE(port, 0) << statd.Log();
  ASSERT_EQ(Scrape(port)->status, 200);
  const Json::Value start =
      kova_test::AskCollector(R"({"request":"realtime","series":["mem.total"]})");
  const int64_t first = start["data"]["now"].asInt64();
  ASSERT_GT(first, 0) << start;

  // Four keep-alive clients scrape as fast as they can for 5 s, noting the
  // longest delay of a sample's pass they see.
  std::atomic<int> scrapes{0};
  std::atomic<int> failures{0};
  std::mutex mutex;
  double longest_delay = 0;
  std::vector<std::thread> clients;
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  for (int i = 0; i < 4; ++i) {
    clients.emplace_back([&] {
      httplib::Client client("127.0.0.1", port);
      client.set_keep_alive(true);
      while (std::chrono::steady_clock::now() < end) {
        const httplib::Result result = client.Get("/metrics");
        ++(result && result->status == 200 ? scrapes : failures);
        constexpr std::string_view kDelay = "\nkova_statd_sample_delay_seconds ";
        const size_t at = result ? result->body.find(kDelay) : std::string::npos;
        if (at == std::string::npos) continue;
        const double delay = std::strtod(result->body.c_str() + at + kDelay.size(), nullptr);
        std::lock_guard lock(mutex);
        longest_delay = std::max(longest_delay, delay);
      }
    });
  }
  for (std::thread& client : clients) client.join();
  RecordProperty("scrapes", scrapes.load());
  EXPECT_GT(scrapes.load(), 2000);
  EXPECT_EQ(failures.load(), 0);
  RecordProperty("longest_delay_us", static_cast<int>(longest_delay * 1e6));
  EXPECT_GT(longest_delay, 0);
  EXPECT_LT(longest_delay, 0.3);

  // One sample each second all along.
  const Json::Value samples = kova_test::AskCollector(
      R"({"request":"realtime","series":["mem.total"],"since":)" + std::to_string(first - 1) + "}");
  const Json::Value& times = samples["data"]["series"][0]["times"];
  ASSERT_GE(times.size(), 5u) << samples;
  for (Json::ArrayIndex i = 1; i < times.size(); ++i) {
    EXPECT_EQ(times[i].asInt64() - times[i - 1].asInt64(), 1) << samples;
  }
  EXPECT_EQ(statd.Stop(), 0);
}

TEST(StatdMetrics, PrometheusScrapesTwoCollectors) {
  kova_test::TestRoot prometheus_dir;
  std::vector<std::unique_ptr<kova_test::TestRoot>> roots;
  std::vector<std::unique_ptr<Collector>> collectors;
  std::vector<std::string> targets;
  for (int i = 0; i < 2; ++i) {
    roots.push_back(std::make_unique<kova_test::TestRoot>());
    roots.back()->Write("/etc/kovainfo.conf", "");
    collectors.push_back(std::make_unique<Collector>(
        *roots.back(), std::vector<std::string>{"--metrics-listen", "127.0.0.1:0"}));
    const int port = collectors.back()->WaitForPort();
    ASSERT_NE(port, 0) << collectors.back()->Log();
    targets.push_back("127.0.0.1:" + std::to_string(port));
  }
  const std::string config = prometheus_dir.Path("/prometheus.yml");
  std::ofstream(config) << "global:\n  scrape_interval: 1s\n  scrape_timeout: 1s\n"
                        << "scrape_configs:\n  - job_name: kova\n    static_configs:\n"
                        << "      - targets: ['" << targets[0] << "', '" << targets[1] << "']\n";
  const int port = kova_test::FreePort();
  Program prometheus({"prometheus", "--config.file=" + config,
                      "--storage.tsdb.path=" + prometheus_dir.Path("/data"),
                      "--web.listen-address=127.0.0.1:" + std::to_string(port)},
                     "", prometheus_dir.Path("/prometheus.log"));

  httplib::Client client("127.0.0.1", port);
  std::set<std::string> instances;
  std::string last;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (instances.size() < 2 && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    const httplib::Result answer = client.Get("/api/v1/query?query=node_cpu_seconds_total");
    if (!answer) continue;
    last = answer->body;
    instances.clear();
    const Json::Value parsed = kova_test::ParseJson(last);
    for (const Json::Value& series : parsed["data"]["result"]) {
      instances.insert(series["metric"]["instance"].asString());
    }
  }
  EXPECT_EQ(instances, std::set<std::string>(targets.begin(), targets.end()))
      << "last answer: " << last << "\n"
      << Read(prometheus_dir.Path("/prometheus.log"));
}

}  // namespace
