// kovastatd: the statistics-collection service.

#include <cstdio>
#include <string>

#include "statd/daemon.h"
#include "statd/options.h"

int main(int argc, char** argv) {
  // A reload asked for while the program starts must not end it.
  statd::BlockSignals();
  statd::Options options;
  std::string error;
  if (!statd::ParseOptions(argc, argv, options, error)) {
    fprintf(stderr, "kovastatd: %s\n%s", error.c_str(), statd::kUsage);
    return 2;
  }
  if (options.help) {
    fputs(statd::kUsage, stdout);
    return 0;
  }
  return statd::RunDaemon(options);
}
