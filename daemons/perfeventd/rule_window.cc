#include "perfeventd/rule_window.h"

namespace perfeventd {

RuleWindow::RuleWindow(double threshold, int samples)
    : threshold_(threshold), samples_(samples < 1 ? 1 : samples) {}

RuleWindow::Change RuleWindow::Feed(std::optional<double> value) {
  const bool high = value.has_value() && *value > threshold_;
  // A sample that agrees with the state, or none at all, ends the run.
  if (!value.has_value() || high == raised_) {
    run_ = 0;
    sum_ = 0;
    return Change::kNone;
  }
  ++run_;
  sum_ += *value;
  if (run_ < samples_) return Change::kNone;
  raised_ = !raised_;
  average_ = sum_ / run_;
  run_ = 0;
  sum_ = 0;
  return raised_ ? Change::kRaised : Change::kRecovered;
}

}  // namespace perfeventd
