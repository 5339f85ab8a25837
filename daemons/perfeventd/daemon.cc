#include "perfeventd/daemon.h"

#include <curl/curl.h>
#include <errno.h>
#include <signal.h>
#include <syslog.h>
#include <unistd.h>

#include <cmath>
#include <ctime>
#include <set>
#include <string>
#include <vector>

#include "kova/conf.h"
#include "perfeventd/alert_poster.h"
#include "perfeventd/alerts.h"
#include "perfeventd/event_queue.h"
#include "perfeventd/monitor.h"
#include "perfeventd/rule_loader.h"
#include "perfeventd/state_file.h"
#include "sampling/measurements.h"
#include "sampling/object_directory.h"
#include "sampling/proc_reader.h"
#include "src/conf_file.h"
#include "src/file_stamp.h"
#include "src/system_root.h"

namespace perfeventd {

using sampling::Measurements;
using sampling::ProcReader;
using sampling::Snapshot;
using sampling::SystemDirectory;
namespace {

constexpr char kSpillPath[] = "/var/lib/kova/perfevent/waiting_events";
constexpr size_t kQueueCapacity = 10000;
constexpr char kStatePath[] = "/run/kova/perfeventd.state";
// The settings of kovainfo.conf that the daemon reads: where alerts go, and
// the instance label they carry (the host name when empty).
constexpr char kAlertmanagerUrlsKey[] = "perfevent_alertmanager_urls";
constexpr char kAlertInstanceKey[] = "perfevent_alert_instance";
// Alertmanager times out an alert not heard of for its resolve_timeout (5
// minutes by default): a firing alert is posted again every minute.
constexpr double kResendSeconds = 60;

std::string HostName() {
  char name[256] = "";
  if (gethostname(name, sizeof(name) - 1) != 0) return "localhost";
  return name;
}

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
        queue_(kova::RootPath(kSpillPath), kQueueCapacity, Log),
        book_(kResendSeconds * options.time_scale),
        poster_(Log, CurlPost, OutboxLimits{}),
        state_(kova::RootPath(kStatePath), Log) {}

  int Run() {
    // The signals are taken synchronously, between cycles.
    const sigset_t signals = HeldSignals();
    sigprocmask(SIG_BLOCK, &signals, nullptr);
    signal(SIGPIPE, SIG_IGN);
    Log(LOG_INFO, "started");
    queue_.Restore();
    ReadSettings();
    PublishState();
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
        if (got == SIGHUP) {
          ReadSettings();
          reload = true;
        }
        if (got >= 0 || errno == EINTR) continue;  // a signal, or interrupted: wait on
      }
      if (!reload && watch_.Changed()) reload = !Reload();
      Cycle();
      // A late cycle doesn't make up for the missed ones.
      next = std::max(next + monitor_.CycleSeconds() * options_.time_scale, Now());
    }
    queue_.Flush();  // what still fails stays in the file for the next start
    // Alerts still firing are not resolved: Alertmanager times them out once
    // they are no longer posted again, and a daemon started again in time
    // posts the same alert anew.
    poster_.SetUrls({});
    state_.Remove();
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
    const int64_t now = time(nullptr);
    const std::vector<Event> events = monitor_.Cycle(measurements_, now);
    counts_.Count(events);
    const std::vector<Firing> firings = monitor_.Firings();
    std::set<std::string> firing_ids;
    for (const Firing& firing : firings) firing_ids.insert(firing.rule_id);
    queue_.Add(events);
    queue_.Flush();
    state_.Publish(StateText(counts_, firings));
    // Logged first: an alert's text is the event's as logged.
    book_.Take(events);
    book_.KeepOnly(firing_ids, now);
    poster_.Post(book_.Due(Now()));
  }

  void PublishState() { state_.Publish(StateText(counts_, monitor_.Firings())); }

  // Reads where alerts go from the settings file; said in the system log when
  // it changed. An unreadable file keeps the settings read before.
  void ReadSettings() {
    const std::string path = kova::RootPath(kKovaInfoConf);
    std::string urls, instance;
    if (kova::ConfRead(path, kAlertmanagerUrlsKey, urls) < 0 ||
        kova::ConfRead(path, kAlertInstanceKey, instance) < 0) {
      Log(LOG_ERR, "can't read " + path + "; the alert settings read before stay");
      return;
    }
    if (instance.empty()) instance = HostName();
    book_.SetInstance(instance);
    if (urls == alert_urls_setting_) return;
    alert_urls_setting_ = urls;
    std::vector<std::string> refused;
    const std::vector<std::string> endpoints = AlertmanagerEndpoints(urls, refused);
    for (const std::string& url : refused) {
      Log(LOG_ERR, std::string(kAlertmanagerUrlsKey) + ": \"" + UrlForLog(url) +
                       "\" is not an http:// or https:// URL; ignored");
    }
    poster_.SetUrls(endpoints);
    std::string list;
    for (const std::string& endpoint : endpoints)
      list += (list.empty() ? "" : ", ") + UrlForLog(endpoint);
    Log(LOG_INFO, endpoints.empty() ? "alerts are posted nowhere" : "alerts are posted to " + list);
  }

  const Options& options_;
  SystemDirectory directory_;
  Monitor monitor_;
  ProcReader reader_;
  Measurements measurements_;
  EventQueue queue_;
  StoreWatch watch_;
  AlertBook book_;
  AlertPoster poster_;
  StateFile state_;
  EventCounts counts_;
  std::string alert_urls_setting_;
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
  // Before any thread: libcurl's global setup is not thread-safe.
  if (curl_global_init(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
    Log(LOG_ERR, "can't set up libcurl; stopped");
    closelog();
    return 1;
  }
  const int status = Daemon(options).Run();
  curl_global_cleanup();
  closelog();
  return status;
}

}  // namespace perfeventd
