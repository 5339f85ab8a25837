#include "host/module_loader.h"

#include <gtest/gtest.h>

namespace kova_host {
namespace {

void Handler(KOVA::APIRequest*, KOVA::APIResponse*) {}
int Check(KOVA::APIRequest*) { return 1; }

constexpr char kApi[] = "Test.Api";

TEST(ModuleLoaderTest, ChecksTablesUpToTheirTerminators) {
  const APITableEntry good[] = {{kApi, 1, "get", Handler}, {kApi, 2, "get", Handler}, {}};
  const APICheckEntry checks[] = {{kApi, 2, "get", Check, 0, 0}, {}};
  EXPECT_EQ(CheckTables(good, checks), "");
  EXPECT_EQ(CheckTables(good, nullptr), "");

  const APITableEntry twice[] = {{kApi, 1, "get", Handler}, {kApi, 1, "get", Handler}, {}};
  const APITableEntry no_handler[] = {{kApi, 1, "get", nullptr}, {}};
  const APITableEntry no_api[] = {{nullptr, 1, "get", Handler}, {}};
  const APITableEntry no_method[] = {{kApi, 1, "", Handler}, {}};
  const APITableEntry version_zero[] = {{kApi, 0, "get", Handler}, {}};
  const APICheckEntry stray_check[] = {{kApi, 3, "get", Check, 0, 0}, {}};
  const APICheckEntry no_callback[] = {{kApi, 1, "get", nullptr, 0, 0}, {}};
  const struct {
    const APITableEntry* table;
    const APICheckEntry* checks;
    const char* fault;
  } cases[] = {
      {twice, nullptr, "Test.Api v1 get comes twice"},
      {no_handler, nullptr, "Test.Api v1 get has no handler"},
      {no_api, nullptr, "API table row 1 has no API name"},
      {no_method, nullptr, "API table row 1 has no method name"},
      {version_zero, nullptr, "API table row 1 has a bad version"},
      {good, stray_check, "a check names Test.Api v3 get, no method of it"},
      {good, no_callback, "the check of Test.Api v1 get has no callback"},
  };
  for (const auto& c : cases) EXPECT_EQ(CheckTables(c.table, c.checks), c.fault);

  std::vector<APITableEntry> endless(kMaxTableRows + 1);
  for (size_t i = 0; i < endless.size(); ++i) {
    endless[i] = {kApi, static_cast<intptr_t>(i + 1), "get", Handler};
  }
  endless.push_back({});
  EXPECT_EQ(CheckTables(endless.data(), nullptr), "its API table has no terminating row");
}

}  // namespace
}  // namespace kova_host
