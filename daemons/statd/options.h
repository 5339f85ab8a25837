// The command line of kovastatd.

#ifndef KOVA_DAEMONS_STATD_OPTIONS_H_
#define KOVA_DAEMONS_STATD_OPTIONS_H_

#include <cstddef>
#include <optional>
#include <string>

namespace statd {

struct Options {
  int interval = 1;  // seconds between samples
  std::string proc_dir = "/proc";
  std::string sys_dir = "/sys";
  double time_scale = 1;  // real seconds per second of the collector's clock
  std::string database;   // libpq connection string; empty: the platform's "pgsql"
  size_t spool_max_bytes = size_t{64} << 20;
  // The metrics endpoint's address and token file; unset: the settings file's.
  std::optional<std::string> metrics_listen;
  std::optional<std::string> metrics_token_file;
  bool log_to_stderr = false;
  bool help = false;
};

// Parses the arguments after the program's name. False with `error` set on a
// bad command line: an unknown option, a missing value, a directory that isn't
// one, a number out of its range.
bool ParseOptions(int argc, const char* const* argv, Options& options, std::string& error);

extern const char kUsage[];

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_OPTIONS_H_
