// Client of the statistics-collection service over its Unix socket
// /run/kova/statd.sock: one request line of JSON, one reply line of JSON of up
// to 16 MiB.

#include "kova/transmitor.h"

#include <errno.h>
#include <json/reader.h>
#include <json/writer.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <memory>
#include <string>

#include "kova/error.h"
#include "kova/statistics.h"
#include "src/system_root.h"

namespace {

constexpr auto kTimeout = std::chrono::seconds(3);

using Clock = std::chrono::steady_clock;

// Milliseconds left until `deadline`, at least 0.
int Remaining(Clock::time_point deadline) {
  const auto left =
      std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
  return left > 0 ? static_cast<int>(left) : 0;
}

// Waits for `events` on `fd` until `deadline`; false on a time-out or error.
bool Wait(int fd, short events, Clock::time_point deadline) {
  for (;;) {
    pollfd entry{fd, events, 0};
    const int ready = poll(&entry, 1, Remaining(deadline));
    if (ready > 0) return true;
    if (ready == 0) {
      errno = ETIMEDOUT;
      return false;
    }
    if (errno != EINTR) return false;
  }
}

}  // namespace

struct Transmitor::Impl {
  bool local = false;
  bool answered = false;
  std::string reply;

  // Sends `line` and reads one reply line; the platform error on failure, 0 when done.
  int Exchange(const std::string& line) {
    const std::string path = kova::RootPath(kStatisticsSocket);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof(address.sun_path)) return KOVA_ERR_INVALID;
    memcpy(address.sun_path, path.c_str(), path.size() + 1);
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0) return KOVA_ERR_CONNECT;
    struct Closer {
      int fd;
      ~Closer() { close(fd); }
    } closer{fd};
    const Clock::time_point deadline = Clock::now() + kTimeout;
    if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) != 0) {
      if (errno != EINPROGRESS && errno != EAGAIN) return KOVA_ERR_CONNECT;
      int error = 0;
      socklen_t length = sizeof(error);
      if (!Wait(fd, POLLOUT, deadline)) return KOVA_ERR_TIMEOUT;
      if (getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &length) != 0 || error != 0) {
        return KOVA_ERR_CONNECT;
      }
    }
    for (size_t sent = 0; sent < line.size();) {
      const ssize_t wrote = send(fd, line.data() + sent, line.size() - sent, MSG_NOSIGNAL);
      if (wrote > 0) {
        sent += static_cast<size_t>(wrote);
      } else if (wrote < 0 && errno == EAGAIN) {
        if (!Wait(fd, POLLOUT, deadline)) return KOVA_ERR_TIMEOUT;
      } else if (!(wrote < 0 && errno == EINTR)) {
        return KOVA_ERR_CONNECT;
      }
    }
    std::string received;
    size_t searched = 0;  // bytes of `received` known to hold no newline
    char buffer[65536];
    for (;;) {
      const size_t newline = received.find('\n', searched);
      if (newline != std::string::npos) {
        if (newline > kStatisticsMaxAnswer) return KOVA_ERR_FORMAT;
        received.resize(newline);
        reply = std::move(received);
        return 0;
      }
      searched = received.size();
      if (received.size() > kStatisticsMaxAnswer) return KOVA_ERR_FORMAT;
      if (!Wait(fd, POLLIN, deadline))
        return errno == ETIMEDOUT ? KOVA_ERR_TIMEOUT : KOVA_ERR_CONNECT;
      const ssize_t got = recv(fd, buffer, sizeof(buffer), 0);
      if (got == 0) return KOVA_ERR_CONNECT;  // closed without a whole reply
      if (got < 0 && errno != EINTR && errno != EAGAIN) return KOVA_ERR_CONNECT;
      if (got > 0) received.append(buffer, static_cast<size_t>(got));
    }
  }
};

Transmitor::Transmitor(const char* host) : impl_(new Impl) {
  impl_->local = host != nullptr && strcmp(host, "localhost") == 0;
}

Transmitor::~Transmitor() { delete impl_; }

int Transmitor::Transmit(const Json::Value& request) {
  impl_->answered = false;
  impl_->reply.clear();
  if (!impl_->local) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  const int error = impl_->Exchange(Json::writeString(builder, request) + "\n");
  if (error != 0) {
    KOVA_SET_ERROR(error);
    return -1;
  }
  impl_->answered = true;
  return 0;
}

int Transmitor::GetDataJson(Json::Value& reply) {
  if (!impl_->answered) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return -1;
  }
  Json::CharReaderBuilder builder;
  builder["failIfExtra"] = true;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value parsed;
  const std::string& text = impl_->reply;
  if (!reader->parse(text.data(), text.data() + text.size(), &parsed, nullptr)) {
    KOVA_SET_ERROR(KOVA_ERR_FORMAT);
    return -1;
  }
  reply = parsed;
  return 0;
}
