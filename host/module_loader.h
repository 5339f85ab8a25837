// Finding, loading and checking web-API modules, and registering their methods
// with the platform's registry of in-process web APIs.

#ifndef KOVA_HOST_MODULE_LOADER_H_
#define KOVA_HOST_MODULE_LOADER_H_

#include <string>
#include <vector>

#include "kova/webapi.h"

namespace kova_host {

// Tables longer than this are taken to have lost their terminator.
inline constexpr int kMaxTableRows = 4096;

// Checks a module's tables, each walked to its all-zero row: every method row
// has an API name, a version from 1, a method name and a handler, and no
// (api, version, method) comes twice; every check row names a method of the
// table and has a callback. Returns "" or what is wrong.
std::string CheckTables(const APITableEntry* table, const APICheckEntry* checks);

struct LoadedModule {
  std::string path;
  void* handle = nullptr;
  const APITableEntry* table = nullptr;
};

// Loads every *.so of `dir`, in name order, checks its tables and registers its
// methods. A module that can't be loaded, whose tables fail the checks or that
// repeats another's method is reported on standard error and left out.
std::vector<LoadedModule> LoadModules(const std::string& dir);

}  // namespace kova_host

#endif  // KOVA_HOST_MODULE_LOADER_H_
