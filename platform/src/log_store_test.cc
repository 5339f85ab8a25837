#include "src/log_store.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <sstream>
#include <string>
#include <thread>
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

std::vector<std::string> Ids(const std::vector<std::string>& lines) {
  std::vector<std::string> ids;
  for (const std::string& line : lines) ids.push_back(line.substr(0, line.find('\t')));
  return ids;
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
  EXPECT_EQ(std::string(path), root.Path("/var/log/kova/perfevent"));
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
  EXPECT_EQ(Ids(Dump(root)), (std::vector<std::string>{"3", "4", "5"}));

  ASSERT_EQ(KOVALogClean(kLogTypePerfEvent), 0);
  EXPECT_TRUE(StoreExists());
  EXPECT_EQ(Dump(root), std::vector<std::string>());
  ASSERT_EQ(KOVALogWrite(kLogTypePerfEvent, "Info", "admin", "test", "after"), 0);
  const std::vector<std::string> after = Dump(root);
  ASSERT_EQ(after.size(), 1u);
  EXPECT_EQ(after[0].substr(0, 2), "6\t");
}

// The oldest records go a segment (an eighth of the bound) at a time: the log
// holds the newest `max` records at least and one segment more at most.
TEST(LogStoreTest, DropsTheOldestWholeSegments) {
  TestRoot root;
  ASSERT_EQ(QLIBCINFOSetKeyValue(kova::kLogMaxRecordsKey, "16"), 0);
  for (int i = 1; i <= 41; ++i) {
    ASSERT_EQ(KOVALogWrite(kLogTypePerfEvent, "Info", "admin", "test", "e"), 0);
    const std::vector<std::string> ids = Ids(Dump(root));
    ASSERT_GE(ids.size(), std::min(i, 16));
    ASSERT_LE(ids.size(), 18u);
    ASSERT_EQ(ids.back(), std::to_string(i));
    ASSERT_EQ(ids.front(), std::to_string(i - static_cast<int>(ids.size()) + 1));
  }
}

// A crash in the middle of a write leaves a line without its line feed: it is
// never read, and the next write takes its place and its id.
TEST(LogStoreTest, ATornLastLineIsNeverRead) {
  TestRoot root;
  for (const char* event : {"one", "two"}) {
    ASSERT_EQ(KOVALogWrite(kLogTypePerfEvent, "Info", "admin", "test", event), 0);
  }
  const std::string segment = "/var/log/kova/perfevent/00000000000000000001.log";
  const std::string whole = root.Read(segment);
  root.Write(segment, whole + "3\tWarning\t2024/01/01 00:0", 0600);
  EXPECT_EQ(Ids(Dump(root)), (std::vector<std::string>{"1", "2"}));
  ASSERT_EQ(KOVALogWrite(kLogTypePerfEvent, "Critical", "admin", "test", "three"), 0);
  const std::vector<std::string> lines = Dump(root);
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_EQ(lines[2].substr(0, 11), "3\tCritical\t");
  EXPECT_EQ(root.Read(segment).substr(0, whole.size()), whole);
}

// A log kept by an earlier version in a database is moved into the folder the
// first time it is opened, ids, texts and the next id included.
TEST(LogStoreTest, MovesALogFromTheOldDatabase) {
  const int64_t t = 1700000000;
  const struct {
    const char* name;
    bool made_already;  // a move that ended before the database was removed
  } cases[] = {{"first open", false}, {"store made already", true}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    TestRoot root;
    ASSERT_EQ(QLIBCINFOSetKeyValue(kova::kLogMaxRecordsKey, "16"), 0);  // segments of 2
    const std::string database = root.Path("/var/log/kova/perfevent.db");
    root.Write("/var/log/kova/keep", "");
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(database.c_str(), &db), SQLITE_OK);
    const std::string sql =
        "CREATE TABLE records(id INTEGER PRIMARY KEY AUTOINCREMENT, level TEXT NOT NULL, "
        "time INTEGER NOT NULL, user TEXT NOT NULL, source TEXT NOT NULL, event TEXT NOT NULL);"
        "INSERT INTO records VALUES(5, 'Warning', " +
        std::to_string(t) +
        ", 'admin', 'd', 'a, b');"
        "INSERT INTO records VALUES(6, 'Critical', " +
        std::to_string(t + 70) +
        ", 'admin', 'd', '');"
        "INSERT INTO records VALUES(7, 'Info', " +
        std::to_string(t + 80) +
        ", 'admin', 'd', 'x\ty');"
        "INSERT INTO records VALUES(9, 'Info', " +
        std::to_string(t + 90) +
        ", 'admin', 'd', 'z');"
        "UPDATE sqlite_sequence SET seq = 12 WHERE name = 'records';";
    ASSERT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK);
    sqlite3_close(db);
    if (c.made_already) {
      char moved[4096];
      ASSERT_EQ(KOVALogFilePathGet(kLogTypePerfEvent, moved, sizeof(moved)), 0);
      root.Write("/var/log/kova/perfevent.db", "left behind");
    }
    char path[4096];
    ASSERT_EQ(KOVALogFilePathGet(kLogTypePerfEvent, path, sizeof(path)), 0);
    EXPECT_EQ(access(path, F_OK), 0);
    EXPECT_EQ(access(database.c_str(), F_OK), -1);
    EXPECT_EQ(Dump(root), (std::vector<std::string>{
                              "5\tWarning\t" + KOVALogConvertTime1(t) + "\tadmin\td\ta, b",
                              "6\tCritical\t" + KOVALogConvertTime1(t + 70) + "\tadmin\td\t",
                              "7\tInfo\t" + KOVALogConvertTime1(t + 80) + "\tadmin\td\tx\ty",
                              "9\tInfo\t" + KOVALogConvertTime1(t + 90) + "\tadmin\td\tz",
                          }));
    ASSERT_EQ(KOVALogWrite(kLogTypePerfEvent, "Info", "admin", "test", "next"), 0);
    EXPECT_EQ(Ids(Dump(root)).back(), "13");
  }
}

// Where the output can't take an in-kernel copy (a pipe), the dump goes
// through a buffer, however large the log.
TEST(LogStoreTest, DumpsToAPipe) {
  TestRoot root;
  ASSERT_EQ(QLIBCINFOSetKeyValue(kova::kLogMaxRecordsKey, "100000"), 0);
  std::vector<LogRecord> batch(30000, LogRecord{"Warning", 1700000000, "admin", "w", "e"});
  for (size_t i = 0; i < batch.size(); ++i) batch[i].event = std::string(40, 'a' + i % 26);
  ASSERT_EQ(kova::AppendLogRecords(kLogTypePerfEvent, batch), 0);
  int pipe_fds[2];
  ASSERT_EQ(pipe2(pipe_fds, O_CLOEXEC), 0);
  std::string piped;
  std::thread reader([&] {
    char buffer[1 << 16];
    for (ssize_t got; (got = read(pipe_fds[0], buffer, sizeof(buffer))) > 0;)
      piped.append(buffer, got);
  });
  EXPECT_EQ(kova::DumpLogRecords(kLogTypePerfEvent, pipe_fds[1]), 0);
  close(pipe_fds[1]);
  reader.join();
  close(pipe_fds[0]);
  KOVALogGet1(kLogTypePerfEvent, root.Path("/tmp/dump").c_str(), "enu");
  EXPECT_GT(piped.size(), 1u << 20);
  EXPECT_EQ(piped, root.Read("/tmp/dump"));
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

// A reader during writes from two other processes sees every batch whole and
// the ids in order without a gap; the writers never share an id.
TEST(LogStoreTest, ReaderDuringWritesSeesWholeBatches) {
  TestRoot root;
  ASSERT_EQ(QLIBCINFOSetKeyValue(kova::kLogMaxRecordsKey, "100000"), 0);
  ASSERT_EQ(KOVALogWrite(kLogTypePerfEvent, "Info", "admin", "test", "first"), 0);
  constexpr int kBatches = 100;
  constexpr int kBatch = 10;
  pid_t writers[2];
  for (pid_t& writer : writers) {
    writer = fork();
    if (writer == 0) {
      for (int b = 0; b < kBatches; ++b) {
        std::vector<LogRecord> batch(kBatch,
                                     LogRecord{"Warning", 1700000000 + b, "admin", "w", "e"});
        if (kova::AppendLogRecords(kLogTypePerfEvent, batch) != 0) _exit(1);
      }
      _exit(0);
    }
  }
  size_t dumps = 0;
  for (int running = 2; running > 0; ++dumps) {
    const std::vector<std::string> lines = Dump(root);
    ASSERT_EQ((lines.size() - 1) % kBatch, 0u) << "a batch seen in part";
    for (size_t i = 0; i < lines.size(); ++i) {
      ASSERT_EQ(lines[i].substr(0, lines[i].find('\t')), std::to_string(i + 1));
    }
    for (pid_t& writer : writers) {
      int status;
      if (writer > 0 && waitpid(writer, &status, WNOHANG) == writer) {
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
        writer = -1;
        --running;
      }
    }
  }
  EXPECT_GT(dumps, 1u);
  EXPECT_EQ(Dump(root).size(), 1u + 2 * kBatches * kBatch);
}

}  // namespace
