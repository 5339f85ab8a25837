// The front-end process: HTTP, sessions and static files. It never runs module
// code; calls go to the runner, which the monitor starts for it.

#ifndef KOVA_HOST_FRONT_END_H_
#define KOVA_HOST_FRONT_END_H_

#include "host/options.h"
#include "host/privileges.h"

namespace kova_host {

inline constexpr size_t kMaxBody = size_t{1} << 20;

// Binds the port, gives root up for `account` when it is not null, starts the
// first runner through the monitor on `control` and serves until SIGTERM or
// SIGINT. Returns the exit status.
int RunFrontEnd(int control, const Options& options, const Identity* account);

}  // namespace kova_host

#endif  // KOVA_HOST_FRONT_END_H_
