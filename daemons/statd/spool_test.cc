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
  Spool Make(int64_t run = 7, uint64_t bound = 1 << 20) {
    return Spool(root_.Path(kDir), bound, run,
                 [this](int, const std::string& text) { log_.push_back(text); });
  }
  // The batches Take gives, each then written: "minute run seq".
  static std::vector<std::string> Drain(Spool& spool) {
    std::vector<std::string> ids;
    while (auto batch = spool.Take()) {
      ids.push_back(std::to_string(batch->id.minute) + " " + std::to_string(batch->id.run) + " " +
                    std::to_string(batch->id.seq));
      spool.Done(batch->id, true);
    }
    return ids;
  }

  kova_test::TestRoot root_;
  std::vector<std::string> log_;
};

TEST_F(SpoolTest, KeepsBatchesInOrderAcrossARestart) {
  const std::vector<MinuteRow> rows = {Row("mem.used", 60, 0.1),
                                       {"volume.free@/volume 1", 60, 3, 1e300, -0.0, 2.5e-300}};
  {
    Spool spool = Make(7);
    EXPECT_EQ(spool.Restore(), 0u);
    spool.Put(180, {Row("cpu.user", 180, 5)});
    spool.Put(120, {Row("cpu.user", 120, 4)});
    spool.Put(60, {Row("cpu.user", 60, 1), Row("mem.used", 60, 2)});
    spool.Put(60, rows);  // a batch of its own, never merged
  }
  // A file of an older version, named by its minute alone.
  root_.Write(std::string(kDir) + "/60.rows", SpoolText(60, {Row("load.1", 60, 8)}));
  Spool spool = Make(9);
  EXPECT_EQ(spool.Restore(), 5u);
  spool.Put(60, {Row("cpu.user", 60, 3)});  // the rest of minute 60, in the next run
  auto first = spool.Take();
  ASSERT_TRUE(first);
  EXPECT_EQ(first->id, (BatchId{60, 0, 0}));
  EXPECT_THAT(first->rows, ElementsAre(Row("load.1", 60, 8)));
  spool.Done(first->id, false);  // not written: it waits again
  EXPECT_EQ(spool.Take()->id, first->id);
  spool.Done(first->id, true);
  EXPECT_FALSE(std::filesystem::exists(root_.Path(kDir) + "/60.rows"));
  auto second = spool.Take();
  ASSERT_TRUE(second);
  EXPECT_EQ(second->id, (BatchId{60, 7, 2}));
  EXPECT_THAT(second->rows, ElementsAre(Row("cpu.user", 60, 1), Row("mem.used", 60, 2)));
  spool.Done(second->id, true);
  EXPECT_FALSE(std::filesystem::exists(root_.Path(kDir) + "/60_7_2.rows"));
  auto third = spool.Take();
  ASSERT_TRUE(third);
  EXPECT_THAT(third->rows, ElementsAre(rows[0], rows[1]));  // values exactly as put
  spool.Done(third->id, true);
  EXPECT_THAT(Drain(spool), ElementsAre("60 9 0", "120 7 1", "180 7 0"));
  EXPECT_TRUE(spool.empty());
  EXPECT_EQ(spool.bytes(), 0u);
  EXPECT_THAT(log_, ElementsAre("5 batches of history rows of an earlier run wait in the spool"));
}

TEST_F(SpoolTest, RestoreClearsWhatACrashLeftAndDropsBrokenFiles) {
  root_.Write(std::string(kDir) + "/60_3_0.rows", SpoolText(60, {Row("cpu.user", 60, 1)}));
  root_.Write(std::string(kDir) + "/120_3_1.rows", "kovastatd spool 1 120\ncpu.user\t60\t1");
  root_.Write(std::string(kDir) + "/180.rows", "kovastatd spool 1 60\n");  // another minute's
  root_.Write(std::string(kDir) + "/240_3_2.rows.tmp.Ab3dE9", "half");
  // Names no spool writes: left alone.
  for (const char* name : {"notes.txt", "060_3_0.rows", "60_0_0.rows", "60_-3_0.rows", "60_3.rows",
                           "60_3_0_1.rows", ".rows"}) {
    root_.Write(std::string(kDir) + "/" + name, "an operator's");
  }
  Spool spool = Make();
  EXPECT_EQ(spool.Restore(), 3u);
  EXPECT_FALSE(std::filesystem::exists(root_.Path(kDir) + "/240_3_2.rows.tmp.Ab3dE9"));
  EXPECT_THAT(Drain(spool), ElementsAre("60 3 0"));
  EXPECT_EQ(root_.Read(std::string(kDir) + "/060_3_0.rows"), "an operator's");
  EXPECT_THAT(log_,
              ElementsAre(HasSubstr("3 batches"), HasSubstr("120_3_1.rows is dropped: its last"),
                          HasSubstr("180.rows is dropped: it doesn't start")));
}

TEST_F(SpoolTest, DropsTheOldestPastItsBoundButNotTheOneTaken) {
  // Minutes of four digits: every file the same size.
  const uint64_t batch_bytes = SpoolText(6000, {Row("cpu.user", 6000, 1)}).size();
  Spool spool = Make(7, 3 * batch_bytes);
  spool.Restore();
  for (int64_t minute = 6000; minute <= 6120; minute += 60) {
    spool.Put(minute, {Row("cpu.user", minute, 1)});
  }
  const auto taken = spool.Take();  // being written
  ASSERT_EQ(taken->id.minute, 6000);
  spool.Put(6180, {Row("cpu.user", 6180, 1)});
  spool.Put(6240, {Row("cpu.user", 6240, 1)});
  EXPECT_EQ(spool.size(), 3u);
  EXPECT_EQ(spool.bytes(), 3 * batch_bytes);
  spool.Done(taken->id, true);
  EXPECT_THAT(Drain(spool), ElementsAre("6180 7 3", "6240 7 4"));
  EXPECT_THAT(log_, ElementsAre(HasSubstr("over its")));  // said once for both drops
}

TEST_F(SpoolTest, AMinutePutWhileOneIsTakenIsABatchOfItsOwn) {
  Spool spool = Make();
  spool.Put(60, {Row("cpu.user", 60, 1)});
  const auto taken = spool.Take();
  ASSERT_TRUE(taken);
  spool.Put(60, {Row("mem.used", 60, 2)});
  spool.Done(taken->id, true);
  auto again = spool.Take();
  ASSERT_TRUE(again);
  EXPECT_EQ(again->id, (BatchId{60, 7, 1}));
  EXPECT_THAT(again->rows, ElementsAre(Row("mem.used", 60, 2)));
}

TEST_F(SpoolTest, KeepsBatchesInMemoryWhenTheDirectoryCantBeWritten) {
  root_.Write("/var/lib/kova/statd", "a file where the directory should be");
  Spool spool = Make();
  EXPECT_EQ(spool.Restore(), 0u);
  spool.Put(60, {Row("cpu.user", 60, 1)});
  spool.Put(120, {Row("cpu.user", 120, 2)});
  auto batch = spool.Take();
  ASSERT_TRUE(batch);
  EXPECT_THAT(batch->rows, ElementsAre(Row("cpu.user", 60, 1)));
  spool.Done(batch->id, true);
  EXPECT_THAT(Drain(spool), ElementsAre("120 7 1"));
  EXPECT_THAT(log_, ElementsAre(HasSubstr("can't make the history spool"),
                                HasSubstr("rows wait in memory")));
}

}  // namespace
}  // namespace statd
