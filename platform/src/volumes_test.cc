#include <gtest/gtest.h>
#include <unistd.h>

#include "kova/error.h"
#include "kova/service.h"
#include "src/system_root.h"
#include "src/volumes.h"
#include "test_support/test_root.h"

namespace {

TEST(VolumesTest, FollowsShareLinksIntoVolumes) {
  kova_test::TestRoot root;
  kova::MakeDirectories(root.Path("/volume1/@database/pgsql"), 0755);
  kova::MakeDirectories(root.Path("/volume2/share"), 0755);
  kova::MakeDirectories(root.Path("/var/services"), 0755);
  ASSERT_EQ(symlink("/volume1/@database/pgsql", root.Path("/var/services/pgsql").c_str()), 0);
  ASSERT_EQ(symlink("../../volume2/./share", root.Path("/var/services/share").c_str()), 0);
  ASSERT_EQ(symlink("/volume3/gone", root.Path("/var/services/gone").c_str()), 0);
  const struct {
    const char* link;
    size_t size;
    int result;
    std::string volume;
  } cases[] = {
      {"pgsql", 4095, 1, root.Path("/volume1")},
      {"share", 4095, 1, root.Path("/volume2")},
      {"gone", 4095, 0, ""},
      {"absent", 4095, 0, ""},
      {"../services/pgsql", 4095, -1, ""},
      {"pgsql", 4, -1, ""},
  };
  for (const auto& c : cases) {
    char volume[4095] = "";
    EXPECT_EQ(KOVAShareServiceVolumeGetbyLink(c.link, volume, c.size), c.result) << c.link;
    EXPECT_EQ(volume, c.volume) << c.link;
  }
}

TEST(VolumesTest, ListsTheVolumeDirectoriesInTheirNumbersOrder) {
  kova_test::TestRoot root;
  for (const char* dir : {"/volume10", "/volume2", "/volume1/share", "/volume", "/volume07",
                          "/volumes", "/volume3x", "/usbshare1"}) {
    kova::MakeDirectories(root.Path(dir), 0755);
  }
  root.Write("/volume4", "a file, not a volume");
  ASSERT_EQ(symlink("/volume1", root.Path("/volume5").c_str()), 0);
  EXPECT_EQ(kova::ListVolumes(), (std::vector<std::string>{"/volume1", "/volume2", "/volume10"}));
  setenv("KOVA_ROOT", root.Path("/absent").c_str(), 1);
  EXPECT_TRUE(kova::ListVolumes().empty());
}

}  // namespace
