#include "perfeventd/alert_poster.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <mutex>
#include <thread>

namespace perfeventd {
namespace {

using ::testing::ElementsAre;
using Clock = std::chrono::steady_clock;

// A sender that fails `failures` posts, then takes the rest.
struct FakeSender {
  std::mutex mutex;
  int failures = 0;
  std::vector<std::string> bodies;  // the bodies taken

  bool Post(const std::string& body, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex);
    if (failures > 0) {
      --failures;
      error = "refused";
      return false;
    }
    bodies.push_back(body);
    return true;
  }
  size_t taken() {
    std::lock_guard<std::mutex> lock(mutex);
    return bodies.size();
  }
};

TEST(AlertPosterTest, PostsInTheBackgroundAndSaysFailuresOnce) {
  const struct {
    const char* name;
    int failures;
    std::vector<std::string> notices;
  } cases[] = {
      {"taken at once", 0, {}},
      {"refused three times",
       3,
       {"can't post alerts to http://am/api/v2/alerts: refused; they wait and are retried",
        "alerts reach http://am/api/v2/alerts again"}},
  };
  for (const auto& c : cases) {
    FakeSender sender;
    sender.failures = c.failures;
    std::mutex notices_mutex;
    std::vector<std::string> notices;
    AlertPoster poster(
        [&](int, const std::string& text) {
          std::lock_guard<std::mutex> lock(notices_mutex);
          notices.push_back(text);
        },
        [&](const std::string&, const std::string& body, const std::atomic<bool>&,
            std::string& error) { return sender.Post(body, error); },
        OutboxLimits{10, 5, 0.01, 0.02, 64});
    poster.SetUrls({"http://am/api/v2/alerts"});
    poster.Post({Alert{{{"rule", "1"}}, "up", 100, 0}});
    const auto said = [&] {
      std::lock_guard<std::mutex> lock(notices_mutex);
      return notices.size();
    };
    const auto end = Clock::now() + std::chrono::seconds(5);
    while ((sender.taken() == 0 || said() < c.notices.size()) && Clock::now() < end) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    poster.SetUrls({});
    EXPECT_THAT(sender.bodies, ElementsAre(AlertsJson({Alert{{{"rule", "1"}}, "up", 100, 0}})))
        << c.name;
    EXPECT_EQ(notices, c.notices) << c.name;
  }
}

}  // namespace
}  // namespace perfeventd
