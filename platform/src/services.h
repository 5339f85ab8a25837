// System services, as the platform describes and runs them.
//
// A service is described by /etc/kova/services/<name>.conf (under the system
// root), a configuration file with the keys
//   command       the program's absolute path and its arguments (double quotes
//                 group words); the program runs in the foreground, with the
//                 environment PATH, LANG and KOVA_ROOT
//   display_name  the name shown to users (default: the service's name)
//   package       the package the service belongs to, if any
//   user          the account the service runs as when the platform is root
//                 (its uid, primary gid and groups); root when unset. A caller
//                 that is not root starts services with its own ids. Each start
//                 of such a service makes its runtime folder /run/<name>, mode
//                 0750, owned by the ids the service runs with (the account's
//                 uid and primary gid), before they are taken, or puts right the
//                 owner and mode of the folder there; a symbolic link or anything
//                 else than a folder there fails the start (KOVA_ERR_FORMAT)
//   stop_signal   the signal that stops the service (HUP, INT, QUIT, TERM, USR1
//                 or USR2, "SIG" in front allowed), sent to its main process
//                 alone; unset, SIGTERM goes to the service's whole process group
//   stop_timeout  seconds (1 to 3600, default 5) the service has to end after
//                 the stop signal before its process group gets SIGKILL
// A started service is recorded in /run/kova/<name>.pid as "<pid> <start time>".
// The service of a package <pkg> is "pkgctl-<pkg>"; it is known to the system
// while /var/packages/<pkg> exists, even without a file of its own.

#ifndef KOVA_PLATFORM_SRC_SERVICES_H_
#define KOVA_PLATFORM_SRC_SERVICES_H_

#include <string>
#include <vector>

namespace kova {

struct ServiceDescription {
  std::string name;
  std::string command;
  std::string display_name;
  std::string package;
  std::string user;
  std::string stop_signal;
  std::string stop_timeout;
};

// Reads the description of service `name`. Returns 1 when the service is known,
// 0 when it is not (or the name can't be a service's), -1 when its file can't
// be read; the last platform error says why on 0 and -1.
int DescribeService(const std::string& name, ServiceDescription& description);

// The runtime folder of service `name`, a system path: /run/<name>.
std::string RuntimeFolder(const std::string& name);

// The names of the described services, sorted.
std::vector<std::string> ListServices();

// The names of every service the system knows, sorted, each once: the
// described ones and "pkgctl-<pkg>" for each installed package (a directory
// /var/packages/<pkg>), with or without a description. Empty when neither
// directory can be read.
std::vector<std::string> ListKnownServices();

// The name users see for the service `name`: its display name, or for a
// package's service without one of its own, the package's name from its INFO
// file (displayname_enu, else displayname). `name` itself when the service is
// unknown or its description can't be read.
std::string ServiceDisplayName(const std::string& name);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_SERVICES_H_
