// The runners of all modules: one runner process per module, so that calls of
// different modules never wait on each other, while each module still runs one
// call at a time. Calls are routed by their API.

#ifndef KOVA_HOST_RUNNER_POOL_H_
#define KOVA_HOST_RUNNER_POOL_H_

#include <json/value.h>

#include <chrono>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "host/monitor.h"
#include "host/runner_client.h"

namespace kova_host {

class RunnerPool {
 public:
  // At most `max_waiting` calls wait for each module's runner.
  RunnerPool(MonitorClient& monitor, std::chrono::milliseconds call_timeout, size_t max_waiting);
  ~RunnerPool();

  // Lists the modules of `modules_dir` and starts a runner for each. False
  // with `error` when the folder can't be read: then nothing could be served.
  // A module whose runner does not start is reported and left out.
  bool Start(const std::string& modules_dir, std::string& error);

  // The methods of every module: {"api", "version", "method"}.
  std::shared_ptr<const Json::Value> Methods() const;

  // Hands the call to the runner of the module that serves its API; `done`
  // runs as RunnerClient::Submit says, with kFailed when no module serves it.
  void Submit(const RunnerCall& call, CallDone done);

 private:
  struct Module;

  MonitorClient& monitor_;
  const std::chrono::milliseconds call_timeout_;
  const size_t max_waiting_;
  std::vector<std::unique_ptr<Module>> modules_;
  std::map<std::string, Module*> by_api_;  // set by Start, read-only after
  std::shared_ptr<const Json::Value> methods_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_RUNNER_POOL_H_
