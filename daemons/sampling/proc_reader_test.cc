#include "sampling/proc_reader.h"

#include <gtest/gtest.h>

#include "kova/perfevent.h"
#include "sampling/measurements.h"
#include "test_support/recorded_proc.h"
#include "test_support/test_root.h"

namespace sampling {

using kova_test::WriteFile;
using kova_test::WriteProcess;
using kova_test::WriteSystem;
namespace {

// The value measured, -1 for none, -2 for a problem.
double ValueOf(const Measured& measured) {
  if (!measured.problem.empty()) return -2;
  return measured.reading ? measured.reading->value() : -1;
}

TEST(ProcReaderTest, ReadsOnePassOfRecordedFiles) {
  kova_test::TestRoot root;
  const std::string proc = root.Path("/proc");
  const std::string sys = root.Path("/sys");
  WriteSystem(proc, 250, 1000, 4000000, 1000000);
  WriteProcess(proc, {10, 1, 500, 40, 300, "odd) (name"});
  WriteProcess(proc, {9, 1, 400, 7, 2});
  WriteFile(proc + "/11/stat", "11 (cut off");  // a process that ended mid-read
  WriteFile(proc + "/diskstats",
            "   8       0 vda 100 5 8000 300 50 7 4000 200 0 0 0 0 0 0 0\n"
            "   8       1 vda1 90 0 7000 250 40 0 3000 150 0 0 0 0 0 0 0\n"
            " 253       0 dm-0 1 0 2 3 4 0 6 7 0 0 0\n");
  WriteFile(sys + "/block/vda/device/vendor", "virtio\n");
  WriteFile(sys + "/block/dm-0/dm/name", "vg-data\n");
  WriteFile(proc + "/self/mountinfo",
            "22 1 8:1 / / rw - ext4 /dev/vda1 rw\n"
            "40 22 253:0 / /volume\\0401 rw - ext4 /dev/mapper/vg-data rw\n");

  const Snapshot all = ProcReader(proc, sys).Read({true, true, true, true});
  ASSERT_TRUE(all.cpu.has_value());
  EXPECT_EQ(all.cpu->busy, 250u);
  EXPECT_EQ(all.cpu->total, 1000u);
  EXPECT_EQ(all.memory_total_kib, 4000000u);
  EXPECT_EQ(all.memory_available_kib, 1000000u);
  // In pid order, without the process that ended mid-read.
  EXPECT_EQ(all.processes, (std::vector<ProcessSample>{{9, 1, 400, 7, 2}, {10, 1, 500, 40, 300}}));
  EXPECT_EQ(all.disks, (std::vector<DiskSample>{{8, 0, "vda", 150, 12000, 500, true},
                                                {8, 1, "vda1", 130, 10000, 400, false},
                                                {253, 0, "dm-0", 5, 8, 10, false}}));
  ASSERT_EQ(all.mounts.size(), 2u);
  EXPECT_EQ(all.mounts[1].path, "/volume 1");
  EXPECT_EQ(all.mounts[1].major, 253u);
  EXPECT_TRUE(all.unreadable.empty());

  // Only what is asked for is read; what is missing is named.
  std::filesystem::remove(proc + "/meminfo");
  const Snapshot some = ProcReader(proc, sys).Read({});
  EXPECT_FALSE(some.processes_read || some.disks_read || some.mounts_read);
  EXPECT_EQ(some.unreadable, std::vector<std::string>{proc + "/meminfo"});
  EXPECT_EQ(ProcReader(root.Path("/none"), sys).Read({true}).unreadable.size(), 3u);
}

TEST(MeasurementsTest, MeasuresServicesSystemAndDisksBetweenTwoPasses) {
  Snapshot before;
  before.seconds = 100;
  before.cpu = CpuTimes{100, 1000};
  before.memory_total_kib = 1000;
  before.memory_available_kib = 400;
  before.processes_read = true;
  // 10 is the service, 11 its child, 12 a grandchild; 20 is unrelated; 13 had
  // the pid of a process that ended.
  before.processes = {
      {10, 1, 50, 100, 5}, {11, 10, 60, 10, 5}, {13, 11, 70, 500, 5}, {20, 1, 80, 0, 5}};
  before.disks_read = true;
  before.disks = {{8, 0, "vda", 100, 1000, 500, true},
                  {8, 1, "vda1", 100, 1000, 500, false},
                  {8, 16, "vdb", 0, 0, 0, true}};
  Snapshot now = before;
  now.seconds = 102;
  now.cpu = CpuTimes{300, 1400};
  now.memory_available_kib = 250;
  now.processes = {{10, 1, 50, 130, 20},
                   {11, 10, 60, 20, 10},
                   {12, 11, 90, 15, 10},
                   {13, 11, 95, 5, 10},
                   {20, 1, 80, 400, 900}};
  now.disks = {{8, 0, "vda", 110, 3000, 600, true},
               {8, 1, "vda1", 105, 2000, 550, false},
               {8, 16, "vdb", 10, 2000, 100, true}};

  Measurements m(4);
  m.Advance(before);
  EXPECT_EQ(ValueOf(m.System(PERFEVENT_RESOURCE_CPU)), -1);  // nothing to compare with yet
  EXPECT_EQ(ValueOf(m.Processes(10, 50, PERFEVENT_RESOURCE_CPU)), -1);
  m.Advance(now);
  EXPECT_DOUBLE_EQ(ValueOf(m.System(PERFEVENT_RESOURCE_CPU)), 50);     // 200 of 400 ticks
  EXPECT_DOUBLE_EQ(ValueOf(m.System(PERFEVENT_RESOURCE_MEMORY)), 75);  // 750 of 1000 KiB
  // 30 + 10 + 15 (new) + 5 (a new process with an old pid) of 400 ticks.
  EXPECT_DOUBLE_EQ(ValueOf(m.Processes(10, 50, PERFEVENT_RESOURCE_CPU)), 15);
  EXPECT_DOUBLE_EQ(ValueOf(m.Processes(11, 60, PERFEVENT_RESOURCE_CPU)), 7.5);
  // (20 + 10 + 10 + 10) pages of 4 KiB of 1000 KiB.
  EXPECT_DOUBLE_EQ(ValueOf(m.Processes(10, 50, PERFEVENT_RESOURCE_MEMORY)), 20);
  EXPECT_EQ(m.Processes(10, 51, PERFEVENT_RESOURCE_CPU).problem, "its process is gone");
  // vda: 2000 sectors in 2 s, 100 ms over 10 I/Os; the system sums vda and vdb.
  EXPECT_DOUBLE_EQ(ValueOf(m.Device(8, 0, PERFEVENT_RESOURCE_IO_RATE)), 500);
  EXPECT_DOUBLE_EQ(ValueOf(m.Device(8, 0, PERFEVENT_RESOURCE_IO_LATENCY)), 10);
  EXPECT_DOUBLE_EQ(ValueOf(m.System(PERFEVENT_RESOURCE_IO_RATE)), 1000);
  EXPECT_DOUBLE_EQ(ValueOf(m.System(PERFEVENT_RESOURCE_IO_LATENCY)), 10);
  EXPECT_EQ(ValueOf(m.Device(9, 0, PERFEVENT_RESOURCE_IO_RATE)), -2);

  // Parents that go round in a circle (a broken recording) end the walk.
  Snapshot circle = now;
  circle.processes[0].ppid = 12;
  m.Advance(circle);
  EXPECT_DOUBLE_EQ(ValueOf(m.Processes(10, 50, PERFEVENT_RESOURCE_MEMORY)), 20);

  // Counters that went back (a replaced device) give no reading.
  Snapshot later = now;
  later.disks[0].sectors = 0;
  later.cpu.reset();
  m.Advance(later);
  EXPECT_EQ(ValueOf(m.Device(8, 0, PERFEVENT_RESOURCE_IO_RATE)), -1);
  EXPECT_EQ(m.System(PERFEVENT_RESOURCE_CPU).problem, "the CPU counters can't be read");
}

}  // namespace
}  // namespace sampling
