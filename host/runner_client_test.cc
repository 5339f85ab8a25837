// The dispatcher against runners played by threads of the test: each runner
// acts on the method of the call it reads.

#include "host/runner_client.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <future>
#include <mutex>
#include <thread>
#include <vector>

#include "host/json_text.h"

namespace kova_host {
namespace {

// A runner counts each call it takes, and answers "echo" with its number;
// "vanish" closes its socket before taking it, the first time; "crash" closes
// after taking it; "hang" takes it and waits; "pair" holds its answer until the
// next call came, then writes both answers in one write.
void PlayRunner(int fd, int taken_fd, int number, bool first) {
  TakenCount taken(taken_fd);
  close(taken_fd);
  Json::Value methods(Json::arrayValue);
  if (SendReady(fd, methods) != IoResult::kOk) return;
  FrameReader reader(fd);
  const auto answer = [number](const RunnerCall& call) {
    Json::Value data;
    data["runner"] = number;
    data["method"] = call.method;
    return RunnerAnswer{false, 0, ToJson(data)};
  };
  RunnerCall call;
  while (ReceiveCall(reader, call) == IoResult::kOk) {
    if (call.method == "vanish" && first) break;
    taken.Add();
    if (call.method == "pair") {
      RunnerCall next;
      if (ReceiveCall(reader, next) != IoResult::kOk) break;
      taken.Add();
      // Both answers as the runner's socket would hold them: one read takes all.
      int pipe[2];
      if (socketpair(AF_UNIX, SOCK_STREAM, 0, pipe) != 0) break;
      SendAnswer(pipe[0], answer(call));
      SendAnswer(pipe[0], answer(next));
      shutdown(pipe[0], SHUT_WR);
      std::string bytes(1 << 16, '\0');
      const ssize_t got = read(pipe[1], bytes.data(), bytes.size());
      close(pipe[0]);
      close(pipe[1]);
      if (got <= 0 || write(fd, bytes.data(), static_cast<size_t>(got)) != got) break;
      continue;
    }
    if (call.method == "crash") break;
    if (call.method == "hang") {
      char byte;
      while (read(fd, &byte, 1) > 0) {
      }
      break;
    }
    if (SendAnswer(fd, answer(call)) != IoResult::kOk) break;
  }
  close(fd);
}

class FakeLauncher : public RunnerLauncher {
 public:
  ~FakeLauncher() override {
    Stop();
    for (std::thread& runner : runners_) runner.join();
  }
  int Start(int& taken_fd, std::string& error) override {
    taken_fd = TakenCount::Create(error);
    int pair[2];
    if (taken_fd < 0 || socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) return -1;
    std::lock_guard lock(mutex_);
    const int number = static_cast<int>(runners_.size()) + 1;
    current_ = pair[1];
    runners_.emplace_back(PlayRunner, pair[1], dup(taken_fd), number, number == 1);
    return pair[0];
  }
  // Ends the runner's side the way a killed runner's ends.
  void Stop() override {
    std::lock_guard lock(mutex_);
    if (current_ >= 0) shutdown(current_, SHUT_RDWR);
    current_ = -1;
  }
  int started() {
    std::lock_guard lock(mutex_);
    return static_cast<int>(runners_.size());
  }

 private:
  std::mutex mutex_;
  std::vector<std::thread> runners_;
  int current_ = -1;
};

struct Outcome {
  CallResult result;
  Json::Value data;
  std::string error;
};

class RunnerClientTest : public ::testing::Test {
 protected:
  void StartClient(std::chrono::milliseconds timeout, size_t max_waiting) {
    client_ = std::make_unique<RunnerClient>(launcher_, timeout, max_waiting);
    std::string error;
    ASSERT_TRUE(client_->Start(error)) << error;
  }
  std::future<Outcome> Submit(const std::string& method) {
    auto promise = std::make_shared<std::promise<Outcome>>();
    client_->Submit({"KOVA.Test", 1, method, Json::Value(Json::objectValue), "admin", "enu"},
                    [promise](CallResult result, RunnerAnswer answer, std::string error) {
                      Outcome outcome{result, Json::Value(), std::move(error)};
                      FromJson(answer.body, outcome.data);
                      promise->set_value(std::move(outcome));
                    });
    return promise->get_future();
  }

  FakeLauncher launcher_;  // outlives the client, which stops its runner
  std::unique_ptr<RunnerClient> client_;
};

TEST_F(RunnerClientTest, AnswersEveryCallOnceWhateverTheRunnerDoes) {
  StartClient(std::chrono::seconds(30), 16);
  // An answer that came in one read with the one before goes to its own call.
  std::future<Outcome> first = Submit("pair");
  std::future<Outcome> second = Submit("echo");
  EXPECT_EQ(first.get().data["method"], "pair");
  EXPECT_EQ(second.get().data["method"], "echo");

  // A runner that ended before taking a call never ran it: a fresh one does.
  const Outcome vanished = Submit("vanish").get();
  EXPECT_EQ(vanished.result, CallResult::kAnswered) << vanished.error;
  EXPECT_EQ(vanished.data["runner"], 2);

  // A runner that ends while running a call fails that call only; the call
  // waiting behind it goes to the next runner.
  std::future<Outcome> crashed = Submit("crash");
  std::future<Outcome> behind = Submit("echo");
  const Outcome lost = crashed.get();
  EXPECT_EQ(lost.result, CallResult::kFailed);
  EXPECT_NE(lost.error.find("runner ended"), std::string::npos) << lost.error;
  EXPECT_EQ(behind.get().data["runner"], 3);
  EXPECT_EQ(launcher_.started(), 3);
}

TEST_F(RunnerClientTest, RefusesCallsOverTheWaitingCapAndRecovers) {
  StartClient(std::chrono::milliseconds(1500), 2);
  std::future<Outcome> hung = Submit("hang");
  std::vector<std::future<Outcome>> calls;
  for (int i = 0; i < 4; ++i) calls.push_back(Submit("echo"));
  // However many the dispatcher has handed on yet, the queue holds two at most:
  // the rest are refused at once, and the ones that waited are answered.
  int busy = 0;
  for (std::future<Outcome>& call : calls) {
    const Outcome outcome = call.get();
    if (outcome.result == CallResult::kBusy) {
      ++busy;
      EXPECT_EQ(outcome.error, "too many calls wait for the module");
    } else {
      EXPECT_EQ(outcome.result, CallResult::kAnswered) << outcome.error;
    }
  }
  EXPECT_GE(busy, 1);
  const Outcome late = hung.get();
  EXPECT_EQ(late.result, CallResult::kFailed);
  EXPECT_NE(late.error.find("time limit"), std::string::npos) << late.error;
  EXPECT_EQ(Submit("echo").get().result, CallResult::kAnswered);
}

}  // namespace
}  // namespace kova_host
