#include "perfeventd/options.h"

#include <sys/stat.h>

#include <cmath>
#include <cstdlib>
#include <string_view>

namespace perfeventd {

const char kUsage[] =
    "usage: kovaperfeventd [--proc DIR] [--sys DIR] [--time-scale FACTOR] [--log-stderr]\n"
    "Raises performance events under the rules of the rule store, as the service\n"
    "\"kovaperfeventd\". SIGHUP reads the rules again; SIGTERM ends it.\n"
    "  --proc DIR           read process and system counters from DIR (default /proc)\n"
    "  --sys DIR            read block devices from DIR (default /sys)\n"
    "  --time-scale FACTOR  real seconds per second of the rules' periods and durations\n"
    "                       (default 1; 0.01 runs a 5 s period every 50 ms)\n"
    "  --log-stderr         copy system-log lines to standard error\n";

bool ParseOptions(int argc, const char* const* argv, Options& options, std::string& error) {
  for (int i = 1; i < argc; ++i) {
    std::string_view arg = argv[i];
    std::string value;
    const size_t equals = arg.find('=');
    const std::string_view name = arg.substr(0, equals);
    const bool takes_value = name == "--proc" || name == "--sys" || name == "--time-scale";
    if (arg == "--help" || arg == "-h") {
      options.help = true;
      continue;
    }
    if (arg == "--log-stderr") {
      options.log_to_stderr = true;
      continue;
    }
    if (!takes_value) {
      error = "unknown option " + std::string(arg);
      return false;
    }
    if (equals != std::string_view::npos) {
      value = arg.substr(equals + 1);
    } else if (i + 1 < argc) {
      value = argv[++i];
    } else {
      error = std::string(name) + " needs a value";
      return false;
    }
    if (name == "--time-scale") {
      char* end = nullptr;
      const double scale = strtod(value.c_str(), &end);
      if (value.empty() || *end != '\0' || !std::isfinite(scale) || scale <= 0 || scale > 3600) {
        error = "--time-scale " + value + ": not a number above 0 and at most 3600";
        return false;
      }
      options.time_scale = scale;
      continue;
    }
    struct stat info;
    if (value.empty() || stat(value.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
      error = std::string(name) + " " + value + ": not a directory";
      return false;
    }
    (name == "--proc" ? options.proc_dir : options.sys_dir) = value;
  }
  return true;
}

}  // namespace perfeventd
