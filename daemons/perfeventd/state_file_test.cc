#include "perfeventd/state_file.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "kova/perfevent.h"
#include "test_support/test_root.h"

namespace perfeventd {
namespace {

using ::testing::ElementsAre;

TEST(StateFileTest, TextHoldsEveryLevelAndEachFiringRule) {
  const struct {
    std::vector<Event> events;
    std::vector<Firing> firings;
    const char* text;
  } cases[] = {
      {{{1, "Warning", "a"}, {2, "Critical", "b"}, {3, "Warning", "c"}, {4, "Info", "d"}},
       {{"3", "system", PERFEVENT_RESOURCE_MEMORY},
        {"12", "Web\tserver\nA", PERFEVENT_RESOURCE_CPU},
        {"20", "Backup LUN", PERFEVENT_RESOURCE_IO_LATENCY},
        {"21", "Backup LUN", PERFEVENT_RESOURCE_IO_RATE}},
       "events_total\tInfo\t1\nevents_total\tWarning\t2\nevents_total\tCritical\t1\n"
       "firing\t3\tsystem\tmemory\nfiring\t12\tWeb server A\tcpu\n"
       "firing\t20\tBackup LUN\tio_latency\nfiring\t21\tBackup LUN\tio_rate\n"},
  };
  for (const auto& c : cases) {
    EventCounts counts;
    counts.Count(c.events);
    EXPECT_EQ(StateText(counts, c.firings), c.text);
  }
}

TEST(StateFileTest, PublishesWholeReadableFilesAndSaysAFailureOnce) {
  kova_test::TestRoot root;
  std::vector<std::string> notices;
  const Notify notify = [&](int, const std::string& text) { notices.push_back(text); };
  const mode_t old_mask = umask(077);
  StateFile state(root.Path("/run/kova/perfeventd.state"), notify);
  state.Publish("events_total\tInfo\t0\n");
  umask(old_mask);
  struct stat info {};
  ASSERT_EQ(stat(root.Path("/run/kova/perfeventd.state").c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 07777, 0644u);
  state.Publish("events_total\tInfo\t1\n");
  EXPECT_EQ(root.Read("/run/kova/perfeventd.state"), "events_total\tInfo\t1\n");
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(root.Path("/run/kova")), {}), 1);

  root.Write("/run/blocked", "a file, not a folder");
  StateFile blocked(root.Path("/run/blocked/perfeventd.state"), notify);
  for (int i = 0; i < 3; ++i) blocked.Publish("events_total\tInfo\t0\n");
  EXPECT_THAT(notices, ElementsAre("can't write " + root.Path("/run/blocked/perfeventd.state") +
                                   ": Not a directory"));
}

}  // namespace
}  // namespace perfeventd
