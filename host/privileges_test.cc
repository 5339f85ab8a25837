#include "host/privileges.h"

#include <grp.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "test_support/run_in_child.h"

namespace kova_host {
namespace {

class PrivilegesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root";
    std::string error;
    ASSERT_TRUE(LookUpIdentity("nobody", account_, error)) << error;
  }
  Identity account_;
};

TEST_F(PrivilegesTest, LooksUpUnprivilegedAccountsOnly) {
  Identity identity;
  std::string error;
  EXPECT_FALSE(LookUpIdentity("root", identity, error));
  EXPECT_FALSE(LookUpIdentity("no-such-account-here", identity, error));
  EXPECT_NE(account_.uid, 0u);
}

TEST_F(PrivilegesTest, DroppedForGoodRootCannotBeRegained) {
  EXPECT_TRUE(kova_test::RunInChild([&] {
    std::string error;
    ASSERT_TRUE(DropForGood(account_, error)) << error;
    const IdSnapshot ids = SnapshotIds();
    EXPECT_EQ(ids.ruid, account_.uid);
    EXPECT_EQ(ids.suid, account_.uid);
    EXPECT_EQ(ids.sgid, account_.gid);
    EXPECT_NE(setresuid(-1, 0, -1), 0);
  }));
}

TEST_F(PrivilegesTest, RaisedOrRegroupedIdsArePutBack) {
  EXPECT_TRUE(kova_test::RunInChild([&] {
    std::string error;
    ASSERT_TRUE(TakeEffectiveIds(account_, error)) << error;
    const IdSnapshot wanted = SnapshotIds();
    EXPECT_EQ(wanted.ruid, 0u);
    EXPECT_EQ(wanted.euid, account_.uid);

    bool changed = true;
    EXPECT_TRUE(RestoreIds(wanted, changed, error));
    EXPECT_FALSE(changed);

    ASSERT_EQ(setresuid(-1, 0, -1), 0);
    ASSERT_EQ(setresgid(-1, 0, -1), 0);
    const gid_t root_group = 0;
    ASSERT_EQ(setgroups(1, &root_group), 0);
    EXPECT_TRUE(RestoreIds(wanted, changed, error)) << error;
    EXPECT_TRUE(changed);
    EXPECT_EQ(SnapshotIds(), wanted);

    // Real and saved ids given away can't be taken back: the runner must end.
    ASSERT_EQ(setresuid(-1, 0, -1), 0);
    ASSERT_EQ(setresuid(account_.uid, account_.uid, account_.uid), 0);
    EXPECT_FALSE(RestoreIds(wanted, changed, error));
  }));
}

}  // namespace
}  // namespace kova_host
