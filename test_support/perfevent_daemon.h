// For tests: kovaperfeventd installed as a platform service, and the
// performance-event log read back.

#ifndef KOVA_TEST_SUPPORT_PERFEVENT_DAEMON_H_
#define KOVA_TEST_SUPPORT_PERFEVENT_DAEMON_H_

#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include "kova/log.h"

namespace kova_test {

// Installs `program` as the platform service "kovaperfeventd" in the system
// root `root` with the script install-service.sh at `script`, run with
// `options` and its system-log lines appended to the file `log`.
inline bool InstallDaemonService(const std::string& script, const std::string& root,
                                 const std::string& program, const std::string& options,
                                 const std::string& log) {
  const std::string command = script + " " + root + " /bin/sh -c \"exec " + program + " " +
                              options + " --log-stderr 2>>" + log + "\"";
  return std::system(command.c_str()) == 0;
}

// The performance-event log's records as KOVALogGet1 prints them, without
// their ids, fetched through the file `scratch`.
inline std::vector<std::string> LogLines(const std::string& scratch) {
  std::vector<std::string> lines;
  if (KOVALogGet1(kLogTypePerfEvent, scratch.c_str(), "enu") != 0) return {"(no log)"};
  std::ifstream in(scratch);
  for (std::string line; std::getline(in, line);) lines.push_back(line.substr(line.find('\t') + 1));
  return lines;
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_PERFEVENT_DAEMON_H_
