#include "host/sessions.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

namespace kova_host {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

TEST(SessionsTest, SessionsExpireWhenIdleAndMakeRoomWhenFull) {
  SessionStore store(seconds(10), 2);
  const TimePoint start{};
  Session first;
  const std::string sid = store.Create("admin", true, "enu", start, first);
  EXPECT_EQ(sid.size(), 64u);
  EXPECT_EQ(first.token.size(), 64u);
  EXPECT_NE(first.token, sid);

  store.Touch(sid, start + seconds(8));  // a call keeps the session alive
  ASSERT_TRUE(store.Find(sid, start + seconds(17)).has_value());
  EXPECT_EQ(store.Find(sid, start + seconds(17))->account, "admin");
  EXPECT_FALSE(store.Find(sid, start + seconds(19)).has_value());
  EXPECT_FALSE(store.Find(sid, start).has_value());  // removed, not only hidden

  Session session;
  const std::string a = store.Create("a", false, "enu", start, session);
  const std::string b = store.Create("b", false, "enu", start + seconds(1), session);
  const std::string c = store.Create("c", false, "enu", start + seconds(2), session);
  EXPECT_FALSE(store.Find(a, start + seconds(2)).has_value());  // the least recently used
  EXPECT_TRUE(store.Find(b, start + seconds(2)).has_value());
  store.Remove(c);
  EXPECT_FALSE(store.Find(c, start + seconds(2)).has_value());
}

TEST(SessionsTest, RepeatedFailuresWaitLongerAndLonger) {
  LoginThrottle throttle;
  const TimePoint start{};
  const std::vector<std::string> keys = {"account:admin", "address:127.0.0.1"};
  for (int i = 0; i < LoginThrottle::kFreeFailures; ++i)
    EXPECT_EQ(throttle.Reserve(keys, start), 0) << i;
  EXPECT_EQ(throttle.Reserve(keys, start), 1);
  EXPECT_EQ(throttle.Reserve({"address:127.0.0.1"}, start), 1);  // either key counts
  EXPECT_EQ(throttle.Reserve({"account:other"}, start), 0);
  EXPECT_EQ(throttle.Reserve(keys, start + milliseconds(1001)), 0);
  EXPECT_EQ(throttle.Reserve(keys, start + milliseconds(1001)), 2);
  // An attempt that checked no password doesn't count.
  EXPECT_EQ(throttle.Reserve(keys, start + seconds(4)), 0);
  throttle.Cancel(keys);
  EXPECT_EQ(throttle.Reserve(keys, start + seconds(4)), 2);
  for (int i = 0; i < 20; ++i) throttle.Reserve(keys, start + seconds(1000 * (i + 1)));
  EXPECT_EQ(throttle.Reserve(keys, start + seconds(20000)), LoginThrottle::kMaxWait.count());
  throttle.Succeeded(keys);
  EXPECT_EQ(throttle.Reserve(keys, start + seconds(20000)), 0);
}

// Attempts sent at once get no more password checks than one after another.
TEST(SessionsTest, AttemptsAtOnceAreCountedOneByOne) {
  LoginThrottle throttle;
  const TimePoint start{};
  const std::vector<std::string> keys = {"account:admin", "address:127.0.0.1"};
  for (const auto& [at, allowed] :
       {std::pair{start, LoginThrottle::kFreeFailures}, std::pair{start + milliseconds(1001), 1}}) {
    std::atomic<int> passed = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < 32; ++i) {
      threads.emplace_back([&, at = at] { passed += throttle.Reserve(keys, at) == 0; });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(passed, allowed);
  }
}

}  // namespace
}  // namespace kova_host
