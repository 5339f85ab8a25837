#include "perfeventd/alert_outbox.h"

#include <algorithm>
#include <cmath>

namespace perfeventd {

size_t AlertOutbox::Add(const std::vector<Alert>& alerts) {
  size_t dropped = 0;
  for (const Alert& alert : alerts) {
    const auto same = std::find_if(waiting_.begin(), waiting_.end(), [&](const Waiting& w) {
      return w.alert.labels == alert.labels;
    });
    if (same != waiting_.end()) {
      *same = Waiting{next_id_++, alert, 0};
      continue;
    }
    waiting_.push_back(Waiting{next_id_++, alert, 0});
    if (waiting_.size() > limits_.capacity) {
      waiting_.pop_front();
      ++dropped;
    }
  }
  return dropped;
}

std::optional<double> AlertOutbox::NextTry() const {
  if (waiting_.empty()) return std::nullopt;
  return retry_at_;
}

AlertOutbox::Batch AlertOutbox::Take(double now) const {
  Batch batch;
  if (now < retry_at_) return batch;
  for (const Waiting& waiting : waiting_) {
    if (batch.ids.size() >= limits_.batch) break;
    batch.ids.push_back(waiting.id);
    batch.alerts.push_back(waiting.alert);
  }
  return batch;
}

size_t AlertOutbox::Done(const Batch& batch, bool posted, double now) {
  const auto in_batch = [&](const Waiting& w) {
    return std::find(batch.ids.begin(), batch.ids.end(), w.id) != batch.ids.end();
  };
  if (posted) {
    waiting_.erase(std::remove_if(waiting_.begin(), waiting_.end(), in_batch), waiting_.end());
    failures_ = 0;
    retry_at_ = now;
    return 0;
  }
  const size_t before = waiting_.size();
  for (Waiting& waiting : waiting_) {
    if (in_batch(waiting)) ++waiting.attempts;
  }
  waiting_.erase(std::remove_if(waiting_.begin(), waiting_.end(),
                                [&](const Waiting& w) { return w.attempts >= limits_.attempts; }),
                 waiting_.end());
  const double backoff = limits_.first_backoff * std::pow(2.0, std::min(failures_, 30));
  retry_at_ = now + std::min(backoff, limits_.max_backoff);
  ++failures_;
  return before - waiting_.size();
}

}  // namespace perfeventd
