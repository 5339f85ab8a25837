// The metrics endpoint's parts: kovaperfeventd's state file, the rendering of
// a sample in both formats, and the listener over loopback.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <httplib.h>

#include <string>
#include <vector>

#include "statd/metrics_server.h"
#include "statd/metrics_text.h"
#include "statd/perf_state.h"
#include "test_support/raw_http.h"
#include "test_support/test_root.h"

namespace statd {
namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;

TEST(PerfStateTest, TakesItsLinesAndLeavesTheRest) {
  const struct {
    const char* text;
    PerfState state;
  } cases[] = {
      {"events_total\tInfo\t3\nevents_total\tWarning\t0\nevents_total\tCritical\t12\n"
       "firing\tr1\tMedia Server\tcpu\nfiring\tr2\tBackup LUN\tio_latency\n",
       {{3, 0, 12}, {{"r1", "Media Server", "cpu"}, {"r2", "Backup LUN", "io_latency"}}}},
      // Unknown kinds, other levels, bad counts, wrong field counts: left out.
      {"version\t2\nevents_total\tDebug\t5\nevents_total\tInfo\t-1\nevents_total\tWarning\t2\n"
       "events_total\tWarning\t7x\nevents_total\tCritical\t4\textra\nfiring\tr1\tsystem\n"
       "firing\t\tsystem\tcpu",
       {{0, 2, 0}, {}}},
      {"", {}},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(ParsePerfState(c.text), c.state) << c.text;
  }

  kova_test::TestRoot root;
  std::string error;
  // Missing: the daemon isn't running, and that is no error.
  EXPECT_FALSE(ReadPerfState(root.Path("/run/kova/perfeventd.state"), error));
  EXPECT_EQ(error, "");
  EXPECT_FALSE(ReadPerfState(root.Path("/run"), error));  // a folder
  EXPECT_THAT(error, HasSubstr("can't read"));
}

MetricsSample Sample() {
  MetricsSample s;
  s.time = 1700000000.5;
  s.boot_time = 1690000000;
  s.cpus = {{0, 28084, 5, 300, 90000, 40, 1, 2, 3}, {1, 100, 0, 0, 0, 0, 0, 0, 0}};
  s.memory_total_kib = 4000000;
  s.memory_available_kib = 1000000;
  s.memory = sampling::MemoryDetail{100, 200, 300, 400, 500};
  s.load = sampling::LoadAverage{0.5, 0.25, 0.125};
  s.net = {{"eth0", 1000, 10, 1, 2000, 20, 2}};
  sampling::DiskSample disk;
  disk.name = "sda";
  disk.reads = 7;
  disk.read_sectors = 10;
  disk.write_sectors = 20;
  disk.io_ticks = 1500;
  s.disks = {disk};
  s.filesystems = {{"/volume1", "/dev/sdb1", "ext4", 1000, 600, 500}};
  s.services = {{"web", "Web \"front\\end\"\nnew", 12.5, 4096}, {"idle", "Idle", 0, std::nullopt}};
  s.packages = {{"MediaServer", "Media Server", 3, 8192}};
  s.luns = {{"3f2a", "Backup LUN", 512, 1024, 9, 2500}};
  return s;
}

TEST(MetricsTextTest, NodeExporterNamesAndTheSystemsOwnInBothFormats) {
  MetricsSample sample = Sample();
  const std::string text = RenderMetrics(sample, MetricsFormat::kPrometheus);
  const char* const lines[] = {
      "# TYPE node_cpu_seconds_total counter\n",
      "node_cpu_seconds_total{cpu=\"0\",mode=\"user\"} 280.84\n",
      "node_cpu_seconds_total{cpu=\"1\",mode=\"user\"} 1\n",
      "node_time_seconds 1700000000.5\n",
      "node_boot_time_seconds 1690000000\n",
      "node_load15 0.125\n",
      "# TYPE node_memory_MemTotal_bytes gauge\nnode_memory_MemTotal_bytes 4096000000\n",
      "node_memory_MemAvailable_bytes 1024000000\n",
      "node_memory_SwapFree_bytes 512000\n",
      "node_network_receive_bytes_total{device=\"eth0\"} 1000\n",
      "node_network_transmit_errs_total{device=\"eth0\"} 2\n",
      "node_disk_reads_completed_total{device=\"sda\"} 7\n",
      "node_disk_read_bytes_total{device=\"sda\"} 5120\n",
      "node_disk_written_bytes_total{device=\"sda\"} 10240\n",
      "node_disk_io_time_seconds_total{device=\"sda\"} 1.5\n",
      "node_filesystem_avail_bytes{device=\"/dev/sdb1\",fstype=\"ext4\",mountpoint=\"/volume1\"} "
      "500\n",
      "node_filesystem_free_bytes{device=\"/dev/sdb1\",fstype=\"ext4\",mountpoint=\"/volume1\"} "
      "600\n",
      "kova_service_cpu_seconds_total{service=\"web\",display_name=\"Web "
      "\\\"front\\\\end\\\"\\nnew\"} 12.5\n",
      "kova_service_cpu_seconds_total{service=\"idle\",display_name=\"Idle\"} 0\n",
      "# TYPE kova_service_resident_bytes gauge\n",
      "kova_package_resident_bytes{package=\"MediaServer\",display_name=\"Media Server\"} 8192\n",
      "kova_lun_written_bytes_total{lun=\"3f2a\",name=\"Backup LUN\"} 1024\n",
      "kova_lun_io_time_seconds_total{lun=\"3f2a\",name=\"Backup LUN\"} 2.5\n",
  };
  for (const char* line : lines) EXPECT_THAT(text, HasSubstr(line));
  // A service without memory has no resident series; no kovaperfeventd, no perf series.
  EXPECT_THAT(text, Not(HasSubstr("kova_service_resident_bytes{service=\"idle\"")));
  EXPECT_THAT(text, Not(HasSubstr("kova_perf")));
  EXPECT_THAT(text, Not(HasSubstr("# EOF")));

  sample.perf = PerfState{{1, 2, 3}, {{"r9", "Backup LUN", "io_rate"}}};
  sample.services.clear();
  const std::string open = RenderMetrics(sample, MetricsFormat::kOpenMetrics);
  const char* const open_lines[] = {
      "# TYPE node_cpu_seconds counter\nnode_cpu_seconds_total{",
      "# TYPE kova_perf_events counter\n",
      "kova_perf_events_total{level=\"Critical\"} 3\n",
      "kova_perf_event_rule_firing{rule=\"r9\",object=\"Backup LUN\",resource=\"io_rate\"} 1\n",
  };
  for (const char* line : open_lines) EXPECT_THAT(open, HasSubstr(line));
  EXPECT_THAT(open, Not(HasSubstr("# TYPE node_cpu_seconds_total")));
  EXPECT_THAT(open, Not(HasSubstr("kova_service_")));  // a family without samples leaves no trace
  EXPECT_THAT(open, EndsWith("\n# EOF\n"));

  EXPECT_EQ(FormatFor("application/openmetrics-text;version=1.0.0,text/plain;q=0.5"),
            MetricsFormat::kOpenMetrics);
  EXPECT_EQ(FormatFor(""), MetricsFormat::kPrometheus);
}

TEST(MetricsServerTest, ListenAddressesAndSecrets) {
  const struct {
    const char* text;
    const char* address;  // nullptr: refused
    uint16_t port;
  } cases[] = {
      {"127.0.0.1:9477", "127.0.0.1", 9477},
      {"[::1]:0", "::1", 0},
      {"0.0.0.0:65535", "0.0.0.0", 65535},
      {"127.0.0.1:65536", nullptr, 0},
      {"127.0.0.1", nullptr, 0},
      {"localhost:9477", nullptr, 0},
      {":9477", nullptr, 0},
      {"127.0.0.1:9x", nullptr, 0},
  };
  for (const auto& c : cases) {
    std::string address, error;
    uint16_t port = 1;
    EXPECT_EQ(ParseListenAddress(c.text, address, port, error), c.address != nullptr) << c.text;
    if (c.address == nullptr) {
      EXPECT_THAT(error, HasSubstr("is not ADDRESS:PORT")) << c.text;
      continue;
    }
    EXPECT_EQ(address, c.address);
    EXPECT_EQ(port, c.port);
  }
  EXPECT_TRUE(SameSecret("s3cret", "s3cret"));
  EXPECT_FALSE(SameSecret("s3cret", "s3cres"));
  EXPECT_FALSE(SameSecret("s3cret", "s3cret2"));
  EXPECT_FALSE(SameSecret("s3cret", "s3cre"));
  EXPECT_FALSE(SameSecret("", "x"));
}

TEST(MetricsServerTest, AnswersScrapesFromThePublishedText) {
  MetricsLimits limits;
  limits.max_connections = 3;
  limits.timeout = std::chrono::milliseconds(500);
  MetricsServer server(limits);
  std::string error;
  ASSERT_TRUE(server.Start("127.0.0.1:0", error)) << error;
  const int port = std::stoi(server.bound().substr(server.bound().rfind(':') + 1));
  httplib::Client client("127.0.0.1", port);
  EXPECT_EQ(client.Get("/metrics")->status, 503);  // nothing published yet
  server.Publish("a 1\n", "a 1\n# EOF\n");
  server.SetToken("tok");

  const struct {
    const char* method;
    const char* path;
    httplib::Headers headers;
    int status;
    const char* body;
    const char* header;  // name=value the answer must carry
  } cases[] = {
      {"GET",
       "/metrics",
       {{"Authorization", "Bearer tok"}},
       200,
       "a 1\n",
       "Content-Type=text/plain; version=0.0.4; charset=utf-8"},
      {"GET",
       "/metrics?x=1",
       {{"Authorization", "bearer tok"}, {"Accept", "application/openmetrics-text"}},
       200,
       "a 1\n# EOF\n",
       "Content-Type=application/openmetrics-text; version=1.0.0; charset=utf-8"},
      {"HEAD", "/metrics", {{"Authorization", "Bearer tok"}}, 200, "", "Content-Length=4"},
      {"GET", "/metrics", {}, 401, nullptr, "WWW-Authenticate=Bearer"},
      {"GET", "/metrics", {{"Authorization", "Bearer tok2"}}, 401, nullptr, nullptr},
      {"GET", "/metrics", {{"Authorization", "Basic tok"}}, 401, nullptr, nullptr},
      {"GET", "/metrics", {{"Authorization", "tok"}}, 401, nullptr, nullptr},
      {"GET", "/", {{"Authorization", "Bearer tok"}}, 404, nullptr, nullptr},
      {"POST", "/metrics", {{"Authorization", "Bearer tok"}}, 405, nullptr, "Allow=GET, HEAD"},
  };
  for (const auto& c : cases) {
    httplib::Request request;
    request.method = c.method;
    request.path = c.path;
    request.headers = c.headers;
    const httplib::Result result = client.send(request);
    ASSERT_TRUE(result) << c.method << " " << c.path;
    EXPECT_EQ(result->status, c.status) << c.method << " " << c.path;
    if (c.body != nullptr) {
      EXPECT_EQ(result->body, c.body) << c.path;
    }
    if (c.header != nullptr) {
      const std::string pair = c.header;
      const size_t equals = pair.find('=');
      EXPECT_EQ(result->get_header_value(pair.substr(0, equals).c_str()), pair.substr(equals + 1))
          << c.method << " " << c.path;
    }
  }

  // An oversized header, a silent client, and clients past the cap are let go.
  kova_test::RawConnection big(port);
  ASSERT_TRUE(big.Send("GET /metrics HTTP/1.1\r\nX: " + std::string(10000, 'x') + "\r\n\r\n"));
  EXPECT_TRUE(big.ClosedWithin(std::chrono::seconds(2)));
  std::vector<kova_test::RawConnection> idle;
  for (int i = 0; i < 3; ++i) idle.emplace_back(port);
  kova_test::RawConnection extra(port);
  EXPECT_TRUE(extra.ClosedWithin(std::chrono::seconds(1)));
  EXPECT_TRUE(idle[0].ClosedWithin(std::chrono::seconds(2)));  // its deadline passed
  idle.clear();
  server.SetToken("");
  const httplib::Result open = httplib::Client("127.0.0.1", port).Get("/metrics");
  ASSERT_TRUE(open);
  EXPECT_EQ(open->status, 200);

  server.Stop();
  EXPECT_FALSE(kova_test::RawConnection(port).ok());
  EXPECT_FALSE(server.Start("127.0.0.1:99999", error));
}

}  // namespace
}  // namespace statd
