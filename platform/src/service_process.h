// The processes of started services: launching one detached, telling whether a
// recorded process is still the one that was started, and signalling it.

#ifndef KOVA_PLATFORM_SRC_SERVICE_PROCESS_H_
#define KOVA_PLATFORM_SRC_SERVICE_PROCESS_H_

#include <sys/types.h>

#include <chrono>
#include <string>
#include <vector>

#include "src/privilege.h"

namespace kova {

// A process as recorded when it was started: its id and its start time in
// clock ticks since boot, which tells it apart from a later process that got
// the same id.
struct ProcessIdentity {
  pid_t pid = 0;
  unsigned long long start_time = 0;
};

// The start time of process `pid`, false when there is no such process or it
// has ended (a zombie counts as ended).
bool ReadProcessStart(pid_t pid, unsigned long long& start_time);

// Whether `process` is alive and is the process that was recorded.
bool IsAlive(const ProcessIdentity& process);

// Runs `argv` (argv[0] an absolute program path) with the environment `env` as
// a detached process: its own session, not a child of this process, standard
// streams on /dev/null. When this process is root, the program runs with the
// ids of `account`, or fully as root when `account` is null; otherwise it keeps
// this process's ids. Returns once the program runs, with its identity in
// `started`; false with errno set when the program could not be started.
bool LaunchDetached(const std::vector<std::string>& argv, const std::vector<std::string>& env,
                    const Account* account, ProcessIdentity& started);

// Stops `process`: sends SIGTERM to its whole process group, or `stop_signal`
// to the process alone when it is not 0, and waits up to `grace` for the process
// to end. Past the grace, the group gets SIGKILL and a little more time; after
// a stop signal that ended the process, what is left of its group gets SIGKILL
// at once. True when the process has ended; false with errno set when it could
// not be signalled or outlived SIGKILL.
bool Terminate(const ProcessIdentity& process, std::chrono::milliseconds grace,
               int stop_signal = 0);

// Splits a command line at blanks; double quotes group words. False when a quote
// is left open or the line has no words.
bool SplitCommand(const std::string& line, std::vector<std::string>& words);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_SERVICE_PROCESS_H_
