// The monitor: the process kova-webapid starts as. It keeps the rights the host
// was started with and does for the front-end the two things that need them:
// it starts runners (which keep real and saved ids 0) and checks passwords
// against the accounts file. The front-end asks over a control socket.

#ifndef KOVA_HOST_MONITOR_H_
#define KOVA_HOST_MONITOR_H_

#include <sys/types.h>

#include <map>
#include <mutex>
#include <string>

#include "host/runner.h"
#include "host/runner_client.h"

namespace kova_host {

struct MonitorSetup {
  std::string modules_dir;
  const Identity* account = nullptr;  // as RunnerSetup's
  std::string tmp_dir;                // the system's temporary folder
};

// Serves the front-end `front_end` on the control socket `control` until the
// front-end ends or a signal to stop arrives; then stops the runners and the
// front-end. Started as root, each runner gets a temporary folder of its own
// in place of the system's, removed when the runner ends. Returns the front-end's exit status.
int RunMonitor(int control, pid_t front_end, const MonitorSetup& setup);

// The front-end's side of the control socket. Safe to use from many threads.
class MonitorClient {
 public:
  explicit MonitorClient(int control) : control_(control) {}

  // Starts a fresh runner for `module`, a file name of the modules folder
  // (stopping its runner before), and hands over its socket and the memory
  // file of its TakenCount (`taken_fd`); -1 with `error`.
  int Start(const std::string& module, int& taken_fd, std::string& error);
  // Stops the runner of `module` at once.
  void Stop(const std::string& module);
  // 1 when `password` is the account's (`admin` then set), 0 when not, -1 on failure.
  int CheckPassword(const std::string& account, const std::string& password, bool& admin);

 private:
  int control_;
  std::mutex mutex_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_MONITOR_H_
