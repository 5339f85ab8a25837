// The state of one rule over its samples, fed one sample per period.
//
// A sample is high when it is strictly above the threshold; a sample exactly at
// the threshold is low. A rule is raised after a whole window of high samples
// in a row and recovers after a whole window of low samples in a row, so a
// value that hovers around the threshold changes nothing. A sample that could
// not be taken ends the current run: a window must be seen whole.

#ifndef KOVA_DAEMONS_PERFEVENTD_RULE_WINDOW_H_
#define KOVA_DAEMONS_PERFEVENTD_RULE_WINDOW_H_

#include <optional>

namespace perfeventd {

class RuleWindow {
 public:
  enum class Change { kNone, kRaised, kRecovered };

  // `samples` high (or low) samples in a row make a window; at least one.
  RuleWindow(double threshold, int samples);

  // Feeds the next sample; nullopt is a sample that could not be taken.
  Change Feed(std::optional<double> value);

  bool raised() const { return raised_; }
  // The average of the samples of the window that made the last change.
  double average() const { return average_; }

 private:
  double threshold_;
  int samples_;
  bool raised_ = false;
  int run_ = 0;     // samples in a row that speak for a change
  double sum_ = 0;  // their sum
  double average_ = 0;
};

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_RULE_WINDOW_H_
