// kova-webapid's command line.

#ifndef KOVA_HOST_OPTIONS_H_
#define KOVA_HOST_OPTIONS_H_

#include <chrono>
#include <string>
#include <vector>

namespace kova_host {

struct Options {
  std::string bind = "127.0.0.1";
  int port = 5000;              // 0: any free port, printed when listening
  std::string user = "nobody";  // the unprivileged account, when started as root
  std::string modules_dir;      // default: /usr/lib/kova/webapi under the system root
  std::string static_dir;       // default: /usr/share/kova/www under the system root
  std::chrono::seconds idle_timeout{900};
  std::chrono::seconds call_timeout{120};
  size_t max_waiting_calls = 4096;  // per module, besides those sent to its runner
  // Limits of the HTTP front-end.
  size_t max_connections = 10000;
  size_t max_per_address = 256;                // connections from one client address
  std::chrono::seconds header_timeout{10};     // to read a request's line and header
  std::chrono::seconds body_timeout{30};       // to read its body
  std::chrono::seconds keepalive_timeout{60};  // a connection idle between requests
  std::chrono::seconds send_timeout{60};       // for a client to take an answer, or each part
};

extern const char kUsage[];

// Parses the arguments after the program's name. Returns 0 to go on, -1 after
// printing the help, 2 after printing what is wrong.
int ParseOptions(const std::vector<std::string>& args, Options& options);

}  // namespace kova_host

#endif  // KOVA_HOST_OPTIONS_H_
