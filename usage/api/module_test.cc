// Loads the built module the way the host does and calls it through its tables.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "fake/kova_fake.h"
#include "kova/webapi.h"
#include "test_support/host_call.h"
#include "test_support/module_tables.h"
#include "test_support/run_in_child.h"

namespace {

using kova_test::ParseJson;
using kova_test::RunInChild;
using ::testing::ElementsAre;

using Module = kova_test::ModuleTables;

// Loads the module in this process; each test does so in a child of its own,
// so that every test starts from a freshly loaded module.
Module Load() { return kova_test::LoadModuleTables(KOVA_MODULE_PATH); }

TEST(UsageModuleTest, TablesListTheThreeMethodsAndNoChecks) {
  EXPECT_TRUE(RunInChild([] {
    Module module = Load();
    ASSERT_NE(module.table, nullptr);
    std::vector<std::string> methods;
    for (const APITableEntry* row = module.table; row->api != nullptr; ++row) {
      EXPECT_NE(row->handler, nullptr);
      methods.push_back(std::string(row->api) + " v" + std::to_string(row->version) + " " +
                        row->method);
    }
    EXPECT_THAT(methods, ElementsAre("KOVA.ResourceMonitor.Usage v1 catalog",
                                     "KOVA.ResourceMonitor.Usage v1 realtime",
                                     "KOVA.ResourceMonitor.Usage v1 history"));
    const APITableEntry& end = module.table[methods.size()];
    EXPECT_TRUE(end.version == 0 && end.method == nullptr && end.handler == nullptr);
    const APICheckEntry& checks = module.checks[0];
    EXPECT_TRUE(checks.api == nullptr && checks.version == 0 && checks.method == nullptr &&
                checks.check == nullptr && checks.reserved1 == 0 && checks.reserved2 == 0);
  }));
}

TEST(UsageModuleTest, AnswersThroughTheTable) {
  const struct {
    const char* method;
    const char* params;
    bool queued;
    int code;  // 0: success
    const char* data;
  } cases[] = {
      {"catalog", "{}", true, 0, R"({"interval": 1})"},
      {"realtime", R"({"series": ["cpu.user"]})", false, 6201,
       R"({"err_msg": "Kein Statistikdienst", "err_session": "usage",
           "err_key": "collector_unavailable"})"},
      {"history", R"({"series": ["cpu.user"], "from": 2, "to": 1})", true, 101,
       R"({"param": "to"})"},
  };
  for (const auto& c : cases) {
    EXPECT_TRUE(RunInChild([&c] {
      kova_fake::Reset();
      kova_fake::SetText("usage", "collector_unavailable", "Kein Statistikdienst");
      if (c.queued) {
        kova_fake::QueueExchange(
            {0, 0, ParseJson(R"({"success": true, "data": {"interval": 1}})")});
      }
      Module module = Load();
      ASSERT_NE(module.table, nullptr);
      const KOVA::APIResponse response = kova_test::CallThroughTable(
          module.table, "KOVA.ResourceMonitor.Usage", c.method, c.params);
      EXPECT_EQ(response.GetErrorCode(), c.code);
      EXPECT_EQ(response.GetData(), ParseJson(c.data));
    })) << c.method;
  }
}

}  // namespace
