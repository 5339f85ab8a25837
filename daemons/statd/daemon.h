// The main loop of kovastatd: a sample every interval, the socket answered
// meanwhile, the settings read again on SIGHUP (or a "reload" request), a clean
// end on SIGTERM or SIGINT.

#ifndef KOVA_DAEMONS_STATD_DAEMON_H_
#define KOVA_DAEMONS_STATD_DAEMON_H_

#include "statd/options.h"

namespace statd {

// Holds SIGTERM, SIGINT and SIGHUP back for RunDaemon to take.
void BlockSignals();

// Runs until SIGTERM or SIGINT; returns the exit status (1 when the socket
// can't be served).
int RunDaemon(const Options& options);

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_DAEMON_H_
