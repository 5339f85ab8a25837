#include "statd/socket_server.h"

#include <errno.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "kova/statistics.h"
#include "statd/protocol.h"

namespace statd {
namespace {

using Clock = std::chrono::steady_clock;

// Watches `fd` for `events`, or stops watching it when `events` is 0.
void Watch(int epoll, int fd, uint32_t events, bool watched) {
  epoll_event event{};
  event.events = events;
  event.data.fd = fd;
  if (events == 0) {
    epoll_ctl(epoll, EPOLL_CTL_DEL, fd, nullptr);
  } else {
    epoll_ctl(epoll, watched ? EPOLL_CTL_MOD : EPOLL_CTL_ADD, fd, &event);
  }
}

}  // namespace

SocketServer::SocketServer(std::string path, Answerer answer, SocketLimits limits)
    : path_(std::move(path)), answer_(std::move(answer)), limits_(limits) {}

SocketServer::~SocketServer() { Stop(); }

bool SocketServer::Start(std::string& error) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path_.size() >= sizeof(address.sun_path)) {
    error = "the socket path " + path_ + " is too long for a Unix socket";
    return false;
  }
  memcpy(address.sun_path, path_.c_str(), path_.size() + 1);
  const auto* generic = reinterpret_cast<const sockaddr*>(&address);
  // A socket that answers belongs to a running collector; one that doesn't is stale.
  const int probe = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const bool taken = probe >= 0 && connect(probe, generic, sizeof(address)) == 0;
  if (probe >= 0) close(probe);
  if (taken) {
    error = "another process answers on " + path_;
    return false;
  }
  if (unlink(path_.c_str()) != 0 && errno != ENOENT) {
    error = "can't remove the stale socket " + path_ + ": " + strerror(errno);
    return false;
  }
  listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  epoll_ = epoll_create1(EPOLL_CLOEXEC);
  wake_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (listener_ < 0 || epoll_ < 0 || wake_ < 0 || bind(listener_, generic, sizeof(address)) != 0 ||
      chmod(path_.c_str(), 0666) != 0 || listen(listener_, 128) != 0) {
    error = "can't listen on " + path_ + ": " + strerror(errno);
    for (int* fd : {&listener_, &epoll_, &wake_}) {
      if (*fd >= 0) close(*fd);
      *fd = -1;
    }
    return false;
  }
  Watch(epoll_, listener_, EPOLLIN, false);
  Watch(epoll_, wake_, EPOLLIN, false);
  waiter_ = std::thread([this] { Wait(); });
  for (int i = 0; i < limits_.workers; ++i) workers_.emplace_back([this] { Work(); });
  return true;
}

void SocketServer::Stop() {
  if (listener_ < 0) return;
  {
    std::lock_guard lock(mutex_);
    stopping_ = true;
  }
  work_.notify_all();
  const uint64_t one = 1;
  [[maybe_unused]] const ssize_t woken = write(wake_, &one, sizeof(one));
  waiter_.join();
  for (std::thread& worker : workers_) worker.join();
  workers_.clear();
  for (int* fd : {&listener_, &epoll_, &wake_}) {
    close(*fd);
    *fd = -1;
  }
  unlink(path_.c_str());
}

void SocketServer::Wait() {
  epoll_event events[64];
  while (!stopping_) {
    // Until the nearest deadline of a connection waited on.
    const Clock::time_point now = Clock::now();
    Clock::time_point nearest = now + std::chrono::seconds(1);
    for (const auto& [fd, connection] : connections_) {
      if (!connection.answering) nearest = std::min(nearest, connection.deadline);
    }
    const auto wait = std::chrono::duration_cast<std::chrono::milliseconds>(nearest - now);
    const int ready =
        epoll_wait(epoll_, events, 64, static_cast<int>(std::max<int64_t>(wait.count(), 0)) + 1);
    for (int i = 0; i < ready; ++i) {
      const int fd = events[i].data.fd;
      if (fd == listener_) {
        Accept();
      } else if (fd == wake_) {
        uint64_t count;
        [[maybe_unused]] const ssize_t drained = read(wake_, &count, sizeof(count));
        CollectAnswers();
      } else if (auto found = connections_.find(fd); found != connections_.end()) {
        if (!found->second.out.empty()) {
          Write(fd, found->second);
        } else {
          Read(fd, found->second);
        }
      }
    }
    std::vector<int> late;
    for (const auto& [fd, connection] : connections_) {
      if (!connection.answering && connection.deadline <= Clock::now()) late.push_back(fd);
    }
    for (int fd : late) Close(fd);
  }
  while (!connections_.empty()) Close(connections_.begin()->first);
}

void SocketServer::Work() {
  for (;;) {
    Job job;
    {
      std::unique_lock lock(mutex_);
      work_.wait(lock, [this] { return stopping_ || !jobs_.empty(); });
      if (stopping_) return;
      job = std::move(jobs_.front());
      jobs_.pop_front();
    }
    std::string answer = answer_(job.line);
    {
      std::lock_guard lock(mutex_);
      answers_.push_back(Job{job.fd, std::move(answer)});
    }
    const uint64_t one = 1;
    [[maybe_unused]] const ssize_t woken = write(wake_, &one, sizeof(one));
  }
}

void SocketServer::Accept() {
  for (;;) {
    const int fd = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (fd < 0) return;  // none left, or out of descriptors: the rest wait in the backlog
    ucred peer{};
    socklen_t length = sizeof(peer);
    const uid_t user =
        getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &length) == 0 ? peer.uid : uid_t(-1);
    if (connections_.size() >= limits_.connections || per_user_[user] >= limits_.per_user) {
      close(fd);  // the client reads the end at once, and may try again
      continue;
    }
    ++per_user_[user];
    Connection& connection = connections_[fd];
    connection.user = user;
    connection.deadline = Clock::now() + limits_.request_time;
    Watch(epoll_, fd, EPOLLIN, false);
  }
}

void SocketServer::Read(int fd, Connection& connection) {
  char buffer[4096];
  for (;;) {
    const ssize_t got = recv(fd, buffer, sizeof(buffer), 0);
    if (got > 0) {
      const size_t from = connection.in.size();
      connection.in.append(buffer, static_cast<size_t>(got));
      const size_t end = connection.in.find('\n', from);
      if (end != std::string::npos) {
        connection.in.resize(end);
        break;
      }
      if (connection.in.size() > kStatisticsMaxRequest) break;
      continue;
    }
    if (got < 0 && errno == EINTR) continue;
    if (got < 0 && errno == EAGAIN) return;  // the rest when it comes
    // The end of the stream ends the line too; an error ends the connection.
    if (got < 0 || connection.in.empty()) return Close(fd);
    break;
  }
  if (connection.in.size() > kStatisticsMaxRequest) {
    return Answer(fd, connection, ErrorAnswer("too_large", "the request is over 64 KiB"));
  }
  // A whole line: a worker answers it, and the connection waits unwatched.
  connection.answering = true;
  Watch(epoll_, fd, 0, true);
  {
    std::lock_guard lock(mutex_);
    jobs_.push_back(Job{fd, std::move(connection.in)});
  }
  work_.notify_one();
}

void SocketServer::CollectAnswers() {
  std::vector<Job> answers;
  {
    std::lock_guard lock(mutex_);
    answers.swap(answers_);
  }
  for (Job& answer : answers) {
    const auto found = connections_.find(answer.fd);
    if (found != connections_.end()) Answer(answer.fd, found->second, std::move(answer.line));
  }
}

void SocketServer::Answer(int fd, Connection& connection, std::string answer) {
  const bool watched = !connection.answering;
  connection.answering = false;
  connection.out = std::move(answer) + "\n";
  connection.deadline = Clock::now() + limits_.answer_time;
  Watch(epoll_, fd, EPOLLOUT, watched);
  Write(fd, connection);
}

void SocketServer::Write(int fd, Connection& connection) {
  while (connection.sent < connection.out.size()) {
    const ssize_t wrote = send(fd, connection.out.data() + connection.sent,
                               connection.out.size() - connection.sent, MSG_NOSIGNAL);
    if (wrote < 0 && errno == EINTR) continue;
    if (wrote < 0 && errno == EAGAIN) return;  // the rest when the client reads
    if (wrote <= 0) break;                     // the client went away
    connection.sent += static_cast<size_t>(wrote);
  }
  Close(fd);
}

void SocketServer::Close(int fd) {
  const auto found = connections_.find(fd);
  if (found == connections_.end()) return;
  if (!found->second.answering) Watch(epoll_, fd, 0, true);
  if (--per_user_[found->second.user] == 0) per_user_.erase(found->second.user);
  connections_.erase(found);
  close(fd);
}

}  // namespace statd
