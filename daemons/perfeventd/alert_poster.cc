#include "perfeventd/alert_poster.h"

#include <curl/curl.h>
#include <syslog.h>

#include <chrono>

namespace perfeventd {
namespace {

constexpr long kConnectTimeoutMs = 2000;
constexpr long kTotalTimeoutMs = 5000;
constexpr size_t kAnswerKept = 200;  // bytes of an error answer that the log shows

double SteadyNow() {
  return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

size_t KeepAnswer(char* data, size_t size, size_t count, void* answer) {
  std::string& text = *static_cast<std::string*>(answer);
  const size_t bytes = size * count;
  if (text.size() < kAnswerKept) text.append(data, std::min(bytes, kAnswerKept - text.size()));
  return bytes;
}

// Aborts the transfer once the poster stops.
int CheckStop(void* stop, curl_off_t, curl_off_t, curl_off_t, curl_off_t) {
  return static_cast<const std::atomic<bool>*>(stop)->load() ? 1 : 0;
}

}  // namespace

bool CurlPost(const std::string& url, const std::string& body, const std::atomic<bool>& stop,
              std::string& error) {
  CURL* curl = curl_easy_init();
  if (curl == nullptr) {
    error = "can't make a libcurl handle";
    return false;
  }
  curl_slist* headers = curl_slist_append(nullptr, "Content-Type: application/json");
  std::string answer;
  char message[CURL_ERROR_SIZE] = "";
  curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
  curl_easy_setopt(curl, CURLOPT_PROTOCOLS_STR, "http,https");
  curl_easy_setopt(curl, CURLOPT_HTTPHEADER, headers);
  curl_easy_setopt(curl, CURLOPT_POSTFIELDS, body.c_str());
  curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body.size()));
  curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT_MS, kConnectTimeoutMs);
  curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, kTotalTimeoutMs);
  curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, message);
  curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, KeepAnswer);
  curl_easy_setopt(curl, CURLOPT_WRITEDATA, &answer);
  curl_easy_setopt(curl, CURLOPT_NOPROGRESS, 0L);
  curl_easy_setopt(curl, CURLOPT_XFERINFOFUNCTION, CheckStop);
  curl_easy_setopt(curl, CURLOPT_XFERINFODATA, const_cast<std::atomic<bool>*>(&stop));
  const CURLcode result = curl_easy_perform(curl);
  long status = 0;
  curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
  curl_slist_free_all(headers);
  curl_easy_cleanup(curl);
  if (result != CURLE_OK) {
    error = message[0] != '\0' ? message : curl_easy_strerror(result);
    return false;
  }
  if (status < 200 || status > 299) {
    error = "HTTP " + std::to_string(status) + (answer.empty() ? "" : ": " + answer);
    return false;
  }
  return true;
}

void AlertPoster::SetUrls(const std::vector<std::string>& urls) {
  for (auto it = workers_.begin(); it != workers_.end();) {
    bool kept = false;
    for (const std::string& url : urls) kept |= url == it->first;
    if (kept) {
      ++it;
      continue;
    }
    Worker& worker = *it->second;
    {
      std::lock_guard<std::mutex> lock(worker.mutex);
      worker.stop = true;
    }
    worker.wake.notify_all();
    worker.thread.join();
    it = workers_.erase(it);
  }
  for (const std::string& url : urls) {
    if (workers_.count(url)) continue;
    auto worker = std::make_unique<Worker>(limits_);
    worker->url = url;
    Worker& started = *worker;
    workers_.emplace(url, std::move(worker));
    started.thread = std::thread([this, &started] { Run(started); });
  }
}

void AlertPoster::Post(const std::vector<Alert>& alerts) {
  if (alerts.empty()) return;
  for (auto& [url, worker] : workers_) {
    {
      std::lock_guard<std::mutex> lock(worker->mutex);
      const size_t dropped = worker->outbox.Add(alerts);
      if (dropped > 0 && worker->dropped == 0) {
        notify_(LOG_ERR, "the alerts waiting for " + UrlForLog(url) +
                             " are too many; the oldest are dropped");
      }
      worker->dropped += dropped;
    }
    worker->wake.notify_all();
  }
}

void AlertPoster::Run(Worker& worker) {
  std::unique_lock<std::mutex> lock(worker.mutex);
  while (!worker.stop) {
    const std::optional<double> next = worker.outbox.NextTry();
    if (!next) {
      worker.wake.wait(lock);
      continue;
    }
    const double now = SteadyNow();
    if (*next > now) {
      worker.wake.wait_for(lock, std::chrono::duration<double>(*next - now));
      continue;
    }
    const AlertOutbox::Batch batch = worker.outbox.Take(now);
    lock.unlock();
    std::string error;
    const bool posted = post_(worker.url, AlertsJson(batch.alerts), worker.stop, error);
    lock.lock();
    if (worker.stop) break;
    worker.dropped += worker.outbox.Done(batch, posted, SteadyNow());
    if (!posted && !worker.failing) {
      notify_(LOG_WARNING, "can't post alerts to " + UrlForLog(worker.url) + ": " + error +
                               "; they wait and are retried");
    }
    if (posted && worker.failing) {
      notify_(LOG_INFO, "alerts reach " + UrlForLog(worker.url) + " again" +
                            (worker.dropped > 0 ? " (" + std::to_string(worker.dropped) +
                                                      " were dropped meanwhile)"
                                                : ""));
      worker.dropped = 0;
    }
    worker.failing = !posted;
  }
}

}  // namespace perfeventd
