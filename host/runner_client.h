// The front-end's side of one runner. The runner runs one call at a time; a
// dispatcher thread hands it the calls submitted, in their order,
// keeping the next call waiting in the runner's socket so that the runner goes
// from one call to the next without waiting for the front-end. Each call is
// bounded in time from when the runner starts it; a runner that dies or runs
// late is stopped, the call that it was running fails, and a fresh runner takes
// the calls that were waiting, and a call that the runner had not yet taken.

#ifndef KOVA_HOST_RUNNER_CLIENT_H_
#define KOVA_HOST_RUNNER_CLIENT_H_

#include <json/value.h>

#include <atomic>
#include <chrono>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "host/runner_protocol.h"
#include "host/taken_count.h"

namespace kova_host {

// Starts and stops runners; the monitor does it for the front-end.
class RunnerLauncher {
 public:
  virtual ~RunnerLauncher() = default;
  // A fresh runner's socket, with the memory file of its TakenCount in
  // `taken_fd` (both the caller's to close), or -1 with `error`.
  virtual int Start(int& taken_fd, std::string& error) = 0;
  // Stops the runner at once.
  virtual void Stop() = 0;
};

enum class CallResult {
  kAnswered,  // the runner answered; the answer holds it
  kFailed,    // the runner died or ran late running the call, or none could start
  kBusy,      // too many calls wait for the runner already
};
// Receives a call's outcome, with what went wrong when it was not answered.
using CallDone = std::function<void(CallResult result, RunnerAnswer answer, std::string error)>;

class RunnerClient {
 public:
  // At most `max_waiting` calls, and 64 MiB of them, wait for the runner
  // besides those it was sent.
  RunnerClient(RunnerLauncher& launcher, std::chrono::milliseconds call_timeout,
               size_t max_waiting);
  ~RunnerClient();
  RunnerClient(const RunnerClient&) = delete;
  RunnerClient& operator=(const RunnerClient&) = delete;

  // Starts the first runner, waits for it to load its modules, and starts the
  // dispatcher. The dispatcher starts runners itself from then on.
  bool Start(std::string& error);

  // Queues a call. `done` runs exactly once: at once when the queue is full
  // (kBusy) or the client is stopping (kFailed), else on the dispatcher's
  // thread when the call ends. It must not block.
  void Submit(const RunnerCall& call, CallDone done);

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
  // Hands the outcome to the call's owner and frees it.
  void Finish(Pending* pending, CallResult result, const std::string& error);
  // The runner failed (`why`) with the first unanswered call: that call fails
  // unless the runner never took it, and the others go back to the front of
  // the queue for a fresh runner.
  void Abandon(IoResult why);

  RunnerLauncher& launcher_;
  const std::chrono::milliseconds call_timeout_;
  const size_t max_waiting_;
  int wake_fd_ = -1;  // an eventfd: new calls are queued, or stop
  std::thread dispatcher_;

  std::mutex mutex_;
  std::deque<Pending*> queue_;  // calls not yet sent, in order
  size_t waiting_bytes_ = 0;    // their encoded size
  bool stopping_ = false;

  // Used by the dispatcher only (and by Start before it runs).
  int fd_ = -1;
  std::unique_ptr<FrameReader> reader_;
  std::deque<Pending*> sent_;          // sent calls, the first one running
  std::unique_ptr<TakenCount> taken_;  // calls the runner has taken
  uint64_t answered_ = 0;              // calls the runner has answered
  bool write_failed_ = false;          // the runner's socket takes no more calls
  Clock::time_point running_since_;

  mutable std::mutex methods_mutex_;
  std::shared_ptr<const Json::Value> methods_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_RUNNER_CLIENT_H_
