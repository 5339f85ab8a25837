#include "statd/spool.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>

#include "test_support/test_root.h"

namespace statd {

bool operator==(const MinuteRow& a, const MinuteRow& b) {
  return a.series == b.series && a.minute == b.minute && a.samples == b.samples && a.avg == b.avg &&
         a.min == b.min && a.max == b.max;
}

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

constexpr char kDir[] = "/var/lib/kova/statd/spool";

MinuteRow Row(const char* series, int64_t minute, double avg, int samples = 60) {
  return {series, minute, samples, avg, avg - 1, avg + 1};
}

class SpoolTest : public ::testing::Test {
 protected:
  Spool Make(uint64_t bound = 1 << 20) {
    return Spool(root_.Path(kDir), bound,
                 [this](int, const std::string& text) { log_.push_back(text); });
  }
  // The minutes Take gives, each then written.
  static std::vector<int64_t> Drain(Spool& spool) {
    std::vector<int64_t> minutes;
    while (auto batch = spool.Take()) {
      minutes.push_back(batch->minute);
      spool.Done(batch->minute, true);
    }
    return minutes;
  }

  kova_test::TestRoot root_;
  std::vector<std::string> log_;
};

TEST_F(SpoolTest, KeepsMinutesInOrderAcrossARestart) {
  const std::vector<MinuteRow> rows = {Row("cpu.user", 120, 0.1),
                                       {"volume.free@/volume 1", 120, 3, 1e300, -0.0, 2.5e-300}};
  {
    Spool spool = Make();
    EXPECT_EQ(spool.Restore(), 0u);
    spool.Put(180, {Row("cpu.user", 180, 5)});
    spool.Put(120, rows);
    spool.Put(60, {Row("cpu.user", 60, 1), Row("mem.used", 60, 2)});
    spool.Put(60, {Row("mem.used", 60, 7), Row("load.1", 60, 8)});  // merged into minute 60
  }
  Spool spool = Make();
  EXPECT_EQ(spool.Restore(), 3u);
  auto first = spool.Take();
  ASSERT_TRUE(first);
  EXPECT_EQ(first->minute, 60);
  EXPECT_THAT(first->rows,
              ElementsAre(Row("cpu.user", 60, 1), Row("mem.used", 60, 7), Row("load.1", 60, 8)));
  spool.Done(60, false);  // not written: it waits again
  EXPECT_EQ(spool.Take()->minute, 60);
  spool.Done(60, true);
  EXPECT_FALSE(std::filesystem::exists(root_.Path(kDir) + "/60.rows"));
  auto second = spool.Take();
  ASSERT_TRUE(second);
  EXPECT_THAT(second->rows, ElementsAre(rows[0], rows[1]));  // values exactly as put
  spool.Done(120, true);
  EXPECT_THAT(Drain(spool), ElementsAre(180));
  EXPECT_TRUE(spool.empty());
  EXPECT_EQ(spool.bytes(), 0u);
  EXPECT_THAT(log_, ElementsAre("3 minutes of history rows of an earlier run wait in the spool"));
}

TEST_F(SpoolTest, RestoreClearsWhatACrashLeftAndDropsBrokenFiles) {
  root_.Write(std::string(kDir) + "/60.rows", SpoolText(60, {Row("cpu.user", 60, 1)}));
  root_.Write(std::string(kDir) + "/120.rows", "kovastatd spool 1 120\ncpu.user\t60\t1");
  root_.Write(std::string(kDir) + "/180.rows", "kovastatd spool 1 60\n");  // another minute's
  root_.Write(std::string(kDir) + "/240.rows.tmp.Ab3dE9", "half");
  root_.Write(std::string(kDir) + "/notes.txt", "an operator's");
  Spool spool = Make();
  EXPECT_EQ(spool.Restore(), 3u);
  EXPECT_FALSE(std::filesystem::exists(root_.Path(kDir) + "/240.rows.tmp.Ab3dE9"));
  EXPECT_THAT(Drain(spool), ElementsAre(60));
  EXPECT_EQ(root_.Read(std::string(kDir) + "/notes.txt"), "an operator's");
  EXPECT_THAT(log_, ElementsAre(HasSubstr("3 minutes"), HasSubstr("120.rows is dropped: its last"),
                                HasSubstr("180.rows is dropped: it doesn't start")));
}

TEST_F(SpoolTest, DropsTheOldestPastItsBoundButNotTheOneTaken) {
  // Minutes of four digits: every file the same size.
  const uint64_t minute_bytes = SpoolText(6000, {Row("cpu.user", 6000, 1)}).size();
  Spool spool = Make(3 * minute_bytes);
  spool.Restore();
  for (int64_t minute = 6000; minute <= 6120; minute += 60) {
    spool.Put(minute, {Row("cpu.user", minute, 1)});
  }
  ASSERT_EQ(spool.Take()->minute, 6000);  // being written
  spool.Put(6180, {Row("cpu.user", 6180, 1)});
  spool.Put(6240, {Row("cpu.user", 6240, 1)});
  EXPECT_EQ(spool.size(), 3u);
  EXPECT_EQ(spool.bytes(), 3 * minute_bytes);
  spool.Done(6000, true);
  EXPECT_THAT(Drain(spool), ElementsAre(6180, 6240));
  EXPECT_THAT(log_, ElementsAre(HasSubstr("over its")));  // said once for both drops
}

TEST_F(SpoolTest, AMinuteChangedWhileBeingWrittenWaitsAgain) {
  Spool spool = Make();
  spool.Put(60, {Row("cpu.user", 60, 1)});
  ASSERT_TRUE(spool.Take());
  spool.Put(60, {Row("mem.used", 60, 2)});
  spool.Done(60, true);
  auto again = spool.Take();
  ASSERT_TRUE(again);
  EXPECT_THAT(again->rows, ElementsAre(Row("cpu.user", 60, 1), Row("mem.used", 60, 2)));
}

TEST_F(SpoolTest, KeepsMinutesInMemoryWhenTheDirectoryCantBeWritten) {
  root_.Write("/var/lib/kova/statd", "a file where the directory should be");
  Spool spool = Make();
  EXPECT_EQ(spool.Restore(), 0u);
  spool.Put(60, {Row("cpu.user", 60, 1)});
  spool.Put(120, {Row("cpu.user", 120, 2)});
  auto batch = spool.Take();
  ASSERT_TRUE(batch);
  EXPECT_THAT(batch->rows, ElementsAre(Row("cpu.user", 60, 1)));
  spool.Done(60, true);
  EXPECT_THAT(Drain(spool), ElementsAre(120));
  EXPECT_THAT(log_, ElementsAre(HasSubstr("can't make the history spool"),
                                HasSubstr("rows wait in memory")));
}

}  // namespace
}  // namespace statd
