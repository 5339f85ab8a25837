#include "host/frame.h"

#include <errno.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <algorithm>
#include <cstdint>
#include <cstring>

#include "host/passed_fds.h"

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

// Descriptors one read takes at most; more are closed by the kernel.
constexpr size_t kMaxReceived = 4;

// Sends the buffers of `parts` in order, resuming after partial sends;
// `attached`, unless -1, goes with the first byte.
IoResult WriteAll(int fd, iovec* parts, size_t count, Clock::time_point deadline,
                  int attached = -1) {
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
  while (count > 0) {
    msghdr message{};
    message.msg_iov = parts;
    message.msg_iovlen = count;
    if (attached >= 0) AttachDescriptors(message, &attached, 1, control, sizeof(control));
    ssize_t sent = sendmsg(fd, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (sent > 0) attached = -1;  // it went with the bytes sent
    if (sent < 0) {
      if (errno == EPIPE || errno == ECONNRESET) return IoResult::kClosed;
      if (errno != EAGAIN && errno != EINTR) return IoResult::kError;
      if (IoResult waited = Wait(fd, POLLOUT, deadline); waited != IoResult::kOk) return waited;
      continue;
    }
    for (; count > 0 && static_cast<size_t>(sent) >= parts->iov_len; ++parts, --count) {
      sent -= static_cast<ssize_t>(parts->iov_len);
    }
    if (count > 0) {
      parts->iov_base = static_cast<char*>(parts->iov_base) + sent;
      parts->iov_len -= static_cast<size_t>(sent);
    }
  }
  return IoResult::kOk;
}

void Prefix(std::string_view payload, unsigned char (&prefix)[4]) {
  const uint32_t size = static_cast<uint32_t>(payload.size());
  prefix[0] = static_cast<unsigned char>(size >> 24);
  prefix[1] = static_cast<unsigned char>(size >> 16);
  prefix[2] = static_cast<unsigned char>(size >> 8);
  prefix[3] = static_cast<unsigned char>(size);
}

iovec Part(const void* data, size_t size) { return {const_cast<void*>(data), size}; }

}  // namespace

IoResult WriteFrame(int fd, std::string_view payload, Clock::time_point deadline, int attached) {
  if (payload.size() > kMaxFrame) return IoResult::kTooLarge;
  unsigned char prefix[4];
  Prefix(payload, prefix);
  iovec parts[] = {Part(prefix, 4), Part(payload.data(), payload.size())};
  return WriteAll(fd, parts, 2, deadline, attached);
}

IoResult WriteFrames(int fd, std::string_view first, std::string_view second,
                     Clock::time_point deadline) {
  if (first.size() > kMaxFrame || second.size() > kMaxFrame) return IoResult::kTooLarge;
  unsigned char prefixes[2][4];
  Prefix(first, prefixes[0]);
  Prefix(second, prefixes[1]);
  iovec parts[] = {Part(prefixes[0], 4), Part(first.data(), first.size()), Part(prefixes[1], 4),
                   Part(second.data(), second.size())};
  return WriteAll(fd, parts, 4, deadline);
}

IoResult FrameReader::Fill(size_t size, Clock::time_point deadline) {
  if (start_ > 0 && end_ - start_ < size) {
    buffer_.erase(0, start_);
    end_ -= start_;
    start_ = 0;
  }
  while (end_ - start_ < size) {
    // Without a deadline the read may block; with one, poll says when to read.
    if (deadline != kNoDeadline) {
      if (IoResult waited = Wait(fd_, POLLIN, deadline); waited != IoResult::kOk) return waited;
    }
    // The buffer only grows here, so each byte of it is cleared once.
    const size_t room = std::max(start_ + size, end_ + kReadSize);
    if (buffer_.size() < room) buffer_.resize(room);
    iovec room_left{buffer_.data() + end_, buffer_.size() - end_};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * kMaxReceived)];
    msghdr message{};
    message.msg_iov = &room_left;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof(control);
    const ssize_t got =
        recvmsg(fd_, &message, MSG_CMSG_CLOEXEC | (deadline == kNoDeadline ? 0 : MSG_DONTWAIT));
    if (got >= 0) {
      for (UniqueFd& passed : PassedDescriptors(message)) descriptors_.push_back(std::move(passed));
    }
    if (got > 0) {
      end_ += static_cast<size_t>(got);
      continue;
    }
    if (got == 0 || errno == ECONNRESET) return IoResult::kClosed;
    if (errno != EAGAIN && errno != EINTR) return IoResult::kError;
  }
  return IoResult::kOk;
}

UniqueFd FrameReader::TakeDescriptor() {
  if (descriptors_.empty()) return UniqueFd();
  UniqueFd first = std::move(descriptors_.front());
  descriptors_.pop_front();
  return first;
}

IoResult FrameReader::Read(std::string& payload, size_t max_size, Clock::time_point deadline) {
  if (IoResult got = Fill(4, deadline); got != IoResult::kOk) return got;
  const auto* prefix = reinterpret_cast<const unsigned char*>(buffer_.data() + start_);
  const size_t size = (size_t{prefix[0]} << 24) | (size_t{prefix[1]} << 16) |
                      (size_t{prefix[2]} << 8) | size_t{prefix[3]};
  if (size > max_size) return IoResult::kTooLarge;
  if (IoResult got = Fill(4 + size, deadline); got != IoResult::kOk) return got;
  payload.assign(buffer_, start_ + 4, size);
  start_ += 4 + size;
  if (start_ == end_) {
    start_ = end_ = 0;
    // A large frame's room is given back; a small one is kept for the next.
    if (buffer_.size() > kKeptSize) std::string().swap(buffer_);
  }
  return IoResult::kOk;
}

}  // namespace kova_host
