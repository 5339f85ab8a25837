#include "src/log_store.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <sstream>
#include <string>
#include <vector>

#include "kova/conf.h"
#include "kova/error.h"
#include "kova/log.h"
#include "test_support/test_root.h"

namespace {

using kova::LogRecord;
using kova_test::TestRoot;

// The lines that KOVALogGet1 writes for the performance-event log.
std::vector<std::string> Dump(const TestRoot& root) {
  const std::string out = root.Path("/tmp/dump");
  EXPECT_EQ(KOVALogGet1(kLogTypePerfEvent, out.c_str(), "enu"), 0);
  std::istringstream text(root.Read("/tmp/dump"));
  std::vector<std::string> lines;
  for (std::string line; std::getline(text, line);) lines.push_back(line);
  return lines;
}

bool StoreExists() {
  char path[4096];
  return KOVALogFilePathGet(kLogTypePerfEvent, path, sizeof(path)) == 0 && access(path, F_OK) == 0;
}

TEST(LogStoreTest, DumpsOneLineOfSixFieldsPerRecord) {
  TestRoot root;
  const int64_t t = 1700000000;
  ASSERT_EQ(kova::AppendLogRecords(kLogTypePerfEvent,
                                   {{"Warning", t, "admin", "kovaperfeventd", "CPU\tat 95%"},
                                    {"Critical", t + 61, "ad\tmin", "src\n", "two\nlines\r"},
                                    {"Info", t + 3600, "system", "kova", ""}}),
            0);
  EXPECT_EQ(Dump(root),
            (std::vector<std::string>{
                "1\tWarning\t" + KOVALogConvertTime1(t) + "\tadmin\tkovaperfeventd\tCPU\tat 95%",
                "2\tCritical\t" + KOVALogConvertTime1(t + 61) + "\tad min\tsrc \ttwo lines ",
                "3\tInfo\t" + KOVALogConvertTime1(t + 3600) + "\tsystem\tkova\t",
            }));
}

TEST(LogStoreTest, ALogNeverWrittenHasNoFile) {
  TestRoot root;
  char path[4096];
  ASSERT_EQ(KOVALogFilePathGet(kLogTypePerfEvent, path, sizeof(path)), 0);
  EXPECT_EQ(std::string(path), root.Path("/var/log/kova/perfevent.db"));
  EXPECT_EQ(KOVALogFilePathGet(kLogTypePerfEvent, path, 8), -1);
  EXPECT_EQ(KOVALogFilePathGet(3, path, sizeof(path)), -1);
  EXPECT_EQ(Dump(root), std::vector<std::string>());
  EXPECT_EQ(KOVALogClean(kLogTypePerfEvent), 0);
  EXPECT_FALSE(StoreExists());

  const struct {
    const char* level;
    const char* user;
    const char* source;
  } refused[] = {{"warning", "admin", "s"},
                 {"Warning", "", "s"},
                 {"Info", "admin", ""},
                 {nullptr, "admin", "s"}};
  for (const auto& c : refused) {
    EXPECT_EQ(KOVALogWrite(kLogTypePerfEvent, c.level, c.user, c.source, "event"), -1);
    EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_INVALID);
  }
  EXPECT_EQ(KOVALogWrite(5, "Info", "admin", "s", "event"), -1);
  EXPECT_FALSE(StoreExists());
  EXPECT_EQ(KOVALogGet1(3, root.Path("/tmp/x").c_str(), "enu"), -1);
}

TEST(LogStoreTest, KeepsTheNewestRecordsAndNeverReusesIds) {
  TestRoot root;
  ASSERT_EQ(QLIBCINFOSetKeyValue(kova::kLogMaxRecordsKey, "3"), 0);
  for (int i = 1; i <= 5; ++i) {
    ASSERT_EQ(KOVALogWrite(kLogTypePerfEvent, "Info", "admin", "test", std::to_string(i).c_str()),
              0);
  }
  std::vector<std::string> ids;
  for (const std::string& line : Dump(root)) ids.push_back(line.substr(0, line.find('\t')));
  EXPECT_EQ(ids, (std::vector<std::string>{"3", "4", "5"}));

  ASSERT_EQ(KOVALogClean(kLogTypePerfEvent), 0);
  EXPECT_TRUE(StoreExists());
  EXPECT_EQ(Dump(root), std::vector<std::string>());
  ASSERT_EQ(KOVALogWrite(kLogTypePerfEvent, "Info", "admin", "test", "after"), 0);
  const std::vector<std::string> after = Dump(root);
  ASSERT_EQ(after.size(), 1u);
  EXPECT_EQ(after[0].substr(0, 2), "6\t");
}

TEST(LogStoreTest, NeverWritesThroughALink) {
  TestRoot root;
  root.Write("/etc/target", "keep");
  ASSERT_EQ(symlink(root.Path("/etc/target").c_str(), root.Path("/tmp/planted").c_str()), 0);
  EXPECT_EQ(KOVALogGet1(kLogTypePerfEvent, root.Path("/tmp/planted").c_str(), "enu"), -1);
  EXPECT_EQ(root.Read("/etc/target"), "keep");
}

// Converting once per minute gives the same texts as converting each time,
// across daylight-saving changes and offsets that are not whole hours or minutes.
TEST(LogStoreTest, TimeFormatterAgreesWithTheTimeText) {
  const struct {
    const char* zone;
    int64_t from;
  } cases[] = {
      {"Europe/Berlin", 1711846800 - 600},      // spring forward
      {"Europe/Berlin", 1729990800 - 600},      // fall back
      {"Asia/Kolkata", 1700000000},             // +05:30
      {"Australia/Eucla", 1700000000},          // +08:45
      {"Europe/Amsterdam", -1700000000 - 300},  // +00:19:32 local mean time
      {"UTC", 0},
  };
  const char* saved = getenv("TZ");
  const std::string old = saved != nullptr ? saved : "";
  for (const auto& c : cases) {
    setenv("TZ", c.zone, 1);
    tzset();
    kova::LogTimeFormatter formatter;
    for (int64_t t = c.from; t < c.from + 1200; t += 7) {
      char text[32];
      formatter.Format(t, text);
      ASSERT_EQ(text, KOVALogConvertTime1(t)) << c.zone << " " << t;
    }
  }
  if (saved != nullptr) {
    setenv("TZ", old.c_str(), 1);
  } else {
    unsetenv("TZ");
  }
  tzset();
}

// A reader during writes from another process sees every committed record, in
// order, and nothing half written.
TEST(LogStoreTest, ReaderDuringWritesSeesWholeTransactions) {
  TestRoot root;
  ASSERT_EQ(KOVALogWrite(kLogTypePerfEvent, "Info", "admin", "test", "first"), 0);
  constexpr int kBatches = 100;
  constexpr int kBatch = 10;
  const pid_t writer = fork();
  if (writer == 0) {
    for (int b = 0; b < kBatches; ++b) {
      std::vector<LogRecord> batch(kBatch, LogRecord{"Warning", 1700000000 + b, "admin", "w", "e"});
      if (kova::AppendLogRecords(kLogTypePerfEvent, batch) != 0) _exit(1);
    }
    _exit(0);
  }
  int status = -1;
  size_t dumps = 0;
  while (waitpid(writer, &status, WNOHANG) == 0) {
    const std::vector<std::string> lines = Dump(root);
    ASSERT_EQ((lines.size() - 1) % kBatch, 0u) << "a transaction seen in part";
    for (size_t i = 0; i < lines.size(); ++i) {
      ASSERT_EQ(lines[i].substr(0, lines[i].find('\t')), std::to_string(i + 1));
    }
    ++dumps;
  }
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_GT(dumps, 0u);
  EXPECT_EQ(Dump(root).size(), 1u + kBatches * kBatch);
}

}  // namespace
