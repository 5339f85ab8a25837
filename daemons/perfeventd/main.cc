// kovaperfeventd: the performance-event daemon.

#include <cstdio>
#include <string>

#include "perfeventd/daemon.h"
#include "perfeventd/options.h"

int main(int argc, char** argv) {
  // The reload and stop signals wait for the main loop from the start: a
  // reload asked for while the program starts must not end it.
  perfeventd::BlockSignals();
  perfeventd::Options options;
  std::string error;
  if (!perfeventd::ParseOptions(argc, argv, options, error)) {
    fprintf(stderr, "kovaperfeventd: %s\n%s", error.c_str(), perfeventd::kUsage);
    return 2;
  }
  if (options.help) {
    fputs(perfeventd::kUsage, stdout);
    return 0;
  }
  return perfeventd::RunDaemon(options);
}
