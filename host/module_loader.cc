#include "host/module_loader.h"

#include <dirent.h>
#include <dlfcn.h>
#include <errno.h>

#include <algorithm>
#include <climits>
#include <cstring>
#include <set>
#include <tuple>

#include "host/host_log.h"

namespace kova_host {
namespace {

using Key = std::tuple<std::string, intptr_t, std::string>;

std::string Describe(const Key& key) {
  return std::get<0>(key) + " v" + std::to_string(std::get<1>(key)) + " " + std::get<2>(key);
}

}  // namespace

bool IsModuleName(const std::string& name) {
  return name.size() > 3 && name.compare(name.size() - 3, 3, ".so") == 0 && name[0] != '.' &&
         name.find('/') == std::string::npos;
}

bool ListModules(const std::string& dir, std::vector<std::string>& names, std::string& error) {
  names.clear();
  DIR* stream = opendir(dir.c_str());
  if (stream == nullptr) {
    error = "cannot open the modules folder " + dir + ": " + strerror(errno);
    return false;
  }
  errno = 0;
  while (const dirent* entry = readdir(stream)) {
    if (IsModuleName(entry->d_name)) names.emplace_back(entry->d_name);
  }
  const int failed = errno;
  closedir(stream);
  if (failed != 0) {
    error = "cannot read the modules folder " + dir + ": " + strerror(failed);
    return false;
  }
  std::sort(names.begin(), names.end());
  return true;
}

std::string LoadModule(const std::string& path, LoadedModule& module) {
  void* handle = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (handle == nullptr) return dlerror();
  auto get_table = reinterpret_cast<GetAPITableFunc>(dlsym(handle, kGetAPITableSymbol));
  auto get_checks = reinterpret_cast<GetAPICheckTableFunc>(dlsym(handle, kGetAPICheckTableSymbol));
  std::string fault;
  const APITableEntry* table = get_table != nullptr ? get_table() : nullptr;
  const APICheckEntry* checks = get_checks != nullptr ? get_checks() : nullptr;
  if (table == nullptr) {
    fault = "it exports no API table";
  } else {
    fault = CheckTables(table, checks);
  }
  if (fault.empty() && KOVA::APIRunner::Register(table, checks) < 0) {
    fault = "it repeats a method that another module serves";
  }
  if (!fault.empty()) {
    dlclose(handle);
    return fault;
  }
  module = {path, handle, table};
  return "";
}

std::string CheckTables(const APITableEntry* table, const APICheckEntry* checks) {
  std::set<Key> methods;
  int rows = 0;
  for (const APITableEntry* row = table; row->api != nullptr || row->version != 0 ||
                                         row->method != nullptr || row->handler != nullptr;
       ++row) {
    if (++rows > kMaxTableRows) return "its API table has no terminating row";
    const std::string where = "API table row " + std::to_string(rows);
    if (row->api == nullptr || row->api[0] == '\0') return where + " has no API name";
    if (row->method == nullptr || row->method[0] == '\0') return where + " has no method name";
    if (row->version < 1 || row->version > INT_MAX) return where + " has a bad version";
    const Key key{row->api, row->version, row->method};
    if (row->handler == nullptr) return Describe(key) + " has no handler";
    if (!methods.insert(key).second) return Describe(key) + " comes twice";
  }
  rows = 0;
  for (const APICheckEntry* row = checks;
       row != nullptr && (row->api != nullptr || row->method != nullptr || row->check != nullptr);
       ++row) {
    if (++rows > kMaxTableRows) return "its check table has no terminating row";
    const Key key{row->api != nullptr ? row->api : "", row->version,
                  row->method != nullptr ? row->method : ""};
    if (methods.count(key) == 0) return "a check names " + Describe(key) + ", no method of it";
    if (row->check == nullptr) return "the check of " + Describe(key) + " has no callback";
  }
  return "";
}

}  // namespace kova_host
