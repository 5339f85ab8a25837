#include "src/privilege.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <stdexcept>

#include "test_support/run_in_child.h"

namespace {

TEST(PrivilegeTest, RaisesForTheWorkAndRestoresAfterIt) {
  const struct {
    const char* name;
    uid_t uid[3];  // real, effective, saved
    gid_t gid[3];
    bool root;
  } cases[] = {
      {"host ids", {1000, 1000, 0}, {1000, 1000, 0}, true},
      {"saved user only", {1000, 1000, 0}, {1000, 1000, 1000}, true},
      {"real user root", {0, 1000, 1000}, {1000, 1000, 1000}, true},
      {"unprivileged", {1000, 1000, 1000}, {1000, 1000, 1000}, false},
      {"root", {0, 0, 0}, {0, 0, 0}, true},
  };
  for (const auto& c : cases) {
    EXPECT_TRUE(kova_test::RunInChild([&c] {
      ASSERT_EQ(setresgid(c.gid[0], c.gid[1], c.gid[2]), 0);
      ASSERT_EQ(setresuid(c.uid[0], c.uid[1], c.uid[2]), 0);
      try {
        kova::RootScope scope;
        EXPECT_EQ(scope.root(), c.root);
        EXPECT_EQ(geteuid(), c.root ? 0u : c.uid[1]);
        EXPECT_EQ(getegid(), c.root ? 0u : c.gid[1]);
        throw std::runtime_error("work failed");  // the ids come back all the same
      } catch (const std::runtime_error&) {
      }
      uid_t uid[3];
      gid_t gid[3];
      ASSERT_EQ(getresuid(&uid[0], &uid[1], &uid[2]), 0);
      ASSERT_EQ(getresgid(&gid[0], &gid[1], &gid[2]), 0);
      for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(uid[i], c.uid[i]) << i;
        EXPECT_EQ(gid[i], c.gid[i]) << i;
      }
    })) << c.name;
  }
}

TEST(PrivilegeTest, BecomesRootForGoodFromTheHostsIds) {
  EXPECT_TRUE(kova_test::RunInChild([] {
    ASSERT_EQ(setresgid(1000, 1000, 0), 0);
    ASSERT_EQ(setresuid(1000, 1000, 0), 0);
    kova::RootScope scope;
    ASSERT_TRUE(kova::BecomeRootForGood());
    uid_t uid[3];
    gid_t gid[3];
    ASSERT_EQ(getresuid(&uid[0], &uid[1], &uid[2]), 0);
    ASSERT_EQ(getresgid(&gid[0], &gid[1], &gid[2]), 0);
    EXPECT_EQ(uid[0] | uid[1] | uid[2] | gid[0] | gid[1] | gid[2], 0u);
    EXPECT_EQ(getgroups(0, nullptr), 0);
  }));
}

}  // namespace
