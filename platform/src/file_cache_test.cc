#include "src/file_cache.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <functional>
#include <string>
#include <thread>

#include "kova/conf.h"
#include "src/lun_registry.h"
#include "test_support/test_root.h"

namespace {

// Long enough for a file written now to be kept by the caches.
constexpr auto kSettle = std::chrono::milliseconds(1200);

timespec ModifiedTime(const std::string& path) {
  struct stat info {};
  stat(path.c_str(), &info);
  return info.st_mtim;
}

void SetModifiedTime(const std::string& path, const timespec& time) {
  const timespec times[2] = {time, time};
  ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0) << path;
}

// Writes `content` over the file's own inode, keeping its modification time.
void RewriteInPlace(const std::string& path, const std::string& content) {
  const timespec modified = ModifiedTime(path);
  FILE* file = fopen(path.c_str(), "r+");
  ASSERT_NE(file, nullptr) << path;
  fwrite(content.data(), 1, content.size(), file);
  ASSERT_EQ(ftruncate(fileno(file), static_cast<off_t>(content.size())), 0);
  fclose(file);
  SetModifiedTime(path, modified);
}

// Renames a new file with `content` and the old modification time over `path`.
void ReplaceByRename(const std::string& path, const std::string& content) {
  const timespec modified = ModifiedTime(path);
  const std::string temporary = path + ".new";
  FILE* file = fopen(temporary.c_str(), "w");
  ASSERT_NE(file, nullptr) << temporary;
  fwrite(content.data(), 1, content.size(), file);
  fclose(file);
  SetModifiedTime(temporary, modified);
  ASSERT_EQ(rename(temporary.c_str(), path.c_str()), 0);
}

std::string ReadKey(const char* file, const char* key) {
  char value[64] = {};
  const int found = QLIBCFileGetKeyValue(file, key, value, sizeof(value), 0);
  return found > 0 ? value : found == 0 ? "<none>" : "<error>";
}

TEST(FileCacheTest, SeesEveryChangeOfAKeptFile) {
  kova_test::TestRoot root;
  const struct {
    const char* file;
    std::function<void(const std::string&)> change;
    const char* after;
  } cases[] = {
      {"/etc/same_size.conf", [](const std::string& path) { RewriteInPlace(path, "v=\"bbbb\"\n"); },
       "bbbb"},
      {"/etc/renamed.conf", [](const std::string& path) { ReplaceByRename(path, "v=\"cccc\"\n"); },
       "cccc"},
      {"/etc/deleted.conf", [](const std::string& path) { unlink(path.c_str()); }, "<none>"},
      {"/etc/grown.conf",
       [](const std::string& path) { RewriteInPlace(path, "v=\"aaaa-and-more\"\n"); },
       "aaaa-and-more"},
      {"/etc/unchanged.conf", [](const std::string&) {}, "aaaa"},
  };
  for (const auto& c : cases) root.Write(c.file, "v=\"aaaa\"\n");
  std::this_thread::sleep_for(kSettle);
  for (const auto& c : cases) ASSERT_EQ(ReadKey(c.file, "v"), "aaaa") << c.file;
  for (const auto& c : cases) c.change(root.Path(c.file));
  for (const auto& c : cases) EXPECT_EQ(ReadKey(c.file, "v"), c.after) << c.file;
}

// The registry keeps its table in the same cache as the key-value files: the
// change that only the inode's change time shows, and a removal, suffice here.
TEST(FileCacheTest, ReadsTheLunRegistryAgainOnceChanged) {
  kova_test::TestRoot root;
  const std::string registry = "/etc/kova/iscsi/luns.json";
  const auto text = [](const char* name) {
    return std::string(R"({"luns": [{"uuid": "u-1", "name": ")") + name + "\"}]}\n";
  };
  const struct {
    const char* what;
    std::function<void(const std::string&)> change;
    const char* name;  // of u-1 afterwards, empty when it is gone
  } cases[] = {
      {"same size", [&](const std::string& path) { RewriteInPlace(path, text("Bbbb")); }, "Bbbb"},
      {"delete", [](const std::string& path) { unlink(path.c_str()); }, ""},
  };
  for (const auto& c : cases) {
    root.Write(registry, text("Aaaa"));
    std::this_thread::sleep_for(kSettle);
    kova::Lun lun;
    ASSERT_EQ(kova::FindLun("u-1", lun), 1) << c.what;
    ASSERT_EQ(lun.name, "Aaaa") << c.what;
    c.change(root.Path(registry));
    lun = {};
    EXPECT_EQ(kova::FindLun("u-1", lun), c.name[0] == '\0' ? 0 : 1) << c.what;
    EXPECT_EQ(lun.name, c.name) << c.what;
  }
}

}  // namespace
