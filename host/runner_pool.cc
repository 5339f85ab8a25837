#include "host/runner_pool.h"

#include <set>

#include "host/host_log.h"
#include "host/module_loader.h"
#include "kova/webapi.h"

namespace kova_host {

// One module's runner, started and stopped through the monitor.
struct RunnerPool::Module : RunnerLauncher {
  Module(MonitorClient& monitor, std::string file, std::chrono::milliseconds call_timeout,
         size_t max_waiting)
      : monitor(monitor), file(std::move(file)), client(*this, call_timeout, max_waiting) {}

  int Start(int& taken_fd, std::string& error) override {
    return monitor.Start(file, taken_fd, error);
  }
  void Stop() override { monitor.Stop(file); }

  MonitorClient& monitor;
  const std::string file;
  RunnerClient client;  // last: it stops its dispatcher before the rest goes
};

RunnerPool::RunnerPool(MonitorClient& monitor, std::chrono::milliseconds call_timeout,
                       size_t max_waiting)
    : monitor_(monitor),
      call_timeout_(call_timeout),
      max_waiting_(max_waiting),
      methods_(std::make_shared<const Json::Value>(Json::arrayValue)) {}

RunnerPool::~RunnerPool() = default;

bool RunnerPool::Start(const std::string& modules_dir, std::string& error) {
  std::vector<std::string> files;
  if (!ListModules(modules_dir, files, error)) return false;
  // The platform's own APIs, which every runner serves beside its module's.
  std::set<std::string> platform_apis;
  for (const Json::Value& row : KOVA::APIRunner::List())
    platform_apis.insert(row["api"].asString());
  Json::Value methods(Json::arrayValue);
  for (const std::string& file : files) {
    auto module = std::make_unique<Module>(monitor_, file, call_timeout_, max_waiting_);
    std::string why;
    if (!module->client.Start(why)) {
      HostLog("module %s left out: its runner did not start: %s", file.c_str(), why.c_str());
      continue;
    }
    if (module->client.Methods()->empty()) continue;  // the runner said why
    // An API belongs to the first module, in name order, that serves it.
    std::map<std::string, bool> taken;
    for (const Json::Value& row : *module->client.Methods()) {
      const std::string api = row["api"].asString();
      if (!taken.count(api)) taken[api] = by_api_.emplace(api, module.get()).second;
      if (taken[api]) {
        methods.append(row);
      } else if (platform_apis.count(api) == 0) {
        HostLog("module %s: %s is served by another module; left out", file.c_str(), api.c_str());
      }
    }
    modules_.push_back(std::move(module));
  }
  methods_ = std::make_shared<const Json::Value>(std::move(methods));
  return true;
}

std::shared_ptr<const Json::Value> RunnerPool::Methods() const { return methods_; }

void RunnerPool::Submit(const RunnerCall& call, CallDone done) {
  const auto found = by_api_.find(call.api);
  if (found == by_api_.end()) {
    done(CallResult::kFailed, RunnerAnswer(), "no module serves " + call.api);
    return;
  }
  found->second->client.Submit(call, std::move(done));
}

}  // namespace kova_host
