#include "host/options.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <iterator>

namespace kova_host {

const char kUsage[] =
    "usage: kova-webapid [--bind ADDRESS] [--port PORT] [--user ACCOUNT] [--modules DIR]\n"
    "                    [--static DIR] [--idle-timeout SECONDS] [--call-timeout SECONDS]\n"
    "Serves the web APIs of the modules in DIR (/usr/lib/kova/webapi under $KOVA_ROOT)\n"
    "and the files of the static DIR (/usr/share/kova/www) over HTTP on ADDRESS:PORT\n"
    "(127.0.0.1:5000; port 0 takes any free port). Started as root, it gives root up\n"
    "for ACCOUNT (nobody) once the port is bound. Sessions end after SECONDS without a\n"
    "call (900); a call that runs longer than SECONDS (120) is abandoned.\n";

namespace {

bool ParseNumber(const std::string& text, long low, long high, long& number) {
  char* end = nullptr;
  number = strtol(text.c_str(), &end, 10);
  return !text.empty() && text[0] != '-' && text[0] != '+' && *end == '\0' && number >= low &&
         number <= high;
}

}  // namespace

int ParseOptions(const std::vector<std::string>& args, Options& options) {
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& name = args[i];
    if (name == "--help" || name == "-h") {
      fputs(kUsage, stdout);
      return -1;
    }
    static const char* const kNames[] = {"--bind",   "--port",         "--user",        "--modules",
                                         "--static", "--idle-timeout", "--call-timeout"};
    if (std::find(std::begin(kNames), std::end(kNames), name) == std::end(kNames)) {
      fprintf(stderr, "kova-webapid: unknown option %s\n%s", name.c_str(), kUsage);
      return 2;
    }
    if (i + 1 == args.size()) {
      fprintf(stderr, "kova-webapid: %s without a value\n%s", name.c_str(), kUsage);
      return 2;
    }
    const std::string& value = args[++i];
    long number = 0;
    bool ok = true;
    if (name == "--bind") {
      options.bind = value;
    } else if (name == "--port") {
      ok = ParseNumber(value, 0, 65535, number);
      options.port = static_cast<int>(number);
    } else if (name == "--user") {
      options.user = value;
    } else if (name == "--modules") {
      options.modules_dir = value;
    } else if (name == "--static") {
      options.static_dir = value;
    } else if (name == "--idle-timeout") {
      ok = ParseNumber(value, 1, 7 * 24 * 3600, number);
      options.idle_timeout = std::chrono::seconds(number);
    } else if (name == "--call-timeout") {
      ok = ParseNumber(value, 1, 24 * 3600, number);
      options.call_timeout = std::chrono::seconds(number);
    }
    if (!ok || value.empty()) {
      fprintf(stderr, "kova-webapid: bad value for %s: %s\n", name.c_str(), value.c_str());
      return 2;
    }
  }
  return 0;
}

}  // namespace kova_host
