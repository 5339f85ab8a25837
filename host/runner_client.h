// The front-end's side of the runner: one call at a time, each bounded in time;
// a runner that dies or runs late is stopped and replaced by a fresh one.

#ifndef KOVA_HOST_RUNNER_CLIENT_H_
#define KOVA_HOST_RUNNER_CLIENT_H_

#include <json/value.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <string>

#include "host/runner_protocol.h"

namespace kova_host {

// Starts and stops runners; the monitor does it for the front-end.
class RunnerLauncher {
 public:
  virtual ~RunnerLauncher() = default;
  // A fresh runner's socket, or -1 with `error`.
  virtual int Start(std::string& error) = 0;
  // Stops the runner at once.
  virtual void Stop() = 0;
};

class RunnerClient {
 public:
  RunnerClient(RunnerLauncher& launcher, std::chrono::milliseconds call_timeout);
  ~RunnerClient();

  // Starts a runner when none runs and waits for it to load its modules.
  bool Start(std::string& error);

  // Runs one call. When the runner fails to answer in time, or dies, it is
  // stopped and a fresh one started, and the result is false with `error`.
  bool Call(const RunnerCall& call, RunnerAnswer& answer, std::string& error);

  // Whether a runner is up (it may still die on the next call).
  bool Running() const { return running_; }

  // The methods the last started runner serves: {"api", "version", "method"}.
  std::shared_ptr<const Json::Value> Methods() const;

 private:
  bool StartLocked(std::string& error);
  void StopLocked();

  RunnerLauncher& launcher_;
  const std::chrono::milliseconds call_timeout_;
  std::mutex call_mutex_;  // one call at a time
  int fd_ = -1;
  std::unique_ptr<FrameReader> reader_;
  std::atomic<bool> running_{false};
  mutable std::mutex methods_mutex_;
  std::shared_ptr<const Json::Value> methods_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_RUNNER_CLIENT_H_
