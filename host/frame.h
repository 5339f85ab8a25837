// Length-prefixed frames on a stream socket: a 4-byte big-endian length, then
// that many bytes. A frame may carry a descriptor (SCM_RIGHTS) with its first
// byte. Every wait is bounded by a deadline.

#ifndef KOVA_HOST_FRAME_H_
#define KOVA_HOST_FRAME_H_

#include <sys/socket.h>

#include <chrono>
#include <deque>
#include <string>
#include <string_view>

#include "host/unique_fd.h"

namespace kova_host {

using Clock = std::chrono::steady_clock;
// No deadline at all.
inline constexpr Clock::time_point kNoDeadline = Clock::time_point::max();
// The largest frame either side accepts: an answer's JSON envelope fits; a
// handler's raw output over 64 KiB travels as a file instead.
inline constexpr size_t kMaxFrame = size_t{256} << 20;

enum class IoResult {
  kOk,
  kClosed,     // the other side closed the socket (or died)
  kTimeout,    // the deadline passed
  kTooLarge,   // a frame longer than allowed
  kMalformed,  // a whole frame that doesn't hold the message expected
  kError,      // any other failure (errno says which)
};

// Writes one frame; `attached`, unless -1, goes with it as a copy (the caller
// keeps its own).
IoResult WriteFrame(int fd, std::string_view payload, Clock::time_point deadline,
                    int attached = -1);
// Writes two frames with one system call where the socket takes them whole, so
// that the reader wakes once.
IoResult WriteFrames(int fd, std::string_view first, std::string_view second,
                     Clock::time_point deadline);
// Reads frames from one socket, taking whatever the socket holds at once, so
// that a message of several frames costs one read where it can. Descriptors
// that come with the bytes are kept, in order, until taken; those never taken
// are closed with the reader.
class FrameReader {
 public:
  explicit FrameReader(int fd) : fd_(fd) {}
  IoResult Read(std::string& payload, size_t max_size, Clock::time_point deadline);
  // The first descriptor received and not yet taken; invalid when none came.
  // One sent with a frame has come once that frame was read.
  UniqueFd TakeDescriptor();
  // Whether bytes already taken from the descriptor wait to be read: poll(2)
  // on the descriptor no longer reports them.
  bool Buffered() const { return end_ > start_; }

 private:
  // Reads until `size` unread bytes are buffered.
  IoResult Fill(size_t size, Clock::time_point deadline);

  static constexpr size_t kReadSize = 65536;            // asked of each read at least
  static constexpr size_t kKeptSize = size_t{1} << 20;  // room kept between frames

  int fd_;
  std::string buffer_;  // bytes read are [start_, end_); the rest is room
  size_t start_ = 0;
  size_t end_ = 0;
  std::deque<UniqueFd> descriptors_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_FRAME_H_
