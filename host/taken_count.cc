#include "host/taken_count.h"

#include <errno.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>

namespace kova_host {

static_assert(std::atomic<uint64_t>::is_always_lock_free, "shared between processes");

int TakenCount::Create(std::string& error) {
  const int fd = memfd_create("kova-webapid-taken", MFD_CLOEXEC);
  if (fd < 0 || ftruncate(fd, sizeof(std::atomic<uint64_t>)) != 0) {
    error = std::string("cannot make the count of calls taken: ") + strerror(errno);
    if (fd >= 0) close(fd);
    return -1;
  }
  return fd;  // a fresh memory file reads as zeros: a count of 0
}

TakenCount::TakenCount(int fd) {
  void* shared =
      mmap(nullptr, sizeof(std::atomic<uint64_t>), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  if (shared != MAP_FAILED) count_ = static_cast<std::atomic<uint64_t>*>(shared);
}

TakenCount::~TakenCount() {
  if (count_ != nullptr) munmap(count_, sizeof(std::atomic<uint64_t>));
}

}  // namespace kova_host
