#include "src/lun_api.h"

#include <gtest/gtest.h>

#include "kova/error.h"
#include "kova/webapi.h"
#include "src/lun_registry.h"
#include "test_support/host_call.h"
#include "test_support/test_root.h"

namespace {

using kova_test::ParseJson;

TEST(LunRegistryTest, AddsListsAndRemoves) {
  kova_test::TestRoot root;
  std::vector<kova::Lun> luns;
  ASSERT_EQ(kova::ReadLuns(luns), 0);
  EXPECT_TRUE(luns.empty());
  ASSERT_EQ(kova::AddLun({"b-2", "Backup", 2048, "/volume1"}), 0);
  ASSERT_EQ(kova::AddLun({"a-1", "Archive", 0, ""}), 0);
  const kova::Lun refused[] = {
      {"b-2", "Again", 1, ""}, {"", "x", 1, ""},          {"a/b", "x", 1, ""},
      {"c", "", 1, ""},        {"c", "tab\tname", 1, ""}, {"c", "x", -1, ""},
  };
  for (const kova::Lun& lun : refused) {
    EXPECT_EQ(kova::AddLun(lun), -1) << lun.uuid << " " << lun.name;
    EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_INVALID);
  }
  ASSERT_EQ(kova::ReadLuns(luns), 0);
  ASSERT_EQ(luns.size(), 2u);
  EXPECT_EQ(luns[0].name, "Backup");
  EXPECT_EQ(luns[1].uuid, "a-1");
  EXPECT_EQ(kova::RemoveLun("b-2"), 0);
  EXPECT_EQ(kova::RemoveLun("b-2"), -1);
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_NOT_FOUND);
  ASSERT_EQ(kova::ReadLuns(luns), 0);
  ASSERT_EQ(luns.size(), 1u);
  EXPECT_EQ(luns[0].uuid, "a-1");
}

TEST(LunApiTest, AnswersGetFromTheRegistry) {
  kova_test::TestRoot root;
  ASSERT_EQ(kova::AddLun({"b-2", "Backup", 2048, "/volume1"}), 0);
  const struct {
    const char* params;
    const char* out;
  } cases[] = {
      {R"({"uuid": "b-2"})", R"({"success": true, "data": {"lun": {"uuid": "b-2", "name": "Backup",
                                 "size_mb": 2048, "location": "/volume1"}}})"},
      {R"({"uuid": "gone"})", R"({"success": false, "error": {"code": 18990}})"},
      {R"({"uuid": 7})", R"({"success": false, "error": {"code": 101}})"},
      {R"({})", R"({"success": false, "error": {"code": 101}})"},
  };
  for (const auto& c : cases) {
    Json::Value out;
    EXPECT_EQ(KOVA::APIRunner::Exec(out, kova::kLunApi, 1, "get", ParseJson(c.params), "admin"), 0);
    EXPECT_EQ(out, ParseJson(c.out)) << c.params;
  }
  root.Write("/etc/kova/iscsi/luns.json", "{\"luns\": 3}");
  Json::Value out;
  KOVA::APIRunner::Exec(out, kova::kLunApi, 1, "get", ParseJson(R"({"uuid": "b-2"})"), "admin");
  EXPECT_EQ(out, ParseJson(R"({"success": false, "error": {"code": 100}})"));
}

}  // namespace
