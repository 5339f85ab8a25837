#include "common/temp_file.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "kova/error.h"

namespace {

TEST(TempFileTest, CreatesAFreshPrivateFileUnderThePrefix) {
  char first[64];
  char second[64];
  ASSERT_EQ(kova::MakeTempFile("/tmp/kovatest", first, sizeof(first)), 0);
  ASSERT_EQ(kova::MakeTempFile("/tmp/kovatest", second, sizeof(second)), 0);
  EXPECT_STRNE(first, second);
  EXPECT_EQ(std::string(first).rfind("/tmp/kovatest", 0), 0u);
  struct stat info;
  ASSERT_EQ(lstat(first, &info), 0);
  EXPECT_TRUE(S_ISREG(info.st_mode));
  EXPECT_EQ(info.st_mode & 07777, 0600u);
  EXPECT_EQ(info.st_size, 0);
  unlink(first);
  unlink(second);
}

TEST(TempFileTest, FailsWithAnEmptyNameWhenThePathDoesNotFitOrCannotBeMade) {
  char name[16] = "stale";
  EXPECT_EQ(kova::MakeTempFile("/tmp/a-long-prefix", name, sizeof(name)), -1);
  EXPECT_STREQ(name, "");
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_INVALID);

  char other[64] = "stale";
  EXPECT_EQ(kova::MakeTempFile("/nonexistent-dir/x", other, sizeof(other)), -1);
  EXPECT_STREQ(other, "");
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_IO);
}

}  // namespace
