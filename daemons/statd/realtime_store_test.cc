#include "statd/realtime_store.h"

#include <gtest/gtest.h>

#include <cmath>
#include <string>
#include <vector>

namespace statd {
namespace {

SeriesValue Value(const std::string& id, double value, Labels labels = {}) {
  return SeriesValue{SeriesInfo{id, id.substr(0, id.find('@')), "%", std::move(labels)}, value};
}

struct Samples {
  std::vector<int64_t> times;
  std::vector<double> values;
  bool operator==(const Samples&) const = default;
};

Samples Read(const RealtimeStore& store, const std::string& id, int64_t since = 0) {
  Samples samples;
  EXPECT_TRUE(store.Read(id, since, samples.times, samples.values)) << id;
  return samples;
}

std::vector<std::string> Ids(const RealtimeStore& store) {
  std::vector<std::string> ids;
  for (const SeriesInfo& info : store.Catalog()) ids.push_back(info.id);
  return ids;
}

TEST(RealtimeStore, KeepsTheNewestSamplesAfterASinceTime) {
  RealtimeStore store(3);
  for (int64_t t = 100; t <= 104; ++t) store.Add(t, {Value("cpu.user", static_cast<double>(t))});
  EXPECT_EQ(Read(store, "cpu.user"), (Samples{{102, 103, 104}, {102, 103, 104}}));
  EXPECT_EQ(Read(store, "cpu.user", 102), (Samples{{103, 104}, {103, 104}}));
  EXPECT_EQ(Read(store, "cpu.user", 104), Samples{});
  EXPECT_EQ(store.newest(), 104);
  // The same second twice, or an earlier one, is not a new sample.
  EXPECT_FALSE(store.Add(104, {Value("cpu.user", 1)}));
  EXPECT_FALSE(store.Add(90, {Value("cpu.user", 1)}));
  EXPECT_EQ(Read(store, "cpu.user", 103), (Samples{{104}, {104}}));
}

TEST(RealtimeStore, LeavesOutSecondsWithoutAValueAndShowsShortDecimals) {
  RealtimeStore store(10);
  store.Add(1, {Value("a", 12.3), Value("b", 1)});
  store.Add(2, {Value("b", 2)});
  store.Add(3, {Value("a", 0.1), Value("b", std::nan(""))});
  EXPECT_EQ(Read(store, "a"), (Samples{{1, 3}, {12.3, 0.1}}));
  EXPECT_EQ(Read(store, "b"), (Samples{{1, 2}, {1, 2}}));
  std::vector<int64_t> times;
  std::vector<double> values;
  EXPECT_FALSE(store.Read("c", 0, times, values));
}

TEST(RealtimeStore, ResizingKeepsTheNewestSamples) {
  RealtimeStore store(5);
  for (int64_t t = 1; t <= 5; ++t) store.Add(t, {Value("a", static_cast<double>(t))});
  store.Resize(2);
  EXPECT_EQ(Read(store, "a"), (Samples{{4, 5}, {4, 5}}));
  store.Resize(4);
  store.Add(6, {Value("a", 6)});
  store.Add(7, {Value("a", 7)});
  EXPECT_EQ(Read(store, "a"), (Samples{{4, 5, 6, 7}, {4, 5, 6, 7}}));
  store.Add(8, {Value("a", 8)});
  EXPECT_EQ(Read(store, "a").times, (std::vector<int64_t>{5, 6, 7, 8}));
}

TEST(RealtimeStore, CatalogFollowsTheSeriesThatHaveSamples) {
  RealtimeStore store(2);
  store.Add(1, {Value("cpu.user", 1), Value("net.rx_bytes@eth0", 1, {{"interface", "eth0"}})});
  EXPECT_EQ(Ids(store), (std::vector<std::string>{"cpu.user", "net.rx_bytes@eth0"}));
  // eth1 appears before eth0 this second; eth0 is gone but still has a sample.
  store.Add(2, {Value("net.rx_bytes@eth1", 1), Value("cpu.user", 2)});
  EXPECT_EQ(Ids(store),
            (std::vector<std::string>{"net.rx_bytes@eth1", "cpu.user", "net.rx_bytes@eth0"}));
  // Its last sample leaves the ring, and it leaves the catalog.
  store.Add(3, {Value("cpu.user", 3)});
  EXPECT_EQ(Ids(store), (std::vector<std::string>{"cpu.user", "net.rx_bytes@eth1"}));
  // Labels follow the newest value.
  store.Add(4, {Value("service.cpu@x", 1, {{"display_name", "New name"}})});
  EXPECT_EQ(store.Catalog()[0].labels, (Labels{{"display_name", "New name"}}));
}

TEST(RealtimeStore, AClockSetBackDropsTheSamplesItShowsAsFuture) {
  RealtimeStore store(10);
  for (int64_t t = 1; t <= 6; ++t) store.Add(t, {Value("a", static_cast<double>(t))});
  store.Add(7, {Value("b", 7)});
  store.DropFrom(4);
  EXPECT_EQ(store.newest(), 3);
  EXPECT_EQ(Read(store, "a"), (Samples{{1, 2, 3}, {1, 2, 3}}));
  EXPECT_EQ(Ids(store), (std::vector<std::string>{"a"}));  // b had no sample left
  EXPECT_TRUE(store.Add(4, {Value("a", 40)}));
  EXPECT_EQ(Read(store, "a", 2), (Samples{{3, 4}, {3, 40}}));
}

}  // namespace
}  // namespace statd
