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
// The calls waiting for one runner hold at most this much, however many they
// are: a few large bodies fill the queue as many small calls do.
constexpr size_t kMaxWaitingBytes = size_t{64} << 20;

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
  int retried = 0;      // times a runner ended before taking it
  RunnerAnswer answer;
  CallDone done;
};

RunnerClient::RunnerClient(RunnerLauncher& launcher, std::chrono::milliseconds call_timeout,
                           size_t max_waiting)
    : launcher_(launcher),
      call_timeout_(call_timeout),
      max_waiting_(max_waiting),
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
  int taken_fd = -1;
  const int fd = launcher_.Start(taken_fd, error);
  if (fd < 0) return false;
  auto taken = std::make_unique<TakenCount>(taken_fd);
  close(taken_fd);
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
  taken_ = std::move(taken);
  answered_ = 0;
  std::lock_guard lock(methods_mutex_);
  methods_ = std::make_shared<const Json::Value>(std::move(methods));
  return true;
}

void RunnerClient::StopRunner() {
  if (fd_ >= 0) close(fd_);
  fd_ = -1;
  write_failed_ = false;
  reader_.reset();
  launcher_.Stop();
}

void RunnerClient::Submit(const RunnerCall& call, CallDone done) {
  auto pending = std::make_unique<Pending>();
  pending->message = EncodeCall(call);
  pending->name = call.api + " v" + std::to_string(call.version) + " " + call.method;
  pending->done = std::move(done);
  CallResult refused = CallResult::kAnswered;
  {
    std::lock_guard lock(mutex_);
    if (stopping_) {
      refused = CallResult::kFailed;
    } else if (queue_.size() >= max_waiting_ ||
               waiting_bytes_ + pending->message.size() > kMaxWaitingBytes) {
      refused = CallResult::kBusy;
    } else {
      waiting_bytes_ += pending->message.size();
      queue_.push_back(pending.release());
    }
  }
  if (refused != CallResult::kAnswered) {
    pending->done(refused, RunnerAnswer(),
                  refused == CallResult::kBusy ? "too many calls wait for the module"
                                               : "the host is stopping");
    return;
  }
  const uint64_t one = 1;
  [[maybe_unused]] const ssize_t ignored = write(wake_fd_, &one, sizeof(one));
}

void RunnerClient::Finish(Pending* pending, CallResult result, const std::string& error) {
  const std::unique_ptr<Pending> owned(pending);
  owned->done(result, std::move(owned->answer), error);
}

void RunnerClient::Abandon(IoResult why) {
  Pending* running = sent_.front();
  // A runner that ended before taking the call never ran it: the call goes to
  // a fresh runner, once, with those behind it.
  const bool taken = !taken_->mapped() || taken_->Read() > answered_;
  const bool retry = !taken && why != IoResult::kTimeout && running->retried++ == 0;
  if (retry) {
    HostLog("%s: the runner ended before taking the call; a fresh runner takes it",
            running->name.c_str());
  } else {
    sent_.pop_front();
    HostLog("%s: %s; starting a fresh runner", running->name.c_str(), Why(why));
  }
  StopRunner();
  {
    std::lock_guard lock(mutex_);
    for (const Pending* again : sent_) waiting_bytes_ += again->message.size();
    queue_.insert(queue_.begin(), sent_.begin(), sent_.end());
  }
  sent_.clear();
  if (!retry) Finish(running, CallResult::kFailed, Why(why));
}

bool RunnerClient::SendWaiting() {
  for (;;) {
    Pending* next = nullptr;
    {
      std::lock_guard lock(mutex_);
      if (queue_.empty() || sent_.size() > 1 || write_failed_) return true;
      if (!sent_.empty() && queue_.front()->message.size() > kMaxQueuedCall) return true;
      next = queue_.front();
      queue_.pop_front();
      waiting_bytes_ -= next->message.size();
    }
    if (sent_.empty()) running_since_ = Clock::now();
    sent_.push_back(next);
    const IoResult sent = WriteFrame(fd_, next->message, running_since_ + call_timeout_);
    if (sent == IoResult::kClosed || sent == IoResult::kError) {
      // The runner is gone; what it said before it went is still to be read,
      // which tells whether it took the first call.
      write_failed_ = true;
      return true;
    }
    if (sent != IoResult::kOk) {
      Abandon(sent);
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
          waiting_bytes_ = 0;
        }
        for (Pending* pending : failed) Finish(pending, CallResult::kFailed, "no runner: " + error);
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
      const IoResult got = ReceiveAnswer(*reader_, running->answer, running_since_ + call_timeout_);
      if (got != IoResult::kOk) {
        Abandon(got);
        continue;
      }
      sent_.pop_front();
      ++answered_;
      running_since_ = Clock::now();  // the runner goes on to the next call at once
      Finish(running, CallResult::kAnswered, "");
    } else if (Clock::now() >= running_since_ + call_timeout_) {
      Abandon(IoResult::kTimeout);
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
  for (Pending* pending : left) Finish(pending, CallResult::kFailed, "the host is stopping");
}

std::shared_ptr<const Json::Value> RunnerClient::Methods() const {
  std::lock_guard lock(methods_mutex_);
  return methods_;
}

}  // namespace kova_host
