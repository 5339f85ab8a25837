#include "host/monitor.h"

#include <errno.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <vector>

#include "host/host_log.h"
#include "host/json_text.h"
#include "host/module_loader.h"
#include "host/passed_fds.h"
#include "host/private_tmp.h"
#include "host/taken_count.h"
#include "src/accounts.h"

namespace kova_host {
namespace {

constexpr size_t kMaxMessage = 16384;

volatile sig_atomic_t stop_signal = 0;

void OnStopSignal(int signal) { stop_signal = signal; }

constexpr size_t kMaxPassed = 2;  // descriptors with one message

// Sends one message with the descriptors `fds` (at most kMaxPassed) attached.
bool Send(int socket, const Json::Value& message, std::initializer_list<int> fds = {}) {
  const std::string text = ToJson(message);
  iovec data{const_cast<char*>(text.data()), text.size()};
  msghdr header{};
  header.msg_iov = &data;
  header.msg_iovlen = 1;
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * kMaxPassed)] = {};
  AttachDescriptors(header, fds.begin(), fds.size(), control, sizeof(control));
  ssize_t sent;
  do {
    sent = sendmsg(socket, &header, MSG_NOSIGNAL);
  } while (sent < 0 && errno == EINTR);
  return sent == static_cast<ssize_t>(text.size());
}

// Receives one message and up to `count` descriptors attached to it into
// `fds` (-1 where none came); others are closed. Returns 1, 0 when the other
// side closed the socket, -1 on failure.
int Receive(int socket, Json::Value& message, int* fds = nullptr, size_t count = 0) {
  std::string text(kMaxMessage, '\0');
  iovec data{text.data(), text.size()};
  msghdr header{};
  header.msg_iov = &data;
  header.msg_iovlen = 1;
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * kMaxPassed)] = {};
  header.msg_control = control;
  header.msg_controllen = sizeof(control);
  ssize_t got;
  do {
    got = recvmsg(socket, &header, MSG_CMSG_CLOEXEC);
  } while (got < 0 && errno == EINTR);
  if (got <= 0) return got == 0 ? 0 : -1;
  std::fill(fds, fds + count, -1);
  std::vector<UniqueFd> passed = PassedDescriptors(header);  // those not taken close
  for (size_t i = 0; i < count && i < passed.size(); ++i) fds[i] = passed[i].Release();
  text.resize(static_cast<size_t>(got));
  const bool ok = (header.msg_flags & (MSG_TRUNC | MSG_CTRUNC)) == 0 && FromJson(text, message) &&
                  message.isObject();
  if (!ok) {
    for (size_t i = 0; i < count; ++i) {
      if (fds[i] >= 0) close(fds[i]);
      fds[i] = -1;
    }
  }
  return ok ? 1 : -1;
}

std::string HowEnded(int status) {
  if (WIFSIGNALED(status)) {
    const int signal = WTERMSIG(status);
    return "killed by signal " + std::to_string(signal) + " (" + strsignal(signal) + ")";
  }
  return "exited with status " + std::to_string(WEXITSTATUS(status));
}

class Monitor {
 public:
  Monitor(int control, pid_t front_end, const MonitorSetup& setup)
      : control_(control), front_end_(front_end), setup_(setup) {}

  int Run() {
    while (!front_end_ended_ && stop_signal == 0) {
      pollfd entry{control_, POLLIN, 0};
      const int ready = poll(&entry, 1, 250);
      if (ready > 0 && !Serve()) break;
      Reap(false);
    }
    Shutdown();
    return WIFEXITED(front_end_status_) ? WEXITSTATUS(front_end_status_)
                                        : 128 + WTERMSIG(front_end_status_);
  }

 private:
  // Answers one request; false when the front-end is gone.
  bool Serve() {
    Json::Value request;
    const int got = Receive(control_, request);
    if (got == 0) return false;
    if (got < 0) return Send(control_, Failure("malformed request"));
    const Json::Value& op = request["op"];
    const std::string module = request["module"].isString() ? request["module"].asString() : "";
    if ((op == "start" || op == "stop") && !IsModuleName(module)) {
      return Send(control_, Failure("no such module"));
    }
    if (op == "start") return StartRunner(module);
    if (op == "stop") {
      StopRunner(module);
      return Send(control_, Json::Value(Json::objectValue));
    }
    if (op == "check" && request["account"].isString() && request["password"].isString()) {
      bool admin = false;
      Json::Value answer;
      answer["result"] = kova::CheckAccountPassword(request["account"].asString(),
                                                    request["password"].asString(), admin);
      answer["admin"] = admin;
      return Send(control_, answer);
    }
    return Send(control_, Failure("unknown request"));
  }

  static Json::Value Failure(const std::string& error) {
    Json::Value answer;
    answer["error"] = error;
    return answer;
  }

  struct Runner {
    pid_t pid = 0;
    std::string tmp_root;  // its private /tmp's folder, "" when it shares /tmp
  };

  bool StartRunner(const std::string& module) {
    StopRunner(module);
    RunnerSetup runner_setup{setup_.modules_dir + "/" + module, setup_.account, "", setup_.tmp_dir};
    Runner runner;
    if (geteuid() == 0) {
      std::string error;
      runner_setup.private_tmp = MakePrivateTmp(setup_.tmp_dir, runner.tmp_root, error);
      if (runner_setup.private_tmp.empty())
        HostLog("runner of %s: %s", module.c_str(), error.c_str());
    }
    std::string error;
    const int taken = TakenCount::Create(error);
    int pair[2];
    if (taken < 0 || socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) {
      if (taken < 0) error = std::string("socketpair: ") + strerror(errno);
      if (taken >= 0) close(taken);
      Ended(module, runner, 0);
      return Send(control_, Failure(error));
    }
    runner_setup.taken_fd = taken;
    runner.pid = fork();
    if (runner.pid == 0) {
      for (int signal : {SIGTERM, SIGHUP, SIGINT}) ::signal(signal, SIG_DFL);
      close(control_);
      close(pair[0]);
      _exit(RunRunner(pair[1], runner_setup));
    }
    close(pair[1]);
    if (runner.pid < 0) {
      close(pair[0]);
      close(taken);
      Ended(module, runner, 0);
      return Send(control_, Failure(std::string("fork: ") + strerror(errno)));
    }
    runners_[module] = runner;
    const bool sent = Send(control_, Json::Value(Json::objectValue), {pair[0], taken});
    close(pair[0]);
    close(taken);
    return sent;
  }

  void StopRunner(const std::string& module) {  // not a key of runners_: erased below
    const auto found = runners_.find(module);
    if (found == runners_.end()) return;
    // A runner that is ending already keeps the status it ends with.
    kill(found->second.pid, SIGKILL);
    int status;
    while (waitpid(found->second.pid, &status, 0) < 0 && errno == EINTR) {
    }
    const Runner runner = found->second;
    runners_.erase(found);
    Ended(module, runner, status);
  }

  // Logs how a runner ended (when it was started) and removes its /tmp.
  static void Ended(const std::string& module, const Runner& runner, int status) {
    if (runner.pid > 0) {
      HostLog("runner %d of %s %s", static_cast<int>(runner.pid), module.c_str(),
              HowEnded(status).c_str());
    }
    if (!runner.tmp_root.empty() && !RemovePrivateTmp(runner.tmp_root)) {
      HostLog("cannot remove all of %s", runner.tmp_root.c_str());
    }
  }

  // Collects ended children; with `block`, waits for the front-end.
  void Reap(bool block) {
    for (;;) {
      int status;
      const pid_t pid = waitpid(-1, &status, block && !front_end_ended_ ? 0 : WNOHANG);
      if (pid <= 0) {
        if (pid < 0 && errno == EINTR) continue;
        return;
      }
      const auto runner = std::find_if(runners_.begin(), runners_.end(), [pid](const auto& entry) {
        return entry.second.pid == pid;
      });
      if (runner != runners_.end()) {
        const std::string module = runner->first;
        const Runner ended = runner->second;
        runners_.erase(runner);
        Ended(module, ended, status);
      } else if (pid == front_end_) {
        front_end_ended_ = true;
        front_end_status_ = status;
      }
    }
  }

  void Shutdown() {
    shutdown(control_, SHUT_RDWR);  // requests of the front-end fail now instead of waiting
    while (!runners_.empty()) StopRunner(std::string(runners_.begin()->first));
    if (!front_end_ended_) {
      kill(front_end_, SIGTERM);
      for (int i = 0; i < 50 && !front_end_ended_; ++i) {
        usleep(100000);
        Reap(false);
      }
      if (!front_end_ended_) kill(front_end_, SIGKILL);
      Reap(true);
    }
  }

  int control_;
  pid_t front_end_;
  const MonitorSetup& setup_;
  std::map<std::string, Runner> runners_;  // by module
  bool front_end_ended_ = false;
  int front_end_status_ = 0;
};

}  // namespace

int RunMonitor(int control, pid_t front_end, const MonitorSetup& setup) {
  struct sigaction action {};
  action.sa_handler = OnStopSignal;  // no SA_RESTART: a signal ends the wait
  sigemptyset(&action.sa_mask);
  for (int signal : {SIGTERM, SIGINT, SIGHUP}) sigaction(signal, &action, nullptr);
  return Monitor(control, front_end, setup).Run();
}

int MonitorClient::Start(const std::string& module, int& taken_fd, std::string& error) {
  std::lock_guard lock(mutex_);
  Json::Value request;
  request["op"] = "start";
  request["module"] = module;
  Json::Value answer;
  int fds[2] = {-1, -1};
  if (!Send(control_, request) || Receive(control_, answer, fds, 2) != 1) {
    error = "the monitor does not answer";
    return -1;
  }
  if (fds[0] < 0 || fds[1] < 0) {
    error = answer["error"].isString() ? answer["error"].asString() : "no runner";
    for (int fd : fds) {
      if (fd >= 0) close(fd);
    }
    return -1;
  }
  taken_fd = fds[1];
  return fds[0];
}

void MonitorClient::Stop(const std::string& module) {
  std::lock_guard lock(mutex_);
  Json::Value request;
  request["op"] = "stop";
  request["module"] = module;
  Json::Value answer;
  if (Send(control_, request)) Receive(control_, answer);
}

int MonitorClient::CheckPassword(const std::string& account, const std::string& password,
                                 bool& admin) {
  std::lock_guard lock(mutex_);
  Json::Value request;
  request["op"] = "check";
  request["account"] = account;
  request["password"] = password;
  Json::Value answer;
  admin = false;
  if (!Send(control_, request) || Receive(control_, answer) != 1 || !answer["result"].isInt()) {
    return -1;
  }
  admin = answer["admin"].asBool();
  return answer["result"].asInt();
}

}  // namespace kova_host
