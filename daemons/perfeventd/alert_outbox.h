// The alerts waiting to be posted to one Alertmanager, with bounded retries.
//
// At most `capacity` alerts wait; beyond that the oldest are dropped. An alert
// queued while one with the same labels waits replaces it in place, so that a
// re-sent or resolved alert never waits twice. A failed post counts an attempt
// on each alert it carried and backs off, doubling from `first_backoff` up to
// `max_backoff` seconds; an alert out of attempts is dropped. Times are seconds
// of a clock that only goes forward, given by the caller.

#ifndef KOVA_DAEMONS_PERFEVENTD_ALERT_OUTBOX_H_
#define KOVA_DAEMONS_PERFEVENTD_ALERT_OUTBOX_H_

#include <cstddef>
#include <cstdint>
#include <deque>
#include <optional>
#include <vector>

#include "perfeventd/alerts.h"

namespace perfeventd {

struct OutboxLimits {
  size_t capacity = 1000;
  int attempts = 10;
  double first_backoff = 1;
  double max_backoff = 60;
  size_t batch = 64;  // alerts in one post at most
};

class AlertOutbox {
 public:
  // The alerts of one post, and which waiting alerts they were.
  struct Batch {
    std::vector<uint64_t> ids;
    std::vector<Alert> alerts;
  };

  explicit AlertOutbox(const OutboxLimits& limits) : limits_(limits) {}

  // Queues `alerts`; returns how many waiting alerts were dropped to make room.
  size_t Add(const std::vector<Alert>& alerts);

  // When the next post may go: now or later while backing off; nullopt when
  // nothing waits.
  std::optional<double> NextTry() const;

  // The oldest waiting alerts, up to a batch; empty while backing off at `now`.
  Batch Take(double now) const;

  // The outcome of posting `batch`: a success removes its alerts (those not
  // replaced meanwhile); a failure counts an attempt on each and backs off.
  // Returns how many alerts were dropped for want of attempts.
  size_t Done(const Batch& batch, bool posted, double now);

  size_t size() const { return waiting_.size(); }

 private:
  struct Waiting {
    uint64_t id;
    Alert alert;
    int attempts = 0;
  };

  OutboxLimits limits_;
  std::deque<Waiting> waiting_;
  uint64_t next_id_ = 1;
  int failures_ = 0;  // failed posts in a row
  double retry_at_ = 0;
};

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_ALERT_OUTBOX_H_
