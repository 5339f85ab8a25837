// Loads the built module the way the host does and calls it through its tables.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <set>
#include <string>

#include "fake/kova_fake.h"
#include "kova/webapi.h"
#include "test_support/host_call.h"
#include "test_support/module_tables.h"
#include "test_support/run_in_child.h"

namespace {

using kova_test::ParseJson;
using kova_test::RunInChild;

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

// The host walks each table up to its all-zero row and calls what a row names.
TEST(ModuleTest, TablesEndWithTheirZeroRowAndEveryRowCanBeCalled) {
  EXPECT_TRUE(RunInChild([] {
    Module module = Load();
    ASSERT_NE(module.table, nullptr);
    ASSERT_NE(module.checks, nullptr);
    std::set<std::string> methods;
    const APITableEntry* row = module.table;
    for (; row->api != nullptr; ++row) {
      const std::string name = Name(row->api, row->version, row->method);
      EXPECT_NE(row->method, nullptr) << name;
      EXPECT_NE(row->handler, nullptr) << name;
      EXPECT_TRUE(methods.insert(name).second) << name << " listed twice";
    }
    EXPECT_TRUE(row->version == 0 && row->method == nullptr && row->handler == nullptr);

    KOVA::APIRequest request(Json::Value(), "admin", "enu");
    const APICheckEntry* check = module.checks;
    for (; check->api != nullptr; ++check) {
      const std::string name = Name(check->api, check->version, check->method);
      EXPECT_EQ(methods.count(name), 1u) << name << " is checked but not served";
      ASSERT_NE(check->check, nullptr) << name;
      EXPECT_EQ(check->check(&request), 1) << name;
    }
    EXPECT_TRUE(check->version == 0 && check->method == nullptr && check->check == nullptr &&
                check->reserved1 == 0 && check->reserved2 == 0);
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
