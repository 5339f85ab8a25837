#include "host/runner_client.h"

#include <errno.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>

#include "host/host_log.h"

namespace kova_host {
namespace {

constexpr std::chrono::seconds kStartTimeout{60};
// A call larger than this is sent only to an idle runner, so that writing it
// can't wait on a runner that is itself waiting to write a large answer.
constexpr size_t kMaxQueuedCall = 64 * 1024;

const char* Why(IoResult result) {
  switch (result) {
    case IoResult::kClosed:
      return "the runner ended (a module crashed or aborted)";
    case IoResult::kTimeout:
      return "the call ran past its time limit";
    case IoResult::kTooLarge:
      return "the runner's answer is too large";
    default:
      return "the runner broke the protocol";
  }
}

}  // namespace

struct RunnerClient::Pending {
  std::string message;  // the encoded call
  std::string name;     // for the log
  RunnerAnswer* answer = nullptr;
  std::string error;
  bool ok = false;
  bool done = false;
  std::condition_variable finished;  // one per call: only its own thread wakes
};

RunnerClient::RunnerClient(RunnerLauncher& launcher, std::chrono::milliseconds call_timeout)
    : launcher_(launcher),
      call_timeout_(call_timeout),
      wake_fd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
      methods_(std::make_shared<const Json::Value>(Json::arrayValue)) {}

RunnerClient::~RunnerClient() {
  {
    std::lock_guard lock(mutex_);
    stopping_ = true;
  }
  const uint64_t one = 1;
  [[maybe_unused]] const ssize_t ignored = write(wake_fd_, &one, sizeof(one));
  if (dispatcher_.joinable()) dispatcher_.join();  // it waits in poll, which the write ends
  if (fd_ >= 0) close(fd_);
  if (wake_fd_ >= 0) close(wake_fd_);
}

bool RunnerClient::Start(std::string& error) {
  if (wake_fd_ < 0) {
    error = "no eventfd";
    return false;
  }
  const bool started = StartRunner(error);
  dispatcher_ = std::thread(&RunnerClient::Dispatch, this);
  return started;
}

bool RunnerClient::StartRunner(std::string& error) {
  const int fd = launcher_.Start(error);
  if (fd < 0) return false;
  Json::Value methods;
  auto reader = std::make_unique<FrameReader>(fd);
  const IoResult ready = ReceiveReady(*reader, methods, Clock::now() + kStartTimeout);
  if (ready != IoResult::kOk) {
    error = ready == IoResult::kClosed ? "the runner ended while loading the modules"
                                       : "the runner did not get ready";
    close(fd);
    launcher_.Stop();
    return false;
  }
  fd_ = fd;
  reader_ = std::move(reader);
  std::lock_guard lock(methods_mutex_);
  methods_ = std::make_shared<const Json::Value>(std::move(methods));
  return true;
}

void RunnerClient::StopRunner() {
  if (fd_ >= 0) close(fd_);
  fd_ = -1;
  reader_.reset();
  launcher_.Stop();
}

bool RunnerClient::Call(const RunnerCall& call, RunnerAnswer& answer, std::string& error) {
  Pending pending;
  pending.message = EncodeCall(call);
  pending.name = call.api + " v" + std::to_string(call.version) + " " + call.method;
  pending.answer = &answer;
  {
    std::lock_guard lock(mutex_);
    if (stopping_) {
      error = "the host is stopping";
      return false;
    }
    queue_.push_back(&pending);
  }
  const uint64_t one = 1;
  [[maybe_unused]] const ssize_t ignored = write(wake_fd_, &one, sizeof(one));
  std::unique_lock lock(mutex_);
  pending.finished.wait(lock, [&] { return pending.done; });
  error = pending.error;
  return pending.ok;
}

void RunnerClient::Finish(Pending* pending, bool ok, const std::string& error) {
  std::lock_guard lock(mutex_);
  pending->ok = ok;
  pending->error = error;
  pending->done = true;
  pending->finished.notify_one();
}

void RunnerClient::Abandon(const std::string& error) {
  Pending* running = sent_.front();
  sent_.pop_front();
  HostLog("%s: %s; starting a fresh runner", running->name.c_str(), error.c_str());
  StopRunner();
  {
    std::lock_guard lock(mutex_);
    queue_.insert(queue_.begin(), sent_.begin(), sent_.end());
  }
  sent_.clear();
  Finish(running, false, error);
}

bool RunnerClient::SendWaiting() {
  for (;;) {
    Pending* next = nullptr;
    {
      std::lock_guard lock(mutex_);
      if (queue_.empty() || sent_.size() > 1) return true;
      if (!sent_.empty() && queue_.front()->message.size() > kMaxQueuedCall) return true;
      next = queue_.front();
      queue_.pop_front();
    }
    if (sent_.empty()) running_since_ = Clock::now();
    sent_.push_back(next);
    const IoResult sent = WriteFrame(fd_, next->message, running_since_ + call_timeout_);
    if (sent != IoResult::kOk) {
      Abandon(Why(sent));
      return false;
    }
  }
}

void RunnerClient::Dispatch() {
  for (;;) {
    {
      std::lock_guard lock(mutex_);
      if (stopping_) break;
    }
    bool waiting;
    {
      std::lock_guard lock(mutex_);
      waiting = !queue_.empty();
    }
    if (fd_ < 0 && waiting) {
      std::string error;
      if (!StartRunner(error)) {
        HostLog("cannot start a runner: %s", error.c_str());
        std::deque<Pending*> failed;
        {
          std::lock_guard lock(mutex_);
          failed.swap(queue_);
        }
        for (Pending* pending : failed) Finish(pending, false, "no runner: " + error);
        continue;
      }
    }
    if (fd_ >= 0 && !SendWaiting()) continue;

    pollfd fds[2] = {{wake_fd_, POLLIN, 0}, {fd_, POLLIN, 0}};
    // An answer that came in with the previous one is already in the reader.
    const bool buffered = !sent_.empty() && reader_ != nullptr && reader_->Buffered();
    int timeout = -1;
    if (buffered) {
      timeout = 0;
    } else if (!sent_.empty()) {
      const auto left = std::chrono::ceil<std::chrono::milliseconds>(running_since_ +
                                                                     call_timeout_ - Clock::now());
      timeout = static_cast<int>(std::clamp<long long>(left.count(), 0, 60000));
    }
    const int ready = poll(fds, fd_ >= 0 ? 2 : 1, timeout);
    if (ready < 0 && errno != EINTR) {
      HostLog("dispatcher: poll failed");
      break;
    }
    if (fds[0].revents & POLLIN) {
      uint64_t count;
      [[maybe_unused]] const ssize_t ignored = read(wake_fd_, &count, sizeof(count));
    }
    if (sent_.empty()) {
      if (fd_ >= 0 && fds[1].revents != 0) {  // an idle runner has nothing to say: it ended
        HostLog("the runner ended between calls");
        StopRunner();
      }
      continue;
    }
    if (fd_ >= 0 && (buffered || fds[1].revents != 0)) {
      Pending* running = sent_.front();
      const IoResult got =
          ReceiveAnswer(*reader_, *running->answer, running_since_ + call_timeout_);
      if (got != IoResult::kOk) {
        Abandon(Why(got));
        continue;
      }
      sent_.pop_front();
      running_since_ = Clock::now();  // the runner goes on to the next call at once
      Finish(running, true, "");
    } else if (Clock::now() >= running_since_ + call_timeout_) {
      Abandon(Why(IoResult::kTimeout));
    }
  }
  // Stopping: nothing more is answered.
  std::deque<Pending*> left;
  {
    std::lock_guard lock(mutex_);
    left.swap(queue_);
  }
  left.insert(left.end(), sent_.begin(), sent_.end());
  sent_.clear();
  for (Pending* pending : left) Finish(pending, false, "the host is stopping");
}

std::shared_ptr<const Json::Value> RunnerClient::Methods() const {
  std::lock_guard lock(methods_mutex_);
  return methods_;
}

}  // namespace kova_host
