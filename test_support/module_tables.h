// For tests: a web-API module loaded with dlopen the way the host loads it,
// and its methods called through its table.

#ifndef KOVA_TEST_SUPPORT_MODULE_TABLES_H_
#define KOVA_TEST_SUPPORT_MODULE_TABLES_H_

#include <dlfcn.h>
#include <gtest/gtest.h>

#include <string>

#include "kova/webapi.h"
#include "test_support/host_call.h"

namespace kova_test {

struct ModuleTables {
  APITableEntry* table = nullptr;
  APICheckEntry* checks = nullptr;
};

// Loads the module at `path` into this process and returns its tables, null
// after a test failure when it can't be loaded or lacks a getter. The exported
// tables must be the ones the getters give.
inline ModuleTables LoadModuleTables(const char* path) {
  ModuleTables module;
  void* handle = dlopen(path, RTLD_NOW | RTLD_LOCAL);
  EXPECT_NE(handle, nullptr) << dlerror();
  if (handle == nullptr) return module;
  auto get_table = reinterpret_cast<GetAPITableFunc>(dlsym(handle, kGetAPITableSymbol));
  auto get_checks = reinterpret_cast<GetAPICheckTableFunc>(dlsym(handle, kGetAPICheckTableSymbol));
  EXPECT_NE(get_table, nullptr);
  EXPECT_NE(get_checks, nullptr);
  if (get_table == nullptr || get_checks == nullptr) return module;
  module.table = get_table();
  module.checks = get_checks();
  EXPECT_EQ(dlsym(handle, "gTable"), module.table);
  EXPECT_EQ(dlsym(handle, "gCheckTable"), module.checks);
  return module;
}

// Calls `method` of `api` through `table` with the parameters written in
// `params`; a test failure, and an unsettled response, when the table lacks it.
inline KOVA::APIResponse CallThroughTable(const APITableEntry* table, const char* api,
                                          const char* method, const std::string& params = "{}",
                                          const std::string& language = "enu") {
  for (const APITableEntry* row = table; row != nullptr && row->api != nullptr; ++row) {
    if (std::string(row->api) == api && std::string(row->method) == method) {
      return CallHandler(row->handler, params, language);
    }
  }
  ADD_FAILURE() << api << " " << method << " not in the table";
  return KOVA::APIResponse();
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_MODULE_TABLES_H_
