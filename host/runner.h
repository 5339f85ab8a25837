// The runner process: loads the modules and runs one call at a time for the
// front-end, each with its standard output captured.

#ifndef KOVA_HOST_RUNNER_H_
#define KOVA_HOST_RUNNER_H_

#include <string>

#include "host/privileges.h"
#include "host/runner_protocol.h"

namespace kova_host {

struct RunnerSetup {
  std::string module_path;  // the one module the runner serves
  // The account whose effective ids the runner takes (real and saved ids stay
  // 0); null to keep the process's own ids.
  const Identity* account = nullptr;
  // A folder mounted over the system's temporary folder `tmp_dir` for the
  // runner alone, so that whatever a call leaves there goes with the runner;
  // empty to share it.
  std::string private_tmp;
  std::string tmp_dir;
  int taken_fd = -1;  // the memory file of its TakenCount
};

// Serves calls on `fd` until the front-end closes it. Returns the exit status.
int RunRunner(int fd, const RunnerSetup& setup);

// Runs one call through the platform's registry, capturing what it writes to
// standard output, which must be a seekable file.
RunnerAnswer ExecuteCall(const RunnerCall& call);

}  // namespace kova_host

#endif  // KOVA_HOST_RUNNER_H_
