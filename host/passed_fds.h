// Descriptors that travel beside the bytes of a message on a Unix socket
// (SCM_RIGHTS): the monitor's messages and the runners' frames both carry them.

#ifndef KOVA_HOST_PASSED_FDS_H_
#define KOVA_HOST_PASSED_FDS_H_

#include <sys/socket.h>

#include <cstddef>
#include <vector>

#include "host/unique_fd.h"

namespace kova_host {

// Attaches the `count` descriptors `fds` to `message`, writing the control data
// into `room` (`room_size` bytes, aligned for cmsghdr). False, with nothing
// attached, when they don't fit.
bool AttachDescriptors(msghdr& message, const int* fds, size_t count, void* room, size_t room_size);

// The descriptors that came with the received `message`, in order, now owned
// by the caller.
std::vector<UniqueFd> PassedDescriptors(msghdr& message);

}  // namespace kova_host

#endif  // KOVA_HOST_PASSED_FDS_H_
