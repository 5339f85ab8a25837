// A count of the calls a runner has taken, in memory that the runner and the
// front-end share. The runner counts a call before it runs it; once a runner
// is gone, the count tells whether it took the call it was last sent. It costs
// no message per call.

#ifndef KOVA_HOST_TAKEN_COUNT_H_
#define KOVA_HOST_TAKEN_COUNT_H_

#include <atomic>
#include <cstdint>
#include <string>

namespace kova_host {

class TakenCount {
 public:
  // A fresh count of 0 in a memory file; its descriptor, or -1 with `error`.
  static int Create(std::string& error);

  // Maps the count of the memory file `fd` (which stays the caller's). A
  // count that can't be mapped reads as 0 and counts nothing.
  explicit TakenCount(int fd);
  ~TakenCount();
  TakenCount(const TakenCount&) = delete;
  TakenCount& operator=(const TakenCount&) = delete;

  bool mapped() const { return count_ != nullptr; }
  void Add() {
    if (count_ != nullptr) count_->fetch_add(1, std::memory_order_release);
  }
  uint64_t Read() const { return count_ != nullptr ? count_->load(std::memory_order_acquire) : 0; }

 private:
  std::atomic<uint64_t>* count_ = nullptr;
};

}  // namespace kova_host

#endif  // KOVA_HOST_TAKEN_COUNT_H_
