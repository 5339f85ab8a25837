// kovastatd's metrics endpoint: a scrape of a box with 100 services and 16
// cores, rendered by the real renderer from a made-up last sample and served
// by the real listener on loopback, timed over HTTP per scrape and weighed;
// then this machine's prometheus-node-exporter scraped the same way with the
// same client, side by side. Prints the figures and the ratio ours/theirs;
// exits 1 when a scrape failed or came back without node_cpu_seconds_total.
//   metrics_bench [SCRAPES]   (default 2000 of ours, a tenth of that of theirs)

#include <httplib.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "statd/metrics_server.h"
#include "statd/metrics_text.h"
#include "test_support/free_port.h"

namespace {

using Clock = std::chrono::steady_clock;

// The last sample of a busy box: 16 cores, 100 services, 8 packages, 4 disks,
// 4 interfaces, 4 volumes, 8 LUNs, kovaperfeventd with 3 rules firing.
statd::MetricsSample BusyBox() {
  statd::MetricsSample s;
  s.time = 1700000000;
  s.boot_time = 1690000000;
  for (int cpu = 0; cpu < 16; ++cpu) {
    s.cpus.push_back({cpu, 123456u + cpu, 789, 45678, 9876543, 1234, 56, 789, 12});
  }
  s.memory_total_kib = 32u << 20;
  s.memory_available_kib = 20u << 20;
  s.memory = sampling::MemoryDetail{100000, 2000000, 300000, 4000000, 3900000};
  s.load = sampling::LoadAverage{1.5, 1.25, 1.125};
  for (int i = 0; i < 4; ++i) {
    s.net.push_back(
        {"eth" + std::to_string(i), 123456789012u, 98765432, 3, 23456789012u, 8765432, 1});
    sampling::DiskSample disk;
    disk.name = std::string("sd") + static_cast<char>('a' + i);
    disk.reads = disk.writes = 1234567;
    disk.read_sectors = disk.write_sectors = 987654321;
    disk.read_ms = disk.write_ms = disk.io_ticks = 7654321;
    s.disks.push_back(disk);
    s.filesystems.push_back({"/volume" + std::to_string(i + 1), "/dev/md" + std::to_string(i),
                             "btrfs", 4000000000000u, 1500000000000u, 1400000000000u});
  }
  for (int i = 0; i < 100; ++i) {
    const std::string name = "service-" + std::to_string(i);
    s.services.push_back({name, "Service number " + std::to_string(i), 12345.67 + i, 123456789u});
  }
  for (int i = 0; i < 8; ++i) {
    s.packages.push_back(
        {"Package" + std::to_string(i), "Package " + std::to_string(i), 345.6, 98765432u});
    s.luns.push_back({"3f2a9c1e-5b7d-4e8a-9c0f-1d2e3f4a5b6" + std::to_string(i),
                      "LUN " + std::to_string(i), 123456789012u, 98765432109u, 1234567, 7654321});
  }
  s.perf = statd::PerfState{{120, 30, 4},
                            {{"r1", "Service number 3", "cpu"},
                             {"r2", "LUN 1", "io_latency"},
                             {"r3", "system", "memory"}}};
  return s;
}

struct Figures {
  double mean_ms = 0;
  double p50_ms = 0;
  double p99_ms = 0;
  size_t bytes = 0;
  int failures = 0;
};

// `count` scrapes of 127.0.0.1:`port` on one kept-alive connection, after a
// few to warm up; a scrape fails without status 200 or node_cpu_seconds_total.
Figures Scrape(int port, int count) {
  httplib::Client client("127.0.0.1", port);
  client.set_keep_alive(true);
  client.set_read_timeout(10, 0);
  Figures figures;
  std::vector<double> times;
  for (int i = -5; i < count; ++i) {
    const auto start = Clock::now();
    const httplib::Result result = client.Get("/metrics");
    const double ms = std::chrono::duration<double, std::milli>(Clock::now() - start).count();
    const bool good = result && result->status == 200 && !result->body.empty() &&
                      result->body.find("node_cpu_seconds_total") != std::string::npos;
    if (i < 0) continue;
    if (!good) {
      ++figures.failures;
      continue;
    }
    figures.bytes = result->body.size();
    times.push_back(ms);
  }
  if (times.empty()) return figures;
  std::sort(times.begin(), times.end());
  double sum = 0;
  for (double t : times) sum += t;
  figures.mean_ms = sum / static_cast<double>(times.size());
  figures.p50_ms = times[times.size() / 2];
  figures.p99_ms = times[std::min(times.size() - 1, times.size() * 99 / 100)];
  return figures;
}

void Print(const char* who, int count, const Figures& f) {
  printf("%-14s %5d scrapes: mean %.3f ms, median %.3f ms, p99 %.3f ms, %zu bytes, %d failed\n",
         who, count, f.mean_ms, f.p50_ms, f.p99_ms, f.bytes, f.failures);
}

}  // namespace

int main(int argc, char** argv) {
  const int count = argc > 1 ? std::max(10, atoi(argv[1])) : 2000;
  const statd::MetricsSample sample = BusyBox();

  // Rendering, which happens once per sample in the sampling loop.
  const auto render_start = Clock::now();
  constexpr int kRenders = 200;
  std::string prometheus, openmetrics;
  for (int i = 0; i < kRenders; ++i) {
    prometheus = statd::RenderMetrics(sample, statd::MetricsFormat::kPrometheus);
    openmetrics = statd::RenderMetrics(sample, statd::MetricsFormat::kOpenMetrics);
  }
  const double render_ms =
      std::chrono::duration<double, std::milli>(Clock::now() - render_start).count() / kRenders;
  printf("render of both formats per sample: %.3f ms\n", render_ms);

  statd::MetricsServer server;
  std::string error;
  if (!server.Start("127.0.0.1:0", error)) {
    fprintf(stderr, "metrics_bench: %s\n", error.c_str());
    return 1;
  }
  server.Publish(prometheus, openmetrics);
  const int ours_port = std::stoi(server.bound().substr(server.bound().rfind(':') + 1));
  const Figures ours = Scrape(ours_port, count);
  Print("kovastatd", count, ours);
  printf("  targets: under 2 ms per scrape (%s), under 100 KB (%s)\n",
         ours.mean_ms < 2 ? "met" : "missed", ours.bytes < 100000 ? "met" : "missed");
  server.Stop();

  // node_exporter on a free loopback port, scraped by the same client.
  const int port = kova_test::FreePort();
  const std::string listen = "--web.listen-address=127.0.0.1:" + std::to_string(port);
  const pid_t exporter = fork();
  if (exporter == 0) {
    if (freopen("/dev/null", "w", stderr) == nullptr) _exit(127);
    execlp("prometheus-node-exporter", "prometheus-node-exporter", listen.c_str(), nullptr);
    _exit(127);
  }
  bool up = false;
  for (int i = 0; i < 100 && !up; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    up = static_cast<bool>(httplib::Client("127.0.0.1", port).Get("/metrics"));
  }
  const int their_count = std::max(10, count / 10);
  const Figures theirs = up ? Scrape(port, their_count) : Figures{0, 0, 0, 0, their_count};
  kill(exporter, SIGTERM);
  waitpid(exporter, nullptr, 0);
  if (!up) fprintf(stderr, "metrics_bench: prometheus-node-exporter did not answer\n");
  Print("node_exporter", their_count, theirs);
  if (theirs.mean_ms > 0 && ours.mean_ms > 0) {
    printf("ratio ours/node_exporter: time %.3f, size %.3f\n", ours.mean_ms / theirs.mean_ms,
           static_cast<double>(ours.bytes) / static_cast<double>(theirs.bytes));
  }
  const int failures = ours.failures + theirs.failures;
  printf("failed scrapes: %d\n", failures);
  return failures == 0 ? 0 : 1;
}
