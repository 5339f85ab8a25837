// kova-webapid: the web-API host. The process started is the monitor; it forks
// the front-end (HTTP) and, on the front-end's request, the runner (modules).

#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <string>
#include <vector>

#include "host/front_end.h"
#include "host/host_log.h"
#include "host/monitor.h"
#include "host/options.h"

using kova_host::HostLog;

int main(int argc, char** argv) {
  kova_host::Options options;
  const int parsed = kova_host::ParseOptions({argv + 1, argv + argc}, options);
  if (parsed != 0) return parsed < 0 ? 0 : parsed;

  // The system root as an absolute path, for every process and service started.
  std::string root;
  if (const char* given = getenv("KOVA_ROOT"); given != nullptr && given[0] != '\0') {
    char resolved[PATH_MAX];
    if (realpath(given, resolved) == nullptr) {
      HostLog("no system root %s", given);
      return 1;
    }
    root = resolved;
    setenv("KOVA_ROOT", resolved, 1);
  }
  if (options.modules_dir.empty()) options.modules_dir = root + "/usr/lib/kova/webapi";
  if (options.static_dir.empty()) options.static_dir = root + "/usr/share/kova/www";

  kova_host::Identity account;
  const kova_host::Identity* drop = nullptr;
  std::string error;
  if (geteuid() == 0) {
    if (!kova_host::LookUpIdentity(options.user, account, error)) {
      HostLog("%s", error.c_str());
      return 1;
    }
    drop = &account;
  } else {
    HostLog("not started as root: every process keeps the ids of uid %d",
            static_cast<int>(getuid()));
  }

  signal(SIGPIPE, SIG_IGN);
  int control[2];
  if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, control) != 0) {
    HostLog("cannot make the control socket");
    return 1;
  }
  const pid_t front_end = fork();
  if (front_end < 0) {
    HostLog("cannot start the front-end");
    return 1;
  }
  if (front_end == 0) {
    close(control[0]);
    // The HTTP server's threads may still run: leave without static destructors.
    _exit(kova_host::RunFrontEnd(control[1], options, drop));
  }
  close(control[1]);
  const kova_host::MonitorSetup setup{options.modules_dir, drop, root + "/tmp"};
  return kova_host::RunMonitor(control[0], front_end, setup);
}
