#include "statd/options.h"

#include "statd/metrics_server.h"

#include <sys/stat.h>

#include <cmath>
#include <cstdlib>
#include <string_view>

namespace statd {

const char kUsage[] =
    "usage: kovastatd [--interval SECONDS] [--proc DIR] [--sys DIR] [--time-scale FACTOR]\n"
    "                 [--database CONNINFO] [--spool-max MIB] [--metrics-listen ADDR:PORT]\n"
    "                 [--metrics-token-file PATH] [--log-stderr]\n"
    "Collects usage statistics as the service \"kovastatd\": every series sampled each\n"
    "interval, kept in memory for the real-time range and, while history is on, written\n"
    "to the history database once a minute. Answers on /run/kova/statd.sock. SIGHUP\n"
    "reads the settings again; SIGTERM ends it.\n"
    "  --interval SECONDS   seconds between samples, 1 to 60 (default 1)\n"
    "  --proc DIR           read process and system counters from DIR (default /proc)\n"
    "  --sys DIR            read block devices from DIR (default /sys)\n"
    "  --time-scale FACTOR  real seconds per second of the collector's clock (default 1;\n"
    "                       0.05 makes a minute pass in 3 s)\n"
    "  --database CONNINFO  the history database as a libpq connection string (default:\n"
    "                       the service \"pgsql\", host=<root>/run/pgsql user=kova\n"
    "                       dbname=kova_history)\n"
    "  --spool-max MIB      how much may wait for the database, 1 to 4096 (default 64)\n"
    "  --metrics-listen ADDR:PORT  serve GET /metrics for Prometheus there; empty: not\n"
    "                       at all (default: statd_metrics_listen of the settings)\n"
    "  --metrics-token-file PATH  a scrape must send \"Authorization: Bearer\" with the\n"
    "                       token in PATH (default: statd_metrics_token_file)\n"
    "  --log-stderr         copy system-log lines to standard error\n";

namespace {

bool IsDirectory(const std::string& path) {
  struct stat info;
  return !path.empty() && stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

// `text` as a number from `low` to `high`.
bool Number(const std::string& text, double low, double high, double& number) {
  char* end = nullptr;
  number = strtod(text.c_str(), &end);
  return !text.empty() && *end == '\0' && std::isfinite(number) && number >= low && number <= high;
}

}  // namespace

bool ParseOptions(int argc, const char* const* argv, Options& options, std::string& error) {
  for (int i = 1; i < argc; ++i) {
    const std::string_view arg = argv[i];
    if (arg == "--help" || arg == "-h") {
      options.help = true;
      continue;
    }
    if (arg == "--log-stderr") {
      options.log_to_stderr = true;
      continue;
    }
    const size_t equals = arg.find('=');
    const std::string name(arg.substr(0, equals));
    static const char* const kValued[] = {"--interval",
                                          "--proc",
                                          "--sys",
                                          "--time-scale",
                                          "--database",
                                          "--spool-max",
                                          "--metrics-listen",
                                          "--metrics-token-file",
                                          nullptr};
    bool valued = false;
    for (const char* const* known = kValued; *known != nullptr; ++known) valued |= name == *known;
    if (!valued) {
      error = "unknown option " + std::string(arg);
      return false;
    }
    std::string value;
    if (equals != std::string_view::npos) {
      value = arg.substr(equals + 1);
    } else if (i + 1 < argc) {
      value = argv[++i];
    } else {
      error = name + " needs a value";
      return false;
    }
    double number = 0;
    if (name == "--proc" || name == "--sys") {
      if (!IsDirectory(value)) {
        error = name + " " + value + ": not a directory";
        return false;
      }
      (name == "--proc" ? options.proc_dir : options.sys_dir) = value;
    } else if (name == "--database") {
      options.database = value;
    } else if (name == "--metrics-listen") {
      std::string address;
      uint16_t port = 0;
      if (!value.empty() && !ParseListenAddress(value, address, port, error)) {
        error = "--metrics-listen " + error;
        return false;
      }
      options.metrics_listen = value;
    } else if (name == "--metrics-token-file") {
      options.metrics_token_file = value;
    } else if (name == "--interval") {
      if (!Number(value, 1, 60, number) || number != std::floor(number)) {
        error = "--interval " + value + ": not a whole number from 1 to 60";
        return false;
      }
      options.interval = static_cast<int>(number);
    } else if (name == "--time-scale") {
      if (!Number(value, 1e-6, 3600, number) || number <= 0) {
        error = "--time-scale " + value + ": not a number above 0 and at most 3600";
        return false;
      }
      options.time_scale = number;
    } else {
      if (!Number(value, 1, 4096, number) || number != std::floor(number)) {
        error = "--spool-max " + value + ": not a whole number from 1 to 4096";
        return false;
      }
      options.spool_max_bytes = static_cast<size_t>(number) << 20;
    }
  }
  return true;
}

}  // namespace statd
