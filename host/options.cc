#include "host/options.h"

#include <cstdio>
#include <cstdlib>

namespace kova_host {

const char kUsage[] =
    "usage: kova-webapid [OPTION VALUE]...\n"
    "Serves the web APIs of the modules in a folder over HTTP, with the files of a\n"
    "static folder. Started as root, it gives root up for an account once the port\n"
    "is bound.\n"
    "  --bind ADDRESS            listen on ADDRESS (127.0.0.1)\n"
    "  --port PORT               listen on PORT (5000); 0 takes any free port\n"
    "  --user ACCOUNT            the account to run as when started as root (nobody)\n"
    "  --modules DIR             the modules (/usr/lib/kova/webapi under $KOVA_ROOT)\n"
    "  --static DIR              the static files (/usr/share/kova/www under $KOVA_ROOT)\n"
    "  --idle-timeout SECONDS    a session ends after SECONDS without a call (900)\n"
    "  --call-timeout SECONDS    a call that runs longer is abandoned (120)\n"
    "  --max-waiting CALLS       calls that may wait for one module (4096, and 64 MiB\n"
    "                            of them); more are refused with 503 until some ran\n"
    "  --max-connections N       open connections in all (10000)\n"
    "  --max-per-address N       open connections from one client address (256)\n"
    "  --header-timeout SECONDS  to send a request's line and header (10)\n"
    "  --body-timeout SECONDS    to send a request's body (30)\n"
    "  --keepalive-timeout SECONDS\n"
    "                            a connection idle between requests is closed (60)\n"
    "  --send-timeout SECONDS    to take an answer, or each 256 KiB of a download (60)\n";

namespace {

using Setter = void (*)(Options& options, const std::string& text, long number);

// One option: its name, and for a number its range; the setter takes the value.
struct OptionRow {
  const char* name;
  bool number;
  long low, high;
  Setter set;
};

constexpr long kDay = 24 * 3600;

const OptionRow kOptions[] = {
    {"--bind", false, 0, 0, [](Options& o, const std::string& t, long) { o.bind = t; }},
    {"--port", true, 0, 65535, [](Options& o, const std::string&, long n) { o.port = int(n); }},
    {"--user", false, 0, 0, [](Options& o, const std::string& t, long) { o.user = t; }},
    {"--modules", false, 0, 0, [](Options& o, const std::string& t, long) { o.modules_dir = t; }},
    {"--static", false, 0, 0, [](Options& o, const std::string& t, long) { o.static_dir = t; }},
    {"--idle-timeout", true, 1, 7 * kDay,
     [](Options& o, const std::string&, long n) { o.idle_timeout = std::chrono::seconds(n); }},
    {"--call-timeout", true, 1, kDay,
     [](Options& o, const std::string&, long n) { o.call_timeout = std::chrono::seconds(n); }},
    {"--max-waiting", true, 1, 1 << 20,
     [](Options& o, const std::string&, long n) { o.max_waiting_calls = size_t(n); }},
    {"--max-connections", true, 1, 1 << 20,
     [](Options& o, const std::string&, long n) { o.max_connections = size_t(n); }},
    {"--max-per-address", true, 1, 1 << 20,
     [](Options& o, const std::string&, long n) { o.max_per_address = size_t(n); }},
    {"--header-timeout", true, 1, 3600,
     [](Options& o, const std::string&, long n) { o.header_timeout = std::chrono::seconds(n); }},
    {"--body-timeout", true, 1, 3600,
     [](Options& o, const std::string&, long n) { o.body_timeout = std::chrono::seconds(n); }},
    {"--keepalive-timeout", true, 1, 3600,
     [](Options& o, const std::string&, long n) { o.keepalive_timeout = std::chrono::seconds(n); }},
    {"--send-timeout", true, 1, 3600,
     [](Options& o, const std::string&, long n) { o.send_timeout = std::chrono::seconds(n); }},
    {nullptr, false, 0, 0, nullptr},
};

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
    const OptionRow* row = kOptions;
    while (row->name != nullptr && name != row->name) ++row;
    if (row->name == nullptr) {
      fprintf(stderr, "kova-webapid: unknown option %s\n%s", name.c_str(), kUsage);
      return 2;
    }
    if (i + 1 == args.size()) {
      fprintf(stderr, "kova-webapid: %s without a value\n%s", name.c_str(), kUsage);
      return 2;
    }
    const std::string& value = args[++i];
    long number = 0;
    if (value.empty() || (row->number && !ParseNumber(value, row->low, row->high, number))) {
      fprintf(stderr, "kova-webapid: bad value for %s: %s\n", name.c_str(), value.c_str());
      return 2;
    }
    row->set(options, value, number);
  }
  return 0;
}

}  // namespace kova_host
