#include "host/monitor.h"

#include <errno.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>

#include "host/host_log.h"
#include "host/json_text.h"
#include "src/accounts.h"

namespace kova_host {
namespace {

constexpr size_t kMaxMessage = 16384;

volatile sig_atomic_t stop_signal = 0;

void OnStopSignal(int signal) { stop_signal = signal; }

// Sends one message, with `fd` attached when it is not -1.
bool Send(int socket, const Json::Value& message, int fd = -1) {
  const std::string text = ToJson(message);
  iovec data{const_cast<char*>(text.data()), text.size()};
  msghdr header{};
  header.msg_iov = &data;
  header.msg_iovlen = 1;
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
  if (fd >= 0) {
    header.msg_control = control;
    header.msg_controllen = sizeof(control);
    cmsghdr* attached = CMSG_FIRSTHDR(&header);
    attached->cmsg_level = SOL_SOCKET;
    attached->cmsg_type = SCM_RIGHTS;
    attached->cmsg_len = CMSG_LEN(sizeof(int));
    memcpy(CMSG_DATA(attached), &fd, sizeof(int));
  }
  ssize_t sent;
  do {
    sent = sendmsg(socket, &header, MSG_NOSIGNAL);
  } while (sent < 0 && errno == EINTR);
  return sent == static_cast<ssize_t>(text.size());
}

// Receives one message and the descriptor attached to it, if any (else -1).
// Returns 1, 0 when the other side closed the socket, -1 on failure.
int Receive(int socket, Json::Value& message, int* fd = nullptr) {
  std::string text(kMaxMessage, '\0');
  iovec data{text.data(), text.size()};
  msghdr header{};
  header.msg_iov = &data;
  header.msg_iovlen = 1;
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
  header.msg_control = control;
  header.msg_controllen = sizeof(control);
  ssize_t got;
  do {
    got = recvmsg(socket, &header, MSG_CMSG_CLOEXEC);
  } while (got < 0 && errno == EINTR);
  if (got <= 0) return got == 0 ? 0 : -1;
  if (fd != nullptr) *fd = -1;
  for (cmsghdr* attached = CMSG_FIRSTHDR(&header); attached != nullptr;
       attached = CMSG_NXTHDR(&header, attached)) {
    if (attached->cmsg_level != SOL_SOCKET || attached->cmsg_type != SCM_RIGHTS) continue;
    int passed;
    memcpy(&passed, CMSG_DATA(attached), sizeof(int));
    if (fd != nullptr && *fd < 0) {
      *fd = passed;
    } else {
      close(passed);
    }
  }
  text.resize(static_cast<size_t>(got));
  const bool ok =
      (header.msg_flags & MSG_TRUNC) == 0 && FromJson(text, message) && message.isObject();
  if (!ok && fd != nullptr && *fd >= 0) {
    close(*fd);
    *fd = -1;
  }
  return ok ? 1 : -1;
}

std::string Ended(int status) {
  if (WIFSIGNALED(status)) {
    const int signal = WTERMSIG(status);
    return "killed by signal " + std::to_string(signal) + " (" + strsignal(signal) + ")";
  }
  return "exited with status " + std::to_string(WEXITSTATUS(status));
}

class Monitor {
 public:
  Monitor(int control, pid_t front_end, const RunnerSetup& setup)
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
    if (op == "start") return StartRunner();
    if (op == "stop") {
      StopRunner();
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

  bool StartRunner() {
    StopRunner();
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) {
      return Send(control_, Failure(std::string("socketpair: ") + strerror(errno)));
    }
    const pid_t pid = fork();
    if (pid == 0) {
      for (int signal : {SIGTERM, SIGHUP, SIGINT}) ::signal(signal, SIG_DFL);
      close(control_);
      close(pair[0]);
      _exit(RunRunner(pair[1], setup_));
    }
    close(pair[1]);
    if (pid < 0) {
      close(pair[0]);
      return Send(control_, Failure(std::string("fork: ") + strerror(errno)));
    }
    runner_ = pid;
    const bool sent = Send(control_, Json::Value(Json::objectValue), pair[0]);
    close(pair[0]);
    return sent;
  }

  void StopRunner() {
    if (runner_ <= 0) return;
    // A runner that is ending already keeps the status it ends with.
    kill(runner_, SIGKILL);
    int status;
    while (waitpid(runner_, &status, 0) < 0 && errno == EINTR) {
    }
    HostLog("runner %d %s", static_cast<int>(runner_), Ended(status).c_str());
    runner_ = 0;
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
      if (pid == runner_) {
        HostLog("runner %d %s", static_cast<int>(pid), Ended(status).c_str());
        runner_ = 0;
      } else if (pid == front_end_) {
        front_end_ended_ = true;
        front_end_status_ = status;
      }
    }
  }

  void Shutdown() {
    shutdown(control_, SHUT_RDWR);  // requests of the front-end fail now instead of waiting
    StopRunner();
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
  const RunnerSetup& setup_;
  pid_t runner_ = 0;
  bool front_end_ended_ = false;
  int front_end_status_ = 0;
};

}  // namespace

int RunMonitor(int control, pid_t front_end, const RunnerSetup& setup) {
  struct sigaction action {};
  action.sa_handler = OnStopSignal;  // no SA_RESTART: a signal ends the wait
  sigemptyset(&action.sa_mask);
  for (int signal : {SIGTERM, SIGINT, SIGHUP}) sigaction(signal, &action, nullptr);
  return Monitor(control, front_end, setup).Run();
}

int MonitorClient::Start(std::string& error) {
  std::lock_guard lock(mutex_);
  Json::Value request;
  request["op"] = "start";
  Json::Value answer;
  int fd = -1;
  if (!Send(control_, request) || Receive(control_, answer, &fd) != 1) {
    error = "the monitor does not answer";
    return -1;
  }
  if (fd < 0) error = answer["error"].isString() ? answer["error"].asString() : "no runner";
  return fd;
}

void MonitorClient::Stop() {
  std::lock_guard lock(mutex_);
  Json::Value request;
  request["op"] = "stop";
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
