#include "sampling/proc_text.h"

#include <gtest/gtest.h>

#include "sampling/proc_reader.h"
#include "test_support/recorded_proc.h"
#include "test_support/test_root.h"

namespace sampling {
namespace {

TEST(ProcTextTest, CpuLinesStateByState) {
  const struct {
    const char* text;
    std::vector<CpuStates> cpus;  // empty: not in the form of stat
  } cases[] = {
      // cpu1 is offline: its line is missing.
      {"cpu  10 1 5 100 2 1 1 3 7 0\ncpu0 5 1 2 50 1 1 0 2 4 0\ncpu2 5 0 3 50 1 0 1 1 3 0\n"
       "intr 5\n",
       {{-1, 10, 1, 5, 100, 2, 1, 1, 3},
        {0, 5, 1, 2, 50, 1, 1, 0, 2},
        {2, 5, 0, 3, 50, 1, 0, 1, 1}}},
      {"cpu 1 2 3 4\ncpu0 1 2 3 4\n", {{-1, 1, 2, 3, 4}, {0, 1, 2, 3, 4}}},  // an old kernel
      {"cpu0 1 2 3 4\n", {}},
      {"cpu  1 2 3\n", {}},
      {"cpu  1 2 3 4\ncpux 1 2 3 4\n", {}},
      {"cpu  1 2 3 4\ncpu-1 1 2 3 4\n", {}},
      {"", {}},
  };
  for (const auto& c : cases) {
    std::vector<CpuStates> cpus;
    const bool parsed = ParseCpuStates(c.text, cpus);
    EXPECT_EQ(parsed, !c.cpus.empty()) << c.text;
    if (parsed) {
      EXPECT_EQ(cpus, c.cpus) << c.text;
    }
  }
}

TEST(ProcTextTest, MountLinesAndBootTime) {
  const struct {
    const char* line;
    const char* path;  // nullptr: not a mountinfo line
    const char* fstype;
    const char* source;
  } cases[] = {
      {"40 22 253:0 / /volume\\0401 rw shared:1 - ext4 /dev/mapper/vg\\040a rw", "/volume 1",
       "ext4", "/dev/mapper/vg a"},
      {"41 22 0:50 / /run rw - tmpfs tmpfs rw,size=10m", "/run", "tmpfs", "tmpfs"},
      {"42 22 8:1 / /old rw", "/old", "", ""},  // no type or source
      {"43 22 x:1 / /bad rw - ext4 /dev/sdb1 rw", nullptr, "", ""},
  };
  for (const auto& c : cases) {
    MountPoint mount;
    ASSERT_EQ(ParseMountLine(c.line, mount), c.path != nullptr) << c.line;
    if (c.path == nullptr) continue;
    EXPECT_EQ(mount.path, c.path);
    EXPECT_EQ(mount.fstype, c.fstype) << c.line;
    EXPECT_EQ(mount.source, c.source) << c.line;
  }
  EXPECT_EQ(ParseBootTime("cpu  1 2 3 4\nintr 5\nbtime 1700000000\nprocesses 9\n"), 1700000000u);
  EXPECT_EQ(ParseBootTime("cpu  1 2 3 4\n"), 0u);
}

TEST(ProcTextTest, NetDevLinesOfEveryKernel) {
  std::vector<NetSample> interfaces;
  ParseNetDev(
      "Inter-|   Receive                                                |  Transmit\n"
      " face |bytes    packets errs drop fifo frame compressed multicast|bytes    packets errs "
      "drop fifo colls carrier compressed\n"
      "    lo: 100 2 0 0 0 0 0 0 100 2 0 0 0 0 0 0\n"
      "  eth0:98765432109 7 1 0 0 0 0 0 555 6 2 0 0 0 0 0\n"  // no blank after the colon
      "  eth1: 1 2 3 4 5 6 7 8 9 10\n"                        // cut short: left out
      "  br-lan: 1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16",     // no final line break
      interfaces);
  EXPECT_EQ(interfaces, (std::vector<NetSample>{{"lo", 100, 2, 0, 100, 2, 0},
                                                {"eth0", 98765432109, 7, 1, 555, 6, 2},
                                                {"br-lan", 1, 2, 3, 9, 10, 11}}));
}

TEST(ProcReaderTest, ReadsWhatTheStatisticsServiceAsksFor) {
  kova_test::TestRoot root;
  const std::string proc = root.Path("/proc");
  const std::string sys = root.Path("/sys");
  kova_test::WriteCpuStat(proc,
                          {{-1, 20, 2, 10, 100, 4, 1, 1, 2}, {0, 20, 2, 10, 100, 4, 1, 1, 2}});
  kova_test::WriteMemInfo(proc, {1000, 100, 600, 50, 200, 30, 400, 300});
  kova_test::WriteLoadAvg(proc, 0.25, 1.5, 3);
  kova_test::WriteNetDev(proc, {{"lo", 1, 2, 3, 4, 5, 6}, {"eth0", 10, 20, 30, 40, 50, 60}});
  kova_test::WriteDiskStats(proc, sys, {{8, 0, "sda", 1, 2, 3, 4, 5, 6, 7, true}});

  SampleNeeds needs;
  needs.disks = needs.whole_disks = needs.cpu_states = needs.load = needs.memory_detail =
      needs.net = needs.disk_detail = true;
  const Snapshot s = ProcReader(proc, sys).Read(needs);
  EXPECT_TRUE(s.unreadable.empty());
  EXPECT_EQ(s.cpu_states, (std::vector<CpuStates>{{-1, 20, 2, 10, 100, 4, 1, 1, 2},
                                                  {0, 20, 2, 10, 100, 4, 1, 1, 2}}));
  ASSERT_TRUE(s.cpu && s.memory_detail && s.load);
  EXPECT_EQ(s.cpu->busy, 36u);
  EXPECT_EQ(s.memory_available_kib, 600u);
  EXPECT_EQ(*s.memory_detail, (MemoryDetail{50, 200, 30, 400, 300}));
  EXPECT_DOUBLE_EQ(s.load->five, 1.5);
  EXPECT_EQ(s.net,
            (std::vector<NetSample>{{"lo", 1, 2, 3, 4, 5, 6}, {"eth0", 10, 20, 30, 40, 50, 60}}));
  EXPECT_EQ(s.disks, (std::vector<DiskSample>{{8, 0, "sda", 5, 7, 9, true, 1, 2, 3, 4, 5, 6, 7}}));

  // Files that are gone are named, and their parts left empty.
  for (const char* file : {"/stat", "/loadavg", "/net/dev"}) std::filesystem::remove(proc + file);
  const Snapshot gone = ProcReader(proc, sys).Read(needs);
  EXPECT_EQ(gone.unreadable,
            (std::vector<std::string>{proc + "/stat", proc + "/loadavg", proc + "/net/dev"}));
  EXPECT_TRUE(gone.cpu_states.empty() && !gone.cpu && !gone.load && !gone.net_read);
}

}  // namespace
}  // namespace sampling
