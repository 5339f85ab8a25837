// log_fill COUNT: appends COUNT records to the performance-event log of the
// system under $KOVA_ROOT, one every three seconds up to now, in batches of
// 10,000 through the platform's own batch append (the one kovaperfeventd uses).
// One `kova log write` a record costs a process and a transaction each: about
// 3 ms, five minutes for 10^5 records; this takes well under a second.

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>
#include <vector>

#include "kova/log.h"
#include "src/log_store.h"

int main(int argc, char** argv) {
  char* end = nullptr;
  const long count = argc == 2 ? strtol(argv[1], &end, 10) : 0;
  if (argc != 2 || *end != '\0' || count <= 0) {
    fprintf(stderr, "usage: log_fill COUNT\n");
    return 2;
  }
  const char* levels[] = {kLogLevelWarning, kLogLevelCritical};
  const char* services[] = {"smb", "nfs", "pgsql", "web", "iscsi"};
  const long long first = static_cast<long long>(time(nullptr)) - 3LL * (count - 1);
  std::vector<kova::LogRecord> batch;
  for (long i = 0; i < count; ++i) {
    batch.push_back({levels[i % 2], first + 3LL * i, "system", "kovaperfeventd",
                     std::string("CPU usage of service ") + services[i % 5] + " reached " +
                         std::to_string(80 + i % 20) + "% for 30 seconds"});
    if (batch.size() == 10000 || i == count - 1) {
      if (kova::AppendLogRecords(kLogTypePerfEvent, batch) != 0) {
        fprintf(stderr, "log_fill: cannot append to the log\n");
        return 1;
      }
      batch.clear();
    }
  }
  return 0;
}
