#include "src/accounts.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <string>

#include "kova/error.h"
#include "test_support/test_root.h"

namespace {

int Check(const std::string& name, const std::string& password, bool& admin) {
  return kova::CheckAccountPassword(name, password, admin);
}

TEST(AccountsTest, AddsChecksChangesAndRemovesAccounts) {
  kova_test::TestRoot root;
  bool admin = true;
  EXPECT_EQ(Check("admin", "secret", admin), 0);  // no file yet: no accounts
  ASSERT_EQ(kova::AddAccount("admin", "s3cret: with blanks", true), 0);
  ASSERT_EQ(kova::AddAccount("guest", "guest-pw", false), 0);
  EXPECT_EQ(kova::AddAccount("guest", "other", true), 1);

  EXPECT_EQ(Check("admin", "s3cret: with blanks", admin), 1);
  EXPECT_TRUE(admin);
  EXPECT_EQ(Check("guest", "guest-pw", admin), 1);
  EXPECT_FALSE(admin);
  EXPECT_EQ(Check("admin", "s3cret: with blank", admin), 0);
  EXPECT_EQ(Check("admin", "", admin), 0);
  EXPECT_EQ(Check("nobody", "guest-pw", admin), 0);

  const std::string content = root.Read(kova::kAccountsPath);
  EXPECT_EQ(content.find("s3cret"), std::string::npos);  // only hashes are stored
  EXPECT_EQ(content.rfind("admin:admin:$", 0), 0u);
  struct stat info;
  ASSERT_EQ(stat(root.Path(kova::kAccountsPath).c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777, 0600u);

  EXPECT_EQ(kova::SetAccountPassword("guest", "new-pw"), 0);
  EXPECT_EQ(Check("guest", "guest-pw", admin), 0);
  EXPECT_EQ(Check("guest", "new-pw", admin), 1);
  EXPECT_EQ(kova::SetAccountPassword("ghost", "x"), 1);
  EXPECT_EQ(kova::RemoveAccount("guest"), 0);
  EXPECT_EQ(kova::RemoveAccount("guest"), 1);
  std::vector<kova::AccountEntry> accounts;
  ASSERT_TRUE(kova::ListAccounts(accounts));
  ASSERT_EQ(accounts.size(), 1u);
  EXPECT_EQ(accounts[0].name, "admin");
  EXPECT_TRUE(accounts[0].admin);
}

TEST(AccountsTest, RefusesBadNamesPasswordsAndFiles) {
  kova_test::TestRoot root;
  const struct {
    std::string name;
    std::string password;
  } refused[] = {
      {"", "pw"},
      {"-admin", "pw"},
      {".admin", "pw"},
      {"a:b", "pw"},
      {"a b", "pw"},
      {std::string(33, 'a'), "pw"},
      {"admin", ""},
      {"admin", "a\nb"},
      {"admin", std::string("a\0b", 3)},
      {"admin", std::string(1025, 'x')},
  };
  for (const auto& c : refused) {
    EXPECT_EQ(kova::AddAccount(c.name, c.password, true), -1) << c.name;
    EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_INVALID);
  }
  std::vector<kova::AccountEntry> accounts;
  EXPECT_TRUE(kova::ListAccounts(accounts));
  EXPECT_TRUE(accounts.empty());

  root.Write(kova::kAccountsPath, "admin:root:$y$abc\n", 0600);
  bool admin = false;
  EXPECT_EQ(kova::CheckAccountPassword("admin", "pw", admin), -1);
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_FORMAT);
  EXPECT_EQ(kova::AddAccount("other", "pw", false), -1);
  EXPECT_EQ(root.Read(kova::kAccountsPath), "admin:root:$y$abc\n");  // left as it was
}

}  // namespace
