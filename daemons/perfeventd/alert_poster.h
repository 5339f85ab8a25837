// Posts alerts to Alertmanagers on threads of their own, one per URL, so that
// a slow or dead Alertmanager never holds up a cycle: the cycle only queues.
// Each URL has its own AlertOutbox; the system log says once when posts to a
// URL start failing and once when they go through again, with what was
// dropped meanwhile.

#ifndef KOVA_DAEMONS_PERFEVENTD_ALERT_POSTER_H_
#define KOVA_DAEMONS_PERFEVENTD_ALERT_POSTER_H_

#include <atomic>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "perfeventd/alert_outbox.h"
#include "perfeventd/alerts.h"
#include "perfeventd/monitor.h"

namespace perfeventd {

// Posts the JSON `body` to `url`. True on a 2xx answer; false with `error`
// set otherwise. Gives up soon after `stop` becomes true.
using PostFunction = std::function<bool(const std::string& url, const std::string& body,
                                        const std::atomic<bool>& stop, std::string& error)>;

// PostFunction over libcurl: 2 s to connect, 5 s for the whole request, no
// redirects, http and https only. curl_global_init must have run.
bool CurlPost(const std::string& url, const std::string& body, const std::atomic<bool>& stop,
              std::string& error);

class AlertPoster {
 public:
  AlertPoster(Notify notify, PostFunction post, const OutboxLimits& limits)
      : notify_(std::move(notify)), post_(std::move(post)), limits_(limits) {}
  // Stops every thread; alerts still waiting are dropped.
  ~AlertPoster() { SetUrls({}); }
  AlertPoster(const AlertPoster&) = delete;
  AlertPoster& operator=(const AlertPoster&) = delete;

  // Posts to `urls` from now on: a thread starts for each new URL, and the
  // thread of a URL no longer there stops, its waiting alerts dropped.
  void SetUrls(const std::vector<std::string>& urls);

  // Queues `alerts` for every URL and returns at once.
  void Post(const std::vector<Alert>& alerts);

 private:
  struct Worker {
    explicit Worker(const OutboxLimits& limits) : outbox(limits) {}

    std::string url;
    std::mutex mutex;
    std::condition_variable wake;
    AlertOutbox outbox;
    std::atomic<bool> stop{false};
    bool failing = false;
    size_t dropped = 0;  // alerts dropped while failing
    std::thread thread;
  };

  void Run(Worker& worker);

  Notify notify_;
  PostFunction post_;
  OutboxLimits limits_;
  std::map<std::string, std::unique_ptr<Worker>> workers_;
};

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_ALERT_POSTER_H_
