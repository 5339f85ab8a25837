#include "statd/daemon.h"

#include <errno.h>
#include <signal.h>
#include <syslog.h>

#include <cmath>
#include <cstring>
#include <ctime>
#include <memory>
#include <set>
#include <string>

#include "kova/conf.h"
#include "kova/statistics.h"
#include "src/atomic_file.h"
#include "src/file_stamp.h"
#include "src/system_root.h"
#include "statd/collector.h"
#include "statd/metrics_server.h"
#include "statd/metrics_text.h"
#include "statd/perf_state.h"
#include "statd/pg_history.h"
#include "statd/protocol.h"
#include "statd/sampler.h"
#include "statd/schedule.h"
#include "statd/socket_server.h"

namespace statd {
namespace {

constexpr char kSpoolDir[] = "/var/lib/kova/statd/spool";
constexpr char kPerfStateFile[] = "/run/kova/perfeventd.state";

void Log(int priority, const std::string& text) { syslog(priority, "%s", text.c_str()); }

sigset_t HeldSignals() {
  sigset_t signals;
  sigemptyset(&signals);
  for (int number : {SIGTERM, SIGINT, SIGHUP}) sigaddset(&signals, number);
  return signals;
}

double Seconds(clockid_t clock) {
  timespec now;
  clock_gettime(clock, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

// The collector's clock: Unix time, running 1/scale times as fast as the real
// one from the start, so that tests can pass minutes in seconds.
class ScaledClock {
 public:
  explicit ScaledClock(double scale)
      : scale_(scale),
        start_(Seconds(CLOCK_REALTIME)),
        start_monotonic_(Seconds(CLOCK_MONOTONIC)) {}

  double Now() const {
    if (scale_ == 1) return Seconds(CLOCK_REALTIME);
    return start_ + (Seconds(CLOCK_MONOTONIC) - start_monotonic_) / scale_;
  }
  // Real seconds until the clock shows `time`.
  double RealUntil(double time) const { return (time - Now()) * scale_; }

 private:
  double scale_;
  double start_;
  double start_monotonic_;
};

std::string DefaultDatabase() {
  return "host=" + kova::RootPath("/run/pgsql") + " user=kova dbname=kova_history";
}

// The token in the file `path`, its line end left out. False with `error`
// when the file can't be read or holds no token.
bool ReadToken(const std::string& path, std::string& token, std::string& error) {
  std::string text;
  if (!kova::ReadWholeFile(path, text)) {
    error = "can't read the token file " + path + ": " + strerror(errno);
    return false;
  }
  while (!text.empty() && (text.back() == '\n' || text.back() == '\r')) text.pop_back();
  if (text.empty()) {
    error = "the token file " + path + " is empty";
    return false;
  }
  token = std::move(text);
  return true;
}

// Serves the metrics as `options` (first) and `settings` say: on the address
// asked, with the token of the file asked. A token file that can't be read
// stops the endpoint rather than leave it open.
void ConfigureMetrics(MetricsServer& server, const Options& options, const Settings& settings,
                      std::string& listening) {
  const std::string listen = options.metrics_listen.value_or(settings.metrics_listen);
  // The settings name a file of the system, under its root; the option a real path.
  const std::string token_file = options.metrics_token_file ? *options.metrics_token_file
                                 : settings.metrics_token_file.empty()
                                     ? ""
                                     : kova::RootPath(settings.metrics_token_file);
  std::string token;
  std::string error;
  if (!listen.empty() && !token_file.empty() && !ReadToken(token_file, token, error)) {
    Log(LOG_ERR, "metrics not served: " + error);
  }
  if (listen.empty() || !error.empty()) {
    if (server.running()) Log(LOG_INFO, "metrics endpoint closed");
    server.Stop();
    listening.clear();
    return;
  }
  server.SetToken(token);
  if (server.running() && listen == listening) return;
  if (!server.Start(listen, error)) {
    Log(LOG_ERR, "metrics not served: " + error);
    listening.clear();
    return;
  }
  listening = listen;
  Log(LOG_INFO, "metrics on http://" + server.bound() + "/metrics" +
                    (token.empty() ? "" : ", a bearer token asked"));
}

}  // namespace

void BlockSignals() {
  const sigset_t signals = HeldSignals();
  sigprocmask(SIG_BLOCK, &signals, nullptr);
}

int RunDaemon(const Options& options) {
  openlog("kovastatd", LOG_PID | (options.log_to_stderr ? LOG_PERROR : 0), LOG_DAEMON);
  signal(SIGPIPE, SIG_IGN);
  const sigset_t signals = HeldSignals();
  sigprocmask(SIG_BLOCK, &signals, nullptr);

  const ScaledClock clock(options.time_scale);
  PgHistoryTuning tuning;
  tuning.now = [&clock] { return static_cast<int64_t>(clock.Now()); };
  PgHistory history(options.database.empty() ? DefaultDatabase() : options.database,
                    kova::RootPath(kSpoolDir), options.spool_max_bytes, Log, tuning);
  Collector collector(history, options.interval);
  const std::string settings_path = kova::RootPath(kKovaInfoConf);
  kova::FileStamp settings = kova::StampOf(settings_path);
  std::string error;
  if (!collector.Reload(error)) Log(LOG_WARNING, error + "; the defaults stand meanwhile");

  kova::MakeDirectories(kova::RootPath("/run/kova"), 0755);
  SocketServer server(kova::RootPath(kStatisticsSocket),
                      [&collector](std::string_view line) { return Answer(line, collector); });
  if (!server.Start(error)) {
    Log(LOG_ERR, error);
    closelog();
    return 1;
  }
  SamplerOptions sampler_options;
  sampler_options.proc_dir = options.proc_dir;
  sampler_options.sys_dir = options.sys_dir;
  const std::unique_ptr<Sampler> sampler = MakeSystemSampler(sampler_options);
  Log(LOG_INFO, "started: a sample every " + std::to_string(options.interval) + " s");
  MetricsServer metrics;
  std::string metrics_listening;
  ConfigureMetrics(metrics, options, collector.settings(), metrics_listening);
  std::string perf_error;  // said once until it changes

  std::set<std::string> unreadable;
  double next = NextSampleTime(0, clock.Now(), options.interval);
  for (;;) {
    next = NextSampleTime(next, clock.Now(), options.interval);
    const double wait = clock.RealUntil(next);
    if (wait > 0) {
      timespec timeout;
      timeout.tv_sec = static_cast<time_t>(wait);
      timeout.tv_nsec = static_cast<long>((wait - static_cast<double>(timeout.tv_sec)) * 1e9);
      const int got = sigtimedwait(&signals, nullptr, &timeout);
      if (got == SIGTERM || got == SIGINT) break;
      if (got == SIGHUP) {
        if (!collector.Reload(error)) Log(LOG_WARNING, error);
        ConfigureMetrics(metrics, options, collector.settings(), metrics_listening);
      }
      if (got >= 0 || errno == EINTR) continue;
    }
    // Settings written without a reload, such as the real-time range, count at once.
    const kova::FileStamp stamp = kova::StampOf(settings_path);
    if (!(stamp == settings)) {
      settings = stamp;
      if (!collector.Reload(error)) Log(LOG_WARNING, error);
      ConfigureMetrics(metrics, options, collector.settings(), metrics_listening);
    }
    std::vector<SeriesValue> values = sampler->Cycle();
    // What can't be read is said once, and again only after it was read.
    const std::set<std::string> now(sampler->Unreadable().begin(), sampler->Unreadable().end());
    for (const std::string& what : now) {
      if (!unreadable.count(what)) Log(LOG_WARNING, "can't read " + what);
    }
    unreadable = now;
    collector.Record(static_cast<int64_t>(next), values);
    if (metrics.running()) {
      // Rendered once here; scrapes until the next sample get this text.
      MetricsSample sample = sampler->Metrics();
      sample.time = next;
      sample.delay = clock.Now() - next;
      std::string read_error;
      sample.perf = ReadPerfState(kova::RootPath(kPerfStateFile), read_error);
      if (read_error != perf_error && !read_error.empty()) Log(LOG_WARNING, read_error);
      perf_error = read_error;
      metrics.Publish(RenderMetrics(sample, MetricsFormat::kPrometheus),
                      RenderMetrics(sample, MetricsFormat::kOpenMetrics));
    }
    next += options.interval;
  }
  // The minute gathered so far waits in the spool for the database.
  collector.Flush();
  metrics.Stop();
  server.Stop();
  Log(LOG_INFO, "stopped");
  closelog();
  return 0;
}

}  // namespace statd
