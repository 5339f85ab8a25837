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

// The file names of the modules in `dir` (every *.so not starting with a
// dot), in name order. False with `error` when the folder can't be read.
bool ListModules(const std::string& dir, std::vector<std::string>& names, std::string& error);

// Whether `name` could be a name that ListModules gives: no path.
bool IsModuleName(const std::string& name);

// Loads the module at `path`, checks its tables and registers its methods.
// "" on success; else why it was left out (it can't be loaded, its tables
// fail the checks or it repeats a method registered already).
std::string LoadModule(const std::string& path, LoadedModule& module);

}  // namespace kova_host

#endif  // KOVA_HOST_MODULE_LOADER_H_
