// The metrics endpoint of kovastatd: GET /metrics over HTTP on a TCP address
// of its own, answered from the text rendered at the last sample, never from
// /proc, so that a scrape costs the same at any rate. One thread serves every
// connection; a cap on connections, a header size limit and deadlines keep
// clients from holding it, and nothing of it waits for the sampling loop but
// the hand-over of a new text.

#ifndef KOVA_DAEMONS_STATD_METRICS_SERVER_H_
#define KOVA_DAEMONS_STATD_METRICS_SERVER_H_

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

namespace statd {

struct MetricsLimits {
  size_t max_connections = 64;  // more are closed as soon as they are taken
  size_t max_header = 8192;     // a longer request header ends its connection
  // For a request's header to come, and for the answer to be taken.
  std::chrono::milliseconds timeout{10000};
};

// "ADDR:PORT" (an IPv6 address in brackets) split into `address` and `port`;
// false with `error` when it isn't one.
bool ParseListenAddress(const std::string& text, std::string& address, uint16_t& port,
                        std::string& error);

// Whether `a` and `b` are equal, in a time that depends on their lengths only.
bool SameSecret(std::string_view a, std::string_view b);

class MetricsServer {
 public:
  explicit MetricsServer(MetricsLimits limits = {});
  ~MetricsServer();
  MetricsServer(const MetricsServer&) = delete;
  MetricsServer& operator=(const MetricsServer&) = delete;

  // Listens on `listen` ("ADDR:PORT"; port 0 takes a free one) on a thread of
  // its own, after ending the listener before if any. False with `error` when
  // the address is bad or can't be bound; the server is stopped then.
  bool Start(const std::string& listen, std::string& error);
  // Closes the listener and every connection; the published text stays.
  void Stop();
  bool running() const { return runner_ != nullptr; }
  // The address listened on, its port as bound; empty while stopped.
  const std::string& bound() const { return bound_; }

  // The bearer token a scrape must send; empty: none asked.
  void SetToken(std::string token);
  // The texts scrapes are answered with from now on, in either format.
  void Publish(std::string prometheus, std::string openmetrics);

  struct Shared;
  struct Runner;

 private:
  MetricsLimits limits_;
  std::shared_ptr<Shared> shared_;
  std::unique_ptr<Runner> runner_;
  std::string bound_;
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_METRICS_SERVER_H_
