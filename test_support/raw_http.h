// For tests: plain TCP connections to a local HTTP server, for clients that a
// library would not imitate: ones that send nothing, send a request byte by
// byte, or hold a connection open.

#ifndef KOVA_TEST_SUPPORT_RAW_HTTP_H_
#define KOVA_TEST_SUPPORT_RAW_HTTP_H_

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <strings.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <string>
#include <string_view>
#include <utility>

namespace kova_test {

class RawConnection {
 public:
  // Connects to 127.0.0.1:`port`; ok() tells whether it did.
  explicit RawConnection(int port) {
    fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (fd_ >= 0 && connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof(address)) != 0) {
      close(fd_);
      fd_ = -1;
    }
  }
  ~RawConnection() {
    if (fd_ >= 0) close(fd_);
  }
  RawConnection(RawConnection&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  RawConnection& operator=(RawConnection&& other) noexcept {
    std::swap(fd_, other.fd_);
    return *this;
  }

  bool ok() const { return fd_ >= 0; }

  // Sends all of `bytes`; false when the connection is gone.
  bool Send(std::string_view bytes) const {
    while (!bytes.empty()) {
      const ssize_t sent = send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
      if (sent <= 0) return false;
      bytes.remove_prefix(static_cast<size_t>(sent));
    }
    return true;
  }

  // Whether the server has closed the connection, waiting up to `wait` for it;
  // what the server sends meanwhile goes to `received`.
  bool ClosedWithin(std::chrono::milliseconds wait, std::string* received = nullptr) const {
    const auto deadline = std::chrono::steady_clock::now() + wait;
    for (;;) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      pollfd ready{fd_, POLLIN, 0};
      if (left.count() <= 0 || poll(&ready, 1, static_cast<int>(left.count())) <= 0) return false;
      char buffer[4096];
      const ssize_t got = recv(fd_, buffer, sizeof(buffer), 0);
      if (got == 0 || (got < 0 && errno == ECONNRESET)) return true;
      if (got > 0 && received != nullptr) received->append(buffer, static_cast<size_t>(got));
    }
  }

  // Whether the connection is still open at this moment: nothing to read that
  // would say the server closed it.
  bool Open() const {
    pollfd ready{fd_, POLLIN | POLLRDHUP, 0};
    if (poll(&ready, 1, 0) == 0) return true;
    if ((ready.revents & (POLLRDHUP | POLLHUP | POLLERR)) != 0) return false;
    char byte;
    return recv(fd_, &byte, 1, MSG_PEEK | MSG_DONTWAIT) > 0;
  }

  // At least `count` bytes of what the server sends, waiting up to `wait`;
  // fewer when it closes or the time runs out.
  std::string ReadAtLeast(size_t count, std::chrono::milliseconds wait) const {
    const auto deadline = std::chrono::steady_clock::now() + wait;
    std::string text;
    while (text.size() < count) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      pollfd ready{fd_, POLLIN, 0};
      if (left.count() <= 0 || poll(&ready, 1, static_cast<int>(left.count())) <= 0) break;
      char buffer[65536];
      const ssize_t got = recv(fd_, buffer, sizeof(buffer), 0);
      if (got <= 0) break;
      text.append(buffer, static_cast<size_t>(got));
    }
    return text;
  }

  // One answer: its header and a body of its Content-Length, waiting up to
  // `wait`; what arrived, possibly cut short.
  std::string ReadAnswer(std::chrono::milliseconds wait) const {
    const auto deadline = std::chrono::steady_clock::now() + wait;
    std::string text;
    size_t want = std::string::npos;
    while (text.size() < want) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      pollfd ready{fd_, POLLIN, 0};
      if (left.count() <= 0 || poll(&ready, 1, static_cast<int>(left.count())) <= 0) break;
      char buffer[4096];
      const ssize_t got = recv(fd_, buffer, sizeof(buffer), 0);
      if (got <= 0) break;
      text.append(buffer, static_cast<size_t>(got));
      const size_t end = text.find("\r\n\r\n");
      if (want == std::string::npos && end != std::string::npos) {
        want = end + 4 + ContentLength(text.substr(0, end));
      }
    }
    return text;
  }

 private:
  static size_t ContentLength(const std::string& header) {
    for (size_t line = header.find("\r\n"); line != std::string::npos;
         line = header.find("\r\n", line + 2)) {
      constexpr char kName[] = "Content-Length:";
      if (strncasecmp(header.c_str() + line + 2, kName, sizeof(kName) - 1) == 0) {
        return std::stoul(header.substr(line + 2 + sizeof(kName) - 1));
      }
    }
    return 0;
  }

  int fd_ = -1;
};

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_RAW_HTTP_H_
