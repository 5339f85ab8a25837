// For tests: a daemon of daemons/ installed as a platform service in a
// temporary system root.

#ifndef KOVA_TEST_SUPPORT_DAEMON_SERVICE_H_
#define KOVA_TEST_SUPPORT_DAEMON_SERVICE_H_

#include <cstdlib>
#include <string>

namespace kova_test {

// Installs `program` as the platform service `name` in the system root `root`
// with the script daemons/install-service.sh at `script`, run with `options`
// and its system-log lines appended to the file `log`. False when the script
// failed.
inline bool InstallDaemonService(const std::string& script, const std::string& root,
                                 const std::string& name, const std::string& program,
                                 const std::string& options, const std::string& log) {
  const std::string command = script + " " + root + " " + name + " /bin/sh -c \"exec " + program +
                              " " + options + " --log-stderr 2>>" + log + "\"";
  return std::system(command.c_str()) == 0;
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_DAEMON_SERVICE_H_
