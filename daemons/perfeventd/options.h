// The command line of kovaperfeventd.

#ifndef KOVA_DAEMONS_PERFEVENTD_OPTIONS_H_
#define KOVA_DAEMONS_PERFEVENTD_OPTIONS_H_

#include <string>

namespace perfeventd {

struct Options {
  std::string proc_dir = "/proc";
  std::string sys_dir = "/sys";
  double time_scale = 1;  // real seconds per second of the rules' periods and durations
  bool log_to_stderr = false;
  bool help = false;
};

// Parses the arguments after the program's name. False with `error` set on a
// bad command line: an unknown option, a missing value, a directory that
// isn't one, a time scale that isn't a number above 0 and at most 3600.
bool ParseOptions(int argc, const char* const* argv, Options& options, std::string& error);

extern const char kUsage[];

}  // namespace perfeventd

#endif  // KOVA_DAEMONS_PERFEVENTD_OPTIONS_H_
