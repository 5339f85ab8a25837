// Test helper: the module KOVA.ResourceMonitor.so loaded the way the host runs
// it, in a child process with unprivileged effective ids and saved ids 0, over
// the real platform, and its methods called through its table.

#ifndef KOVA_TEST_SUPPORT_MODULE_HOST_H_
#define KOVA_TEST_SUPPORT_MODULE_HOST_H_

#include <dlfcn.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <functional>
#include <string>

#include "kova/webapi.h"
#include "test_support/host_call.h"
#include "test_support/module_tables.h"
#include "test_support/run_in_child.h"

namespace kova_test {

class ModuleHost {
 public:
  // Runs `body` in a child with the host's ids (1000, saved 0) after loading
  // the module at `path`. True when the child saw no test failure.
  bool Run(const char* path, const std::function<void()>& body) {
    return RunInChild([&] {
      ASSERT_EQ(setresgid(1000, 1000, 0), 0);
      ASSERT_EQ(setresuid(1000, 1000, 0), 0);
      void* module = dlopen(path, RTLD_NOW | RTLD_LOCAL);
      ASSERT_NE(module, nullptr) << dlerror();
      auto get_table = reinterpret_cast<GetAPITableFunc>(dlsym(module, kGetAPITableSymbol));
      ASSERT_NE(get_table, nullptr);
      table_ = get_table();
      body();
    });
  }

  // Calls `method` of `api` through the loaded module's table.
  KOVA::APIResponse Call(const char* api, const char* method, const std::string& params = "{}",
                         const std::string& language = "enu") const {
    return CallThroughTable(table_, api, method, params, language);
  }

 private:
  const APITableEntry* table_ = nullptr;
};

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_MODULE_HOST_H_
