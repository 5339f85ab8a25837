#include "perfeventd/daemon.h"

#include <errno.h>
#include <signal.h>
#include <syslog.h>
#include <unistd.h>

#include <cmath>
#include <ctime>
#include <set>
#include <string>
#include <vector>

#include "perfeventd/event_queue.h"
#include "perfeventd/monitor.h"
#include "perfeventd/rule_loader.h"
#include "sampling/measurements.h"
#include "sampling/object_directory.h"
#include "sampling/proc_reader.h"
#include "src/system_root.h"

namespace perfeventd {

using sampling::Measurements;
using sampling::ProcReader;
using sampling::Snapshot;
using sampling::SystemDirectory;
namespace {

constexpr char kSpillPath[] = "/var/lib/kova/perfevent/waiting_events";
constexpr size_t kQueueCapacity = 10000;

double Now() {
  timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

void Log(int priority, const std::string& text) { syslog(priority, "%s", text.c_str()); }

sigset_t HeldSignals() {
  sigset_t signals;
  sigemptyset(&signals);
  for (int number : {SIGTERM, SIGINT, SIGHUP}) sigaddset(&signals, number);
  return signals;
}

// The loop's state between cycles.
class Daemon {
 public:
  explicit Daemon(const Options& options)
      : options_(options),
        monitor_(directory_, Log),
        reader_(options.proc_dir, options.sys_dir),
        measurements_(static_cast<uint64_t>(sysconf(_SC_PAGESIZE)) / 1024),
        queue_(kova::RootPath(kSpillPath), kQueueCapacity, Log) {}

  int Run() {
    // The signals are taken synchronously, between cycles.
    const sigset_t signals = HeldSignals();
    sigprocmask(SIG_BLOCK, &signals, nullptr);
    signal(SIGPIPE, SIG_IGN);
    Log(LOG_INFO, "started");
    queue_.Restore();
    bool reload = true;
    double next = Now();
    for (;;) {
      if (reload) reload = !Reload();
      const double wait = next - Now();
      if (wait > 0) {
        timespec timeout;
        timeout.tv_sec = static_cast<time_t>(wait);
        timeout.tv_nsec = static_cast<long>((wait - static_cast<double>(timeout.tv_sec)) * 1e9);
        const int got = sigtimedwait(&signals, nullptr, &timeout);
        if (got == SIGTERM || got == SIGINT) break;
        if (got == SIGHUP) reload = true;
        if (got >= 0 || errno == EINTR) continue;  // a signal, or interrupted: wait on
      }
      if (!reload && watch_.Changed()) reload = !Reload();
      Cycle();
      // A late cycle doesn't make up for the missed ones.
      next = std::max(next + monitor_.CycleSeconds() * options_.time_scale, Now());
    }
    queue_.Flush();  // what still fails stays in the file for the next start
    Log(LOG_INFO, "stopped");
    return 0;
  }

 private:
  // Reads the rules; false, with the rules before kept, when the store can't be read.
  bool Reload() {
    std::vector<Rule> rules;
    if (!LoadEnabledRules(rules)) {
      if (!store_failing_) {
        Log(LOG_ERR, "can't read the rule store; the rules read before stay, retried each cycle");
      }
      store_failing_ = true;
      return false;
    }
    if (store_failing_) Log(LOG_INFO, "the rule store is read again");
    store_failing_ = false;
    watch_.Mark();
    monitor_.SetRules(rules);
    Log(LOG_INFO, std::to_string(rules.size()) + " enabled rules, a cycle every " +
                      std::to_string(monitor_.CycleSeconds()) + " s");
    return true;
  }

  void Cycle() {
    Snapshot snapshot = reader_.Read(monitor_.Needs());
    // An unreadable file is said once, and again only after it was read.
    std::set<std::string> unreadable(snapshot.unreadable.begin(), snapshot.unreadable.end());
    for (const std::string& path : unreadable) {
      if (!unreadable_.count(path)) Log(LOG_WARNING, "can't read " + path);
    }
    unreadable_ = std::move(unreadable);
    measurements_.Advance(std::move(snapshot));
    queue_.Add(monitor_.Cycle(measurements_, time(nullptr)));
    queue_.Flush();
  }

  const Options& options_;
  SystemDirectory directory_;
  Monitor monitor_;
  ProcReader reader_;
  Measurements measurements_;
  EventQueue queue_;
  StoreWatch watch_;
  bool store_failing_ = false;
  std::set<std::string> unreadable_;
};

}  // namespace

void BlockSignals() {
  const sigset_t signals = HeldSignals();
  sigprocmask(SIG_BLOCK, &signals, nullptr);
}

int RunDaemon(const Options& options) {
  openlog("kovaperfeventd", LOG_PID | (options.log_to_stderr ? LOG_PERROR : 0), LOG_DAEMON);
  const int status = Daemon(options).Run();
  closelog();
  return status;
}

}  // namespace perfeventd
