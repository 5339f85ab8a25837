#include "perfeventd/rule_window.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

#include "perfeventd/rule.h"

namespace perfeventd {
namespace {

constexpr std::optional<double> kGap = std::nullopt;

// Feeds `samples` to a window of three samples over the threshold 80 and
// writes one letter per sample: '.' nothing, 'R' raised, 'r' recovered.
std::string Changes(const std::vector<std::optional<double>>& samples, double* average = nullptr) {
  RuleWindow window(80, 3);
  std::string out;
  for (const auto& sample : samples) {
    switch (window.Feed(sample)) {
      case RuleWindow::Change::kRaised:
        out += 'R';
        break;
      case RuleWindow::Change::kRecovered:
        out += 'r';
        break;
      case RuleWindow::Change::kNone:
        out += '.';
        break;
    }
    if (average != nullptr && out.back() != '.') *average = window.average();
  }
  return out;
}

TEST(RuleWindowTest, ChangesOnlyAfterAWholeWindow) {
  const struct {
    const char* name;
    std::vector<std::optional<double>> samples;
    const char* changes;
  } cases[] = {
      {"three above raise", {81, 90, 95}, "..R"},
      {"exactly at the threshold is not above", {80, 80, 80, 80}, "...."},
      {"one low sample restarts the window", {90, 90, 50, 90, 90, 90}, ".....R"},
      {"a missing sample restarts the window", {90, 90, kGap, 90, 90, 90}, ".....R"},
      {"hovering never raises", {81, 79, 81, 80, 81, 79, 81}, "......."},
      {"no second raise while above", {90, 90, 90, 90, 90, 90, 90}, "..R...."},
      {"recovery after a whole window at or below", {90, 90, 90, 80, 10, 10}, "..R..r"},
      {"hovering after a raise doesn't recover", {90, 90, 90, 70, 90, 70, 70, 90}, "..R....."},
      {"raised again only after recovery", {90, 90, 90, 1, 1, 1, 90, 90, 90}, "..R..r..R"},
  };
  for (const auto& c : cases) EXPECT_EQ(Changes(c.samples), c.changes) << c.name;
}

TEST(RuleWindowTest, ReportsTheAverageOfTheDecidingWindow) {
  double average = 0;
  EXPECT_EQ(Changes({99, 81, 90, 90}, &average), "..R.");
  EXPECT_DOUBLE_EQ(average, 90);
  EXPECT_EQ(Changes({90, 90, 90, 0, 30, 60}, &average), "..R..r");
  EXPECT_DOUBLE_EQ(average, 30);
}

TEST(RuleTest, WindowsAndProblems) {
  const struct {
    Rule rule;
    int samples;
    const char* problem;
  } cases[] = {
      {{"1", 0, "", 1, 1, 80, 5, 30}, 6, ""},
      {{"2", 0, "", 4, 2, 20, 5, 32}, 7, ""},     // 32 s need 7 samples of 5 s
      {{"3", 1, "smb", 2, 1, 90, 10, 0}, 1, ""},  // no duration: the first sample decides
      {{"4", 1, "smb", 3, 1, 90, 5, 30}, 6, "a service's rule can watch only CPU or memory"},
      {{"5", 7, "x", 1, 1, 90, 5, 30}, 6, "unknown object type 7"},
      {{"6", 0, "", 1, 3, 90, 5, 30}, 6, "unknown severity 3"},
      {{"7", 1, "", 1, 1, 90, 5, 30}, 6, "a service's rule needs the service's name"},
      {{"8", 2, "", 3, 1, 90, 5, 30}, 6, "a LUN's rule needs the LUN's uuid"},
      {{"9", 0, "", 1, 1, 90, 0, 30}, 1, "sampling period below one second"},
      {{"10", 0, "", 0, 0, 0, 5, 30}, 6, "unknown resource 0"},  // every field left out
  };
  for (const auto& c : cases) {
    EXPECT_EQ(SamplesPerWindow(c.rule), c.samples) << c.rule.id;
    EXPECT_EQ(RuleProblem(c.rule), c.problem) << c.rule.id;
  }
}

}  // namespace
}  // namespace perfeventd
