#include "host/passed_fds.h"

#include <cstring>

namespace kova_host {

bool AttachDescriptors(msghdr& message, const int* fds, size_t count, void* room,
                       size_t room_size) {
  if (count == 0 || CMSG_SPACE(sizeof(int) * count) > room_size) return false;
  message.msg_control = room;
  message.msg_controllen = CMSG_SPACE(sizeof(int) * count);
  cmsghdr* header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(sizeof(int) * count);
  memcpy(CMSG_DATA(header), fds, sizeof(int) * count);
  return true;
}

std::vector<UniqueFd> PassedDescriptors(msghdr& message) {
  std::vector<UniqueFd> passed;
  for (cmsghdr* header = CMSG_FIRSTHDR(&message); header != nullptr;
       header = CMSG_NXTHDR(&message, header)) {
    if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS) continue;
    const size_t count = (header->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (size_t i = 0; i < count; ++i) {
      int fd;
      memcpy(&fd, CMSG_DATA(header) + i * sizeof(int), sizeof(int));
      passed.emplace_back(fd);
    }
  }
  return passed;
}

}  // namespace kova_host
