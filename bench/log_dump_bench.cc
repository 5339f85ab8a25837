// Dumping a log of 10^6 records: KOVALogGet1 against the sqlite3 command-line
// shell printing the same table, tab-separated, into a file.

#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <ftw.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "kova/conf.h"
#include "kova/log.h"
#include "src/log_store.h"
#include "src/system_root.h"

extern char** environ;

namespace {

constexpr int kRecords = 1000000;

// A system root holding a performance-event log of kRecords records, one every
// three seconds, removed when the program ends.
class LogFixture {
 public:
  LogFixture() {
    char pattern[] = "/tmp/kova_bench.XXXXXX";
    if (mkdtemp(pattern) == nullptr) return;
    root_ = pattern;
    setenv("KOVA_ROOT", root_.c_str(), 1);
    kova::MakeDirectories(root_ + "/tmp", 0755);
    QLIBCINFOSetKeyValue(kova::kLogMaxRecordsKey, std::to_string(kRecords).c_str());
    const char* levels[] = {kLogLevelWarning, kLogLevelCritical};
    const char* services[] = {"smb", "nfs", "pgsql", "web", "iscsi"};
    std::vector<kova::LogRecord> batch;
    for (int i = 0; i < kRecords; ++i) {
      batch.push_back({levels[i % 2], 1700000000 + 3LL * i, "system", "kovaperfeventd",
                       std::string("CPU usage of service ") + services[i % 5] + " reached " +
                           std::to_string(80 + i % 20) + "% for 30 seconds"});
      if (batch.size() == 100000) {
        ready_ = kova::AppendLogRecords(kLogTypePerfEvent, batch) == 0;
        if (!ready_) return;
        batch.clear();
      }
    }
    char path[4096];
    ready_ = ready_ && KOVALogFilePathGet(kLogTypePerfEvent, path, sizeof(path)) == 0;
    store_ = path;
  }
  ~LogFixture() {
    if (root_.empty()) return;
    nftw(
        root_.c_str(), [](const char* file, const struct stat*, int, FTW*) { return remove(file); },
        16, FTW_DEPTH | FTW_PHYS);
  }

  bool ready() const { return ready_; }
  const std::string& store() const { return store_; }
  std::string Output(const char* name) const { return root_ + "/tmp/" + name; }

 private:
  std::string root_;
  std::string store_;
  bool ready_ = false;
};

LogFixture& Fixture() {
  static LogFixture fixture;
  return fixture;
}

long Lines(const std::string& path) {
  FILE* file = fopen(path.c_str(), "r");
  if (file == nullptr) return -1;
  long lines = 0;
  for (int c; (c = getc(file)) != EOF;) lines += c == '\n';
  fclose(file);
  return lines;
}

void BM_KOVALogGet1(benchmark::State& state) {
  if (!Fixture().ready()) return state.SkipWithError("no log");
  const std::string out = Fixture().Output("kova.txt");
  for (auto _ : state) {
    if (KOVALogGet1(kLogTypePerfEvent, out.c_str(), "enu") != 0) {
      return state.SkipWithError("KOVALogGet1 failed");
    }
  }
  if (Lines(out) != kRecords) state.SkipWithError("wrong number of lines");
}

// sqlite3 -separator "<tab>" STORE "SELECT * FROM records" > FILE
void BM_Sqlite3Shell(benchmark::State& state) {
  if (!Fixture().ready()) return state.SkipWithError("no log");
  const std::string out = Fixture().Output("sqlite3.txt");
  std::string separator = "\t";
  std::vector<std::string> args = {"sqlite3", "-separator", separator, Fixture().store(),
                                   "SELECT * FROM records"};
  std::vector<char*> argv;
  for (std::string& arg : args) argv.push_back(arg.data());
  argv.push_back(nullptr);
  for (auto _ : state) {
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, out.c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC, 0600);
    pid_t pid;
    int status = -1;
    const bool ran = posix_spawnp(&pid, "sqlite3", &actions, nullptr, argv.data(), environ) == 0 &&
                     waitpid(pid, &status, 0) == pid && WIFEXITED(status) &&
                     WEXITSTATUS(status) == 0;
    posix_spawn_file_actions_destroy(&actions);
    if (!ran) return state.SkipWithError("sqlite3 failed");
  }
  if (Lines(out) != kRecords) state.SkipWithError("wrong number of lines");
}

BENCHMARK(BM_KOVALogGet1)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(5);
BENCHMARK(BM_Sqlite3Shell)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(5);

}  // namespace

BENCHMARK_MAIN();
