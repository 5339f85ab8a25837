#include "src/conf_file.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "kova/conf.h"
#include "kova/error.h"
#include "src/system_root.h"
#include "test_support/run_in_child.h"
#include "test_support/test_root.h"

namespace {

using kova_test::TestRoot;

TEST(ConfFileTest, ReadsKeysAsWritten) {
  TestRoot root;
  root.Write("/etc/test.conf",
             "# comment=\"no\"\n"
             "plain=value\n"
             "  spaced  =  \"with blanks\"  \n"
             "quoted=\"say \"hi\"\"\n"
             "empty=\"\"\n"
             "crlf=\"yes\"\r\n"
             "dup=\"first\"\n"
             "dup=\"second\"\n"
             "not a key line\n"
             "#hidden=\"1\"\n"
             "prefix_longer=\"x\"\n"
             "last=\"no newline\"");
  const struct {
    const char* key;
    int result;
    const char* value;
  } cases[] = {
      {"plain", 1, "value"},      {"spaced", 1, "with blanks"}, {"quoted", 1, "say \"hi\""},
      {"empty", 1, ""},           {"crlf", 1, "yes"},           {"dup", 1, "first"},
      {"hidden", 0, "untouched"}, {"comment", 0, "untouched"},  {"prefix", 0, "untouched"},
      {"last", 1, "no newline"},  {"absent", 0, "untouched"},
  };
  for (const auto& c : cases) {
    char value[64] = "untouched";
    EXPECT_EQ(QLIBCFileGetKeyValue("/etc/test.conf", c.key, value, sizeof(value), 0), c.result)
        << c.key;
    EXPECT_STREQ(value, c.value) << c.key;
  }
  EXPECT_EQ(QLIBCFileCheckKeyValue("/etc/test.conf", "crlf", "yes", 0), 1);
  EXPECT_EQ(QLIBCFileCheckKeyValue("/etc/test.conf", "crlf", "YES", 0), 0);
  EXPECT_EQ(QLIBCFileCheckKeyValue("/etc/test.conf", "absent", "", 0), 0);
}

TEST(ConfFileTest, MissingFileHasNoKeysAndUnreadableFileFails) {
  TestRoot root;
  char value[16] = "untouched";
  EXPECT_EQ(QLIBCFileGetKeyValue("/etc/missing.conf", "key", value, sizeof(value), 0), 0);
  EXPECT_STREQ(value, "untouched");
  kova::MakeDirectories(root.Path("/etc/directory.conf"), 0755);
  EXPECT_LT(QLIBCFileGetKeyValue("/etc/directory.conf", "key", value, sizeof(value), 0), 0);
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_IO);
  EXPECT_LT(QLIBCFileCheckKeyValue("/etc/directory.conf", "key", "v", 0), 0);
  root.Write("/etc/long.conf", "long=\"abcdefghij\"\n");
  char cut[5];
  EXPECT_GT(QLIBCFileGetKeyValue("/etc/long.conf", "long", cut, sizeof(cut), 0), 0);
  EXPECT_STREQ(cut, "abcd");
}

TEST(ConfFileTest, WritesKeepOtherLinesAndTheirOrder) {
  TestRoot root;
  root.Write(kKovaInfoConf, "# settings\nfirst=\"1\"\n\nmiddle=old\nmiddle=\"dup\"\nlast=\"3\"");
  ASSERT_EQ(QLIBCINFOSetKeyValue("middle", "new value"), 0);
  ASSERT_EQ(QLIBCINFOSetKeyValue("added", "a \"quoted\" word"), 0);
  EXPECT_EQ(root.Read(kKovaInfoConf),
            "# settings\nfirst=\"1\"\n\nmiddle=\"new value\"\nlast=\"3\"\n"
            "added=\"a \"quoted\" word\"\n");
  char value[64];
  ASSERT_EQ(QLIBCFileGetKeyValue(kKovaInfoConf, "added", value, sizeof(value), 0), 1);
  EXPECT_STREQ(value, "a \"quoted\" word");
}

TEST(ConfFileTest, CreatesAMissingFileAndRefusesBadKeysAndValues) {
  TestRoot root;
  ASSERT_EQ(kova::ConfWrite(root.Path("/etc/new/dir/x.conf"), "k", "v"), 0);
  EXPECT_EQ(root.Read("/etc/new/dir/x.conf"), "k=\"v\"\n");

  ASSERT_EQ(QLIBCINFOSetKeyValue("kept", "1"), 0);
  const struct {
    const char* key;
    std::string value;
  } refused[] = {
      {"", "v"}, {"has space", "v"}, {"a=b", "v"}, {"#k", "v"}, {"k", "two\nlines"}, {"k", "cr\r"},
  };
  for (const auto& c : refused) {
    EXPECT_EQ(kova::ConfWrite(root.Path(kKovaInfoConf), c.key, c.value), -1) << c.key;
    EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_INVALID);
  }
  EXPECT_EQ(QLIBCINFOSetKeyValue(nullptr, "v"), -1);
  EXPECT_EQ(root.Read(kKovaInfoConf), "kept=\"1\"\n");
}

// Writers in several processes, each setting keys of its own, lose none.
TEST(ConfFileTest, ConcurrentWritersKeepEveryKey) {
  TestRoot root;
  constexpr int kWriters = 4;
  constexpr int kKeys = 40;
  pid_t writers[kWriters];
  for (int w = 0; w < kWriters; ++w) {
    writers[w] = fork();
    if (writers[w] == 0) {
      for (int k = 0; k < kKeys; ++k) {
        const std::string key = "w" + std::to_string(w) + "_" + std::to_string(k);
        if (QLIBCINFOSetKeyValue(key.c_str(), std::to_string(k).c_str()) != 0) _exit(1);
      }
      _exit(0);
    }
  }
  for (pid_t writer : writers) {
    int status = -1;
    ASSERT_EQ(waitpid(writer, &status, 0), writer);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  for (int w = 0; w < kWriters; ++w) {
    for (int k = 0; k < kKeys; ++k) {
      const std::string key = "w" + std::to_string(w) + "_" + std::to_string(k);
      EXPECT_EQ(QLIBCFileCheckKeyValue(kKovaInfoConf, key.c_str(), std::to_string(k).c_str(), 0), 1)
          << key;
    }
  }
}

// A writer killed at any moment leaves the old file or the new one, whole.
TEST(ConfFileTest, KilledWriterNeverLeavesAPartialFile) {
  TestRoot root;
  const std::string big_a(200000, 'a');
  const std::string big_b(200000, 'b');
  ASSERT_EQ(QLIBCINFOSetKeyValue("big", big_a.c_str()), 0);
  root.Write("/etc/kovainfo.conf.backup", "kept");
  for (int round = 0; round < 15; ++round) {
    const pid_t writer = fork();
    if (writer == 0) {
      for (;;) {
        QLIBCINFOSetKeyValue("big", big_b.c_str());
        QLIBCINFOSetKeyValue("big", big_a.c_str());
      }
    }
    usleep(1000 + round * 700);
    kill(writer, SIGKILL);
    waitpid(writer, nullptr, 0);
    std::string value;
    ASSERT_EQ(kova::ConfRead(root.Path(kKovaInfoConf), "big", value), 1);
    EXPECT_TRUE(value == big_a || value == big_b) << "round " << round << ": " << value.size();
  }
  // The next write clears what killed writers left.
  ASSERT_EQ(QLIBCINFOSetKeyValue("big", "small"), 0);
  EXPECT_EQ(root.Read(kKovaInfoConf), "big=\"small\"\n");
  int files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(root.Path("/etc"))) {
    files += entry.path().filename().string().rfind("kovainfo.conf.", 0) == 0 ? 1 : 0;
  }
  EXPECT_EQ(files, 2);  // the lock file and the operator's backup
}

// Root writes for the host's ids (the end-to-end test); a process that may not
// become root fails and says why.
TEST(ConfFileTest, UnprivilegedWriterFailsWithPermissionDenied) {
  TestRoot root;
  ASSERT_EQ(QLIBCINFOSetKeyValue("resourcemonitor_history", "yes"), 0);
  EXPECT_TRUE(kova_test::RunInChild([] {
    ASSERT_EQ(setresgid(1000, 1000, 1000), 0);
    ASSERT_EQ(setresuid(1000, 1000, 1000), 0);
    EXPECT_EQ(QLIBCINFOSetKeyValue("resourcemonitor_history", "no"), -1);
    EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_PERMISSION);
  }));
  EXPECT_EQ(root.Read(kKovaInfoConf), "resourcemonitor_history=\"yes\"\n");
}

}  // namespace
