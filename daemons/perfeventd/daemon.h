// The main loop of kovaperfeventd: a cycle every period, the rules read again
// on SIGHUP or when the store changed, a clean end on SIGTERM or SIGINT.

#ifndef KOVA_DAEMONS_PERFEVENTD_DAEMON_H_
#define KOVA_DAEMONS_PERFEVENTD_DAEMON_H_

#include "perfeventd/options.h"

namespace perfeventd {

// Holds SIGTERM, SIGINT and SIGHUP back for RunDaemon to take.
void BlockSignals();

// Runs until SIGTERM or SIGINT; returns the exit status.
int RunDaemon(const Options& options);

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_DAEMON_H_
