#include "host/frame.h"

#include <errno.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cstdint>

namespace kova_host {
namespace {

// Waits until `fd` is ready for `events` or the deadline passes.
IoResult Wait(int fd, short events, Clock::time_point deadline) {
  for (;;) {
    int timeout = -1;
    if (deadline != kNoDeadline) {
      const auto left =
          std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now()).count();
      if (left <= 0) return IoResult::kTimeout;
      timeout = static_cast<int>(std::min<long long>(left, 60000));
    }
    pollfd entry{fd, events, 0};
    const int ready = poll(&entry, 1, timeout);
    if (ready > 0) return IoResult::kOk;  // errors and hang-ups show in the next send or recv
    if (ready < 0 && errno != EINTR) return IoResult::kError;
  }
}

IoResult WriteAll(int fd, const char* data, size_t size, Clock::time_point deadline) {
  while (size > 0) {
    const ssize_t sent = send(fd, data, size, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (sent > 0) {
      data += sent;
      size -= static_cast<size_t>(sent);
      continue;
    }
    if (errno == EPIPE || errno == ECONNRESET) return IoResult::kClosed;
    if (errno != EAGAIN && errno != EINTR) return IoResult::kError;
    if (IoResult waited = Wait(fd, POLLOUT, deadline); waited != IoResult::kOk) return waited;
  }
  return IoResult::kOk;
}

IoResult ReadAll(int fd, char* data, size_t size, Clock::time_point deadline) {
  while (size > 0) {
    const ssize_t got = recv(fd, data, size, MSG_DONTWAIT);
    if (got > 0) {
      data += got;
      size -= static_cast<size_t>(got);
      continue;
    }
    if (got == 0 || errno == ECONNRESET) return IoResult::kClosed;
    if (errno != EAGAIN && errno != EINTR) return IoResult::kError;
    if (IoResult waited = Wait(fd, POLLIN, deadline); waited != IoResult::kOk) return waited;
  }
  return IoResult::kOk;
}

}  // namespace

IoResult WriteFrame(int fd, std::string_view payload, Clock::time_point deadline) {
  if (payload.size() > kMaxFrame) return IoResult::kTooLarge;
  const uint32_t size = static_cast<uint32_t>(payload.size());
  const char prefix[4] = {static_cast<char>(size >> 24), static_cast<char>(size >> 16),
                          static_cast<char>(size >> 8), static_cast<char>(size)};
  if (IoResult written = WriteAll(fd, prefix, sizeof(prefix), deadline); written != IoResult::kOk) {
    return written;
  }
  return WriteAll(fd, payload.data(), payload.size(), deadline);
}

IoResult ReadFrame(int fd, std::string& payload, size_t max_size, Clock::time_point deadline) {
  unsigned char prefix[4];
  if (IoResult got = ReadAll(fd, reinterpret_cast<char*>(prefix), sizeof(prefix), deadline);
      got != IoResult::kOk) {
    return got;
  }
  const size_t size = (size_t{prefix[0]} << 24) | (size_t{prefix[1]} << 16) |
                      (size_t{prefix[2]} << 8) | size_t{prefix[3]};
  if (size > max_size) return IoResult::kTooLarge;
  payload.resize(size);
  return ReadAll(fd, payload.data(), size, deadline);
}

}  // namespace kova_host
