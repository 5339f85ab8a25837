#include "host/runner_client.h"

#include <unistd.h>

#include "host/host_log.h"

namespace kova_host {
namespace {

constexpr std::chrono::seconds kStartTimeout{60};

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

RunnerClient::RunnerClient(RunnerLauncher& launcher, std::chrono::milliseconds call_timeout)
    : launcher_(launcher),
      call_timeout_(call_timeout),
      methods_(std::make_shared<const Json::Value>(Json::arrayValue)) {}

RunnerClient::~RunnerClient() {
  if (fd_ >= 0) close(fd_);
}

bool RunnerClient::Start(std::string& error) {
  std::lock_guard lock(call_mutex_);
  return fd_ >= 0 || StartLocked(error);
}

bool RunnerClient::StartLocked(std::string& error) {
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
  running_ = true;
  std::lock_guard lock(methods_mutex_);
  methods_ = std::make_shared<const Json::Value>(std::move(methods));
  return true;
}

void RunnerClient::StopLocked() {
  if (fd_ >= 0) close(fd_);
  fd_ = -1;
  running_ = false;
  launcher_.Stop();
}

bool RunnerClient::Call(const RunnerCall& call, RunnerAnswer& answer, std::string& error) {
  std::lock_guard lock(call_mutex_);
  if (fd_ < 0 && !StartLocked(error)) return false;
  const Clock::time_point deadline = Clock::now() + call_timeout_;
  IoResult result = SendCall(fd_, call, deadline);
  if (result == IoResult::kOk) result = ReceiveAnswer(*reader_, answer, deadline);
  if (result == IoResult::kOk) return true;
  error = Why(result);
  HostLog("%s v%d %s: %s; starting a fresh runner", call.api.c_str(), call.version,
          call.method.c_str(), error.c_str());
  StopLocked();
  std::string start_error;
  if (!StartLocked(start_error)) HostLog("cannot start a runner: %s", start_error.c_str());
  return false;
}

std::shared_ptr<const Json::Value> RunnerClient::Methods() const {
  std::lock_guard lock(methods_mutex_);
  return methods_;
}

}  // namespace kova_host
