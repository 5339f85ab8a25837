#include "statd/socket_server.h"

#include <errno.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstring>

#include "statd/protocol.h"

namespace statd {
namespace {

using Clock = std::chrono::steady_clock;
constexpr auto kRequestTime = std::chrono::seconds(2);
constexpr auto kAnswerTime = std::chrono::seconds(10);

// Waits for `events` on `fd` until `deadline`; false on a time-out or failure.
bool Wait(int fd, short events, Clock::time_point deadline) {
  for (;;) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
    if (left <= 0) return false;
    pollfd entry{fd, events, 0};
    const int ready = poll(&entry, 1, static_cast<int>(left));
    if (ready > 0) return true;
    if (ready < 0 && errno != EINTR) return false;
  }
}

// Reads up to the first line feed (or the end of the stream) into `line`.
// False when the client sent nothing whole in time; `too_long` when it sent
// more than a request may hold.
bool ReadLine(int fd, std::string& line, bool& too_long) {
  const Clock::time_point deadline = Clock::now() + kRequestTime;
  char buffer[4096];
  for (;;) {
    if (!Wait(fd, POLLIN, deadline)) return false;
    const ssize_t got = recv(fd, buffer, sizeof(buffer), MSG_DONTWAIT);
    if (got < 0 && (errno == EINTR || errno == EAGAIN)) continue;
    if (got < 0) return false;
    if (got == 0) return !line.empty();
    const char* end = static_cast<const char*>(memchr(buffer, '\n', static_cast<size_t>(got)));
    line.append(buffer,
                end != nullptr ? static_cast<size_t>(end - buffer) : static_cast<size_t>(got));
    if (line.size() > kMaxRequest) {
      too_long = true;
      return true;
    }
    if (end != nullptr) return true;
  }
}

void WriteAll(int fd, const std::string& text) {
  const Clock::time_point deadline = Clock::now() + kAnswerTime;
  for (size_t sent = 0; sent < text.size();) {
    const ssize_t wrote =
        send(fd, text.data() + sent, text.size() - sent, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (wrote > 0) {
      sent += static_cast<size_t>(wrote);
    } else if (wrote < 0 && (errno == EAGAIN || errno == EINTR)) {
      if (!Wait(fd, POLLOUT, deadline)) return;
    } else {
      return;  // the client went away
    }
  }
}

}  // namespace

SocketServer::SocketServer(std::string path, Answerer answer, int threads)
    : path_(std::move(path)), answer_(std::move(answer)), thread_count_(threads) {}

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
  listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (listener_ < 0 || bind(listener_, generic, sizeof(address)) != 0 ||
      chmod(path_.c_str(), 0666) != 0 || listen(listener_, 64) != 0) {
    error = "can't listen on " + path_ + ": " + strerror(errno);
    if (listener_ >= 0) close(listener_);
    listener_ = -1;
    return false;
  }
  for (int i = 0; i < thread_count_; ++i) threads_.emplace_back([this] { Serve(); });
  return true;
}

void SocketServer::Stop() {
  if (listener_ < 0) return;
  stopping_ = true;
  shutdown(listener_, SHUT_RDWR);  // wakes the threads blocked in accept
  for (std::thread& thread : threads_) thread.join();
  threads_.clear();
  close(listener_);
  listener_ = -1;
  unlink(path_.c_str());
}

void SocketServer::Serve() {
  while (!stopping_) {
    const int connection = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
    if (connection < 0) {
      if (errno == EMFILE || errno == ENFILE || errno == ENOMEM) usleep(10000);
      continue;
    }
    Handle(connection);
    close(connection);
  }
}

void SocketServer::Handle(int connection) {
  std::string line;
  bool too_long = false;
  if (!ReadLine(connection, line, too_long)) return;
  const std::string answer =
      too_long ? ErrorAnswer("too_large", "the request is over 64 KiB") : answer_(line);
  WriteAll(connection, answer + "\n");
}

}  // namespace statd
