#include "statd/sampler.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <future>
#include <map>
#include <thread>

#include "test_support/recorded_proc.h"
#include "test_support/test_root.h"

namespace statd {
namespace {

using kova_test::FakeCpu;
using kova_test::FakeDisk;
using kova_test::FakeInterface;
using ::testing::Contains;
using ::testing::ElementsAreArray;
using ::testing::Not;

// A volume of 1000 blocks of 4 KiB, 400 of them free and 300 free to users.
int FixedSpace(const char*, struct statvfs* out) {
  *out = {};
  out->f_frsize = 4096;
  out->f_blocks = 1000;
  out->f_bfree = 400;
  out->f_bavail = 300;
  return 0;
}

// Each series as "id unit label=value...".
std::vector<std::string> Describe(const std::vector<SeriesValue>& values) {
  std::vector<std::string> out;
  for (const SeriesValue& v : values) {
    std::string text = v.info.id + " " + v.info.unit;
    for (const auto& [key, value] : v.info.labels) text += " " + key + "=" + value;
    out.push_back(text);
  }
  return out;
}

std::map<std::string, double> ById(const std::vector<SeriesValue>& values) {
  std::map<std::string, double> out;
  for (const SeriesValue& v : values) out[v.info.id] = v.value;
  return out;
}

class SamplerTest : public ::testing::Test {
 protected:
  SamplerTest() {
    options_.proc_dir = proc_;
    options_.sys_dir = root_.Path("/sys");
    options_.clock = [this] { return now_; };
    options_.statvfs = FixedSpace;
  }

  // A cycle one second after the one before.
  std::vector<SeriesValue> Cycle(Sampler& sampler) {
    now_ += 1;
    return sampler.Cycle();
  }

  kova_test::TestRoot root_;
  std::string proc_ = root_.Path("/proc");
  SamplerOptions options_;
  double now_ = 100;
};

// A small machine at its `pass`th second: every counter grows by the same
// amount each second.
void WriteSmallMachine(const kova_test::TestRoot& root, uint64_t p) {
  const std::string proc = root.Path("/proc");
  kova_test::WriteCpuStat(proc, {{-1, 40 * p, 10 * p, 10 * p, 120 * p, 5 * p, 5 * p, 5 * p, 5 * p},
                                 {0, 30 * p, 10 * p, 10 * p, 30 * p, 5 * p, 5 * p, 5 * p, 5 * p},
                                 {1, 10 * p, 0, 0, 90 * p, 0, 0, 0, 0}});
  kova_test::WriteNetDev(proc, {{"lo", 9 * p, 9 * p, 0, 9 * p, 9 * p, 0},
                                {"eth0", 1500 * p, 10 * p, 0, 500 * p, 5 * p, p}});
  kova_test::WriteDiskStats(proc, root.Path("/sys"),
                            {{8, 0, "sda", 10 * p, 80 * p, 30 * p, 5 * p, 40 * p, 15 * p, 250 * p},
                             {8, 1, "sda1", 8 * p, 64 * p, 16 * p, 2 * p, 16 * p, 4 * p, 0, false},
                             {8, 16, "sdb", 7, 7, 7, 7, 7, 7, 7},  // idle
                             {253, 0, "dm-0", p, p, p, p, p, p, p, false}});
  kova_test::WriteProcess(proc, {100, 1, 500, 8 * p, 100, "httpd"});
  kova_test::WriteProcess(proc, {101, 100, 510, 2 * p, 50, "httpd"});
  kova_test::WriteProcess(proc, {200, 1, 600, 20 * p, 10, "media"});
  kova_test::WriteProcess(proc, {300, 1, 700, 90 * p, 1000, "other"});
}

TEST_F(SamplerTest, TheSeriesOfASmallMachine) {
  kova_test::WriteMemInfo(proc_, {1000000, 100000, 600000, 50000, 200000, 30000, 400000, 300000});
  kova_test::WriteLoadAvg(proc_, 0.25, 1.5, 3);
  kova_test::WriteFile(proc_ + "/self/mountinfo",
                       "21 1 253:0 / / rw - ext4 /dev/dm-0 rw\n31 21 8:1 / " + root_.path() +
                           "/volume1 rw - ext4 /dev/sda1 rw\n");
  std::filesystem::create_directories(root_.Path("/volume1"));
  root_.Write("/etc/kova/services/web.conf", "display_name=\"Web server\"\n");
  root_.Write("/etc/kova/services/idle.conf", "display_name=\"Not running\"\n");
  root_.Write("/var/packages/Media/INFO", "displayname=\"Media Server\"\n");
  root_.Write("/run/kova/web.pid", "100 500\n");
  root_.Write("/run/kova/pkgctl-Media.pid", "200 600\n");
  root_.Write("/etc/kova/iscsi/luns.json",
              R"({"luns": [{"uuid": "lun-a", "name": "Store", "size_mb": 1, )"
              R"("location": "/volume1"}]})");
  const std::unique_ptr<Sampler> sampler = MakeSystemSampler(options_);

  WriteSmallMachine(root_, 1);
  // The first cycle has levels only: load, memory, volumes and services' memory.
  const std::vector<SeriesValue> first = Cycle(*sampler);
  EXPECT_EQ(first.size(), 13u);
  for (const SeriesValue& v : first) {
    EXPECT_THAT(v.info.metric,
                ::testing::MatchesRegex("load.*|mem.*|swap.*|volume.*|service.memory"));
  }

  WriteSmallMachine(root_, 2);
  const std::vector<SeriesValue> values = Cycle(*sampler);
  std::vector<std::string> expected;
  for (const char* object : {"", "@cpu0", "@cpu1"}) {
    for (std::string metric : {"cpu.user", "cpu.system", "cpu.iowait", "cpu.steal", "cpu.idle"}) {
      expected.push_back(metric + object + " %" +
                         (*object ? std::string(" cpu=") + (object + 4) : ""));
    }
  }
  for (const char* level : {"load.1 load", "load.5 load", "load.15 load", "mem.total B",
                            "mem.used B", "mem.cached B", "mem.available B", "swap.used B"}) {
    expected.push_back(level);
  }
  for (const char* net : {"net.rx_bytes@eth0 B/s", "net.tx_bytes@eth0 B/s",
                          "net.rx_packets@eth0 packets/s", "net.tx_packets@eth0 packets/s",
                          "net.rx_errors@eth0 errors/s", "net.tx_errors@eth0 errors/s"}) {
    expected.push_back(std::string(net) + " interface=eth0");
  }
  for (const std::string disk : {"sda", "sdb"}) {
    for (std::string metric : {"disk.read_bytes B/s", "disk.write_bytes B/s", "disk.read_iops IO/s",
                               "disk.write_iops IO/s", "disk.util %", "disk.await ms"}) {
      // An idle disk has no time per I/O.
      if (disk == "sdb" && metric == "disk.await ms") continue;
      metric.insert(metric.find(' '), "@" + disk);
      expected.push_back(metric + " device=" + disk);
    }
  }
  for (const char* volume :
       {"volume.size@/volume1 B", "volume.used@/volume1 B", "volume.free@/volume1 B"}) {
    expected.push_back(std::string(volume) + " volume=/volume1");
  }
  for (const char* service :
       {"service.cpu@pkgctl-Media % service=pkgctl-Media display_name=Media Server",
        "service.memory@pkgctl-Media B service=pkgctl-Media display_name=Media Server",
        "service.cpu@web % service=web display_name=Web server",
        "service.memory@web B service=web display_name=Web server",
        "lun.io@lun-a B/s lun=lun-a name=Store", "lun.latency@lun-a ms lun=lun-a name=Store"}) {
    expected.push_back(service);
  }
  EXPECT_THAT(Describe(values), ElementsAreArray(expected));
  for (const SeriesValue& v : values) {
    EXPECT_EQ(v.info.id.substr(0, v.info.id.find('@')), v.info.metric);
  }

  const double page = static_cast<double>(sysconf(_SC_PAGESIZE));
  const std::map<std::string, double> by_id = ById(values);
  const struct {
    const char* id;
    double value;
  } cases[] = {
      {"cpu.user", 25},  // (40 user + 10 nice) of 200 ticks
      {"cpu.system", 10},
      {"cpu.iowait", 2.5},
      {"cpu.idle", 60},
      {"cpu.user@cpu0", 40},
      {"cpu.idle@cpu1", 90},
      {"load.5", 1.5},
      {"mem.used", 400000 * 1024.0},
      {"mem.cached", 280000 * 1024.0},
      {"mem.available", 600000 * 1024.0},
      {"swap.used", 100000 * 1024.0},
      {"net.rx_bytes@eth0", 1500},
      {"net.tx_errors@eth0", 1},
      {"disk.read_bytes@sda", 80 * 512},
      {"disk.write_iops@sda", 5},
      {"disk.util@sda", 25},  // 250 ms busy of 1000
      {"disk.await@sda", 3},  // 45 ms over 15 I/Os
      {"disk.util@sdb", 0},
      {"volume.size@/volume1", 4096000},
      {"volume.used@/volume1", 2457600},
      {"volume.free@/volume1", 1228800},
      {"service.cpu@web", 5},  // 10 ticks of the process and its child, of 200
      {"service.memory@web", 150 * page},
      {"service.cpu@pkgctl-Media", 10},
      {"lun.io@lun-a", 80 * 512},  // on sda1, which holds /volume1
      {"lun.latency@lun-a", 2},
  };
  for (const auto& c : cases) EXPECT_DOUBLE_EQ(by_id.at(c.id), c.value) << c.id;

  // A service that stopped has no values.
  root_.Write("/run/kova/web.pid", "");
  WriteSmallMachine(root_, 3);
  std::filesystem::remove_all(proc_ + "/100");
  const std::map<std::string, double> stopped = ById(Cycle(*sampler));
  EXPECT_FALSE(stopped.count("service.cpu@web") || stopped.count("service.memory@web"));
  EXPECT_TRUE(stopped.count("service.cpu@pkgctl-Media"));
  EXPECT_TRUE(sampler->Unreadable().empty());
}

// The counters of a machine that changes: each second every counter grows by
// the same amount, unless a case changes it.
struct Machine {
  std::vector<FakeCpu> cpus = {{-1}, {0}, {1}};
  std::vector<FakeInterface> net = {{"eth0"}, {"eth1"}};
  std::vector<FakeDisk> disks = {{8, 0, "sda"}, {8, 16, "sdb"}};

  void Grow() {
    for (FakeCpu& c : cpus) {
      c.user += 30;
      c.system += 10;
      c.iowait += 10;
      c.idle += 50;
    }
    for (FakeInterface& i : net) {
      i.rx_bytes += 1000;
      i.rx_packets += 10;
      i.tx_bytes += 400;
    }
    for (FakeDisk& d : disks) {
      d.reads += 10;
      d.read_sectors += 100;
      d.read_ms += 20;
      d.io_ticks += 500;
    }
  }
  void Write(const kova_test::TestRoot& root) const {
    kova_test::WriteCpuStat(root.Path("/proc"), cpus);
    kova_test::WriteNetDev(root.Path("/proc"), net);
    kova_test::WriteDiskStats(root.Path("/proc"), root.Path("/sys"), disks);
  }
};

TEST_F(SamplerTest, CountersThatGoBackAndObjectsThatComeAndGo) {
  const struct {
    const char* name;
    // Changes the machine before the passes 3, 4 and 5 are written.
    std::function<void(Machine&, int pass)> change;
    // Watched series: per pass 3, 4 and 5, '+' for a value, '-' for none.
    std::vector<std::pair<std::string, std::string>> watched;
  } cases[] = {
      {"a received-bytes counter wraps",
       [](Machine& m, int pass) {
         if (pass == 3) m.net[0].rx_bytes = 7;
       },
       {{"net.rx_bytes@eth0", "-++"}, {"net.rx_packets@eth0", "+++"}}},
      {"a disk is replaced and counts from 0",
       [](Machine& m, int pass) {
         if (pass == 3) m.disks[0] = {8, 0, "sda"};
       },
       {{"disk.read_bytes@sda", "-++"},
        {"disk.util@sda", "-++"},
        {"disk.await@sda", "-++"},
        {"disk.read_iops@sdb", "+++"}}},
      {"an interface and a disk appear",
       [](Machine& m, int pass) {
         if (pass == 3) m.net.push_back({"eth2", 5000, 50, 0, 2000});
         if (pass == 3) m.disks.push_back({8, 32, "sdc", 1000, 10000, 2000, 0, 0, 0, 50000});
       },
       {{"net.rx_bytes@eth2", "-++"}, {"disk.util@sdc", "-++"}}},
      {"an interface and a disk vanish",
       [](Machine& m, int pass) {
         if (pass == 3) m.net.erase(m.net.begin());
         if (pass == 3) m.disks.erase(m.disks.begin());
       },
       {{"net.rx_bytes@eth0", "---"}, {"disk.util@sda", "---"}, {"net.rx_bytes@eth1", "+++"}}},
      {"a CPU taken offline and back",
       [](Machine& m, int pass) {
         static FakeCpu offline;
         if (pass == 3) {
           offline = m.cpus[2];
           m.cpus.pop_back();
         }
         if (pass == 4) m.cpus.push_back(offline);  // its counters stood still meanwhile
       },
       {{"cpu.user@cpu1", "--+"},
        {"cpu.idle@cpu1", "--+"},
        {"cpu.user@cpu0", "+++"},
        {"cpu.user", "+++"}}},
      {"a CPU's iowait goes back",
       [](Machine& m, int pass) {
         if (pass == 3) m.cpus[1].iowait -= 15;
       },
       {{"cpu.iowait@cpu0", "-++"}, {"cpu.user@cpu0", "-++"}, {"cpu.user@cpu1", "+++"}}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    Machine machine;
    const std::unique_ptr<Sampler> sampler = MakeSystemSampler(options_);
    std::map<std::string, double> steady;  // each series' value while nothing changes
    for (int pass = 1; pass <= 5; ++pass) {
      if (pass >= 3) c.change(machine, pass);
      machine.Grow();
      machine.Write(root_);
      const std::map<std::string, double> values = ById(Cycle(*sampler));
      if (pass == 2) steady = values;
      for (const auto& [id, pattern] : c.watched) {
        if (pass < 3) continue;
        EXPECT_EQ(values.count(id), pattern[pass - 3] == '+' ? 1u : 0u)
            << id << " in pass " << pass;
      }
      // Whatever comes back counts from its new value: no spike, nothing negative.
      for (const auto& [id, value] : values) {
        if (steady.count(id)) {
          EXPECT_DOUBLE_EQ(value, steady[id]) << id << " in pass " << pass;
        }
        EXPECT_GE(value, 0) << id;
      }
    }
  }
}

// statvfs that hangs on /volume2 until released.
struct HangingVolume {
  std::promise<void> promise;
  std::shared_future<void> released_future = promise.get_future().share();
  std::atomic<bool> released{false};
  std::atomic<int> calls{0};

  void Release() {
    if (!released.exchange(true)) promise.set_value();
  }
};

TEST_F(SamplerTest, AHungVolumeIsSkippedWithoutStallingTheCycleAndThenRecovers) {
  for (const char* volume : {"/volume1", "/volume2"}) {
    std::filesystem::create_directories(root_.Path(volume));
  }
  kova_test::WriteSystem(proc_, 100, 1000, 1000, 500);
  const auto hang = std::make_shared<HangingVolume>();
  options_.statvfs = [hang](const char* path, struct statvfs* out) {
    if (std::string(path).ends_with("/volume2")) {
      ++hang->calls;
      hang->released_future.wait();
    }
    return FixedSpace(path, out);
  };
  options_.volume_timeout = std::chrono::milliseconds(50);
  const std::unique_ptr<Sampler> sampler = MakeSystemSampler(options_);
  // Should a cycle wait on the hung call, it would wait until this releases it.
  std::thread watchdog([hang] {
    for (int i = 0; i < 500 && !hang->released; ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    hang->Release();
  });

  for (int cycle = 0; cycle < 2; ++cycle) {
    const std::map<std::string, double> values = ById(Cycle(*sampler));
    EXPECT_FALSE(hang->released) << "the cycle waited on the hung volume";
    EXPECT_TRUE(values.count("volume.free@/volume1"));
    EXPECT_FALSE(values.count("volume.free@/volume2"));
    EXPECT_THAT(sampler->Unreadable(), Contains(root_.Path("/volume2")));
    EXPECT_THAT(sampler->Unreadable(), Not(Contains(root_.Path("/volume1"))));
  }
  EXPECT_EQ(hang->calls, 1);  // no second call while the first hangs
  hang->Release();
  watchdog.join();
  // Once the call returned, the next cycle calls again and has the volume back.
  bool back = false;
  for (int i = 0; i < 200 && !back; ++i) {
    back = ById(Cycle(*sampler)).count("volume.free@/volume2") > 0;
    if (!back) std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  EXPECT_TRUE(back);
  EXPECT_EQ(hang->calls, 2);
  EXPECT_THAT(sampler->Unreadable(), Not(Contains(root_.Path("/volume2"))));
}

}  // namespace
}  // namespace statd
