// The front-end's side of the runner. The runner runs one call at a time; a
// dispatcher thread hands it the calls of all request threads in their order,
// keeping the next call waiting in the runner's socket so that the runner goes
// from one call to the next without waiting for the front-end. Each call is
// bounded in time from when the runner starts it; a runner that dies or runs
// late is stopped, the call that it was running fails, and a fresh runner takes
// the calls that were waiting.

#ifndef KOVA_HOST_RUNNER_CLIENT_H_
#define KOVA_HOST_RUNNER_CLIENT_H_

#include <json/value.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

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
  RunnerClient(const RunnerClient&) = delete;
  RunnerClient& operator=(const RunnerClient&) = delete;

  // Starts the first runner, waits for it to load its modules, and starts the
  // dispatcher. The dispatcher starts runners itself from then on.
  bool Start(std::string& error);

  // Runs one call. False with `error` when the runner failed to answer in
  // time, or died, while running it.
  bool Call(const RunnerCall& call, RunnerAnswer& answer, std::string& error);

  // The methods the last started runner serves: {"api", "version", "method"};
  // empty while no runner has started.
  std::shared_ptr<const Json::Value> Methods() const;

 private:
  struct Pending;

  bool StartRunner(std::string& error);
  void StopRunner();
  void Dispatch();
  // Sends waiting calls while the runner holds at most one unanswered call.
  bool SendWaiting();
  void Finish(Pending* pending, bool ok, const std::string& error);
  // The runner failed running the first unanswered call: that call fails, the
  // others go back to the front of the queue for a fresh runner.
  void Abandon(const std::string& error);

  RunnerLauncher& launcher_;
  const std::chrono::milliseconds call_timeout_;
  int wake_fd_ = -1;  // an eventfd: new calls are queued, or stop
  std::thread dispatcher_;

  std::mutex mutex_;
  std::deque<Pending*> queue_;  // calls not yet sent, in order
  bool stopping_ = false;

  // Used by the dispatcher only (and by Start before it runs).
  int fd_ = -1;
  std::unique_ptr<FrameReader> reader_;
  std::deque<Pending*> sent_;  // sent calls, the first one running
  Clock::time_point running_since_;

  mutable std::mutex methods_mutex_;
  std::shared_ptr<const Json::Value> methods_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_RUNNER_CLIENT_H_
