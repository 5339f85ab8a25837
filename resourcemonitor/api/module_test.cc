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

KOVA::APIResponse Call(const Module& module, const char* api, const char* method,
                       const std::string& params) {
  return kova_test::CallThroughTable(module.table, api, method, params);
}

std::string Name(const char* api, intptr_t version, const char* method) {
  return std::string(api) + " v" + std::to_string(version) + " " + method;
}

constexpr char kSetting[] = "KOVA.ResourceMonitor.Setting";

TEST(ModuleTest, TablesListTheMethodsInOrderUpToTheirTerminators) {
  EXPECT_TRUE(RunInChild([] {
    Module module = Load();
    ASSERT_NE(module.table, nullptr);
    std::vector<std::string> methods;
    for (const APITableEntry* row = module.table; row->api != nullptr; ++row) {
      EXPECT_NE(row->handler, nullptr);
      methods.push_back(Name(row->api, row->version, row->method));
    }
    EXPECT_THAT(
        methods,
        ElementsAre(
            "KOVA.ResourceMonitor.Setting v1 set", "KOVA.ResourceMonitor.Setting v1 get",
            "KOVA.ResourceMonitor.Log v1 list", "KOVA.ResourceMonitor.Log v1 clear",
            "KOVA.ResourceMonitor.Log v1 export", "KOVA.ResourceMonitor.EventRule v1 list",
            "KOVA.ResourceMonitor.EventRule v1 get", "KOVA.ResourceMonitor.EventRule v1 set",
            "KOVA.ResourceMonitor.EventRule v1 delete", "KOVA.ResourceMonitor.EventRule v1 onoff"));
    const APITableEntry& end = module.table[methods.size()];
    EXPECT_TRUE(end.version == 0 && end.method == nullptr && end.handler == nullptr);

    std::vector<std::string> checked;
    KOVA::APIRequest request(Json::Value(), "admin", "enu");
    for (const APICheckEntry* row = module.checks; row->api != nullptr; ++row) {
      checked.push_back(Name(row->api, row->version, row->method));
      EXPECT_EQ(row->check(&request), 1);
      EXPECT_EQ(row->reserved1, 0);
      EXPECT_EQ(row->reserved2, 0);
    }
    EXPECT_THAT(checked, ElementsAre("KOVA.ResourceMonitor.Setting v1 set",
                                     "KOVA.ResourceMonitor.Setting v1 get"));
    EXPECT_NE(module.checks[0].check, module.checks[1].check);
    const APICheckEntry& check_end = module.checks[2];
    EXPECT_TRUE(check_end.version == 0 && check_end.method == nullptr &&
                check_end.check == nullptr && check_end.reserved1 == 0 && check_end.reserved2 == 0);
  }));
}

TEST(ModuleTest, AnswersSettingsThroughTheTable) {
  EXPECT_TRUE(RunInChild([] {
    kova_fake::Reset();
    Module module = Load();
    ASSERT_NE(module.table, nullptr);
    kova_fake::SetConf("/etc/kovainfo.conf", "resourcemonitor_realtime_max", "60");
    kova_fake::SetConf("/etc/kovainfo.conf", "resourcemonitor_performance_event", "yes");
    KOVA::APIResponse got = Call(module, kSetting, "get", "{}");
    EXPECT_EQ(got.GetData(), ParseJson(R"({"duration": 60, "enable_history": false,
                                           "enable_event": true})"));
    KOVA::APIResponse set = Call(module, kSetting, "set", R"({"duration": 120})");
    EXPECT_EQ(set.GetState(), KOVA::APIResponse::State::kSuccess);
    EXPECT_EQ(kova_fake::GetConf("/etc/kovainfo.conf", "resourcemonitor_realtime_max"), "120");
  }));
}

// A fresh process has never filled its error record: a failure that sets no
// code, or only a code, reports the record as it was created.
TEST(ModuleTest, FirstFailuresOfAFreshProcessReportTheInitialRecord) {
  const struct {
    const char* api;
    const char* method;
    const char* params;
    int code;
  } cases[] = {
      // The duration write fails and records nothing.
      {kSetting, "set", R"({"duration": 60})", 6199},
      // A wrong type, or a rule that can't be read, records only its code.
      {kSetting, "set", R"({"duration": "60"})", 6101},
      {"KOVA.ResourceMonitor.EventRule", "get", R"({"id": "1"})", 6102},
      // An unreadable log answers the record as it is, beside an empty page.
      {"KOVA.ResourceMonitor.Log", "list", "{}", 6199},
  };
  for (const auto& c : cases) {
    EXPECT_TRUE(RunInChild([&c] {
      kova_fake::Reset();
      kova_fake::FailConfWrite("resourcemonitor_realtime_max", -1);
      kova_fake::FailLogPath(true);
      Module module = Load();
      ASSERT_NE(module.table, nullptr);
      KOVA::APIResponse response = Call(module, c.api, c.method, c.params);
      EXPECT_EQ(response.GetErrorCode(), c.code);
      Json::Value expected = ParseJson(R"({"err_line": 0, "err_msg": "",
                                           "err_session": "", "err_key": ""})");
      if (std::string(c.method) == "list") {
        expected["total"] = Json::UInt(0);
        expected["logs"] = Json::Value(Json::arrayValue);
      }
      EXPECT_EQ(response.GetData(), expected);
    })) << c.params;
  }
}

}  // namespace
