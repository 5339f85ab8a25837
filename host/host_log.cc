#include "host/host_log.h"

#include <unistd.h>

#include <algorithm>
#include <cstdarg>
#include <cstdio>

namespace kova_host {

void HostLog(const char* format, ...) {
  char line[2048];
  int used = snprintf(line, sizeof(line), "kova-webapid: ");
  va_list args;
  va_start(args, format);
  const int text = vsnprintf(line + used, sizeof(line) - used - 1, format, args);
  va_end(args);
  used = text < 0 ? used : std::min<int>(used + text, sizeof(line) - 2);
  line[used++] = '\n';
  [[maybe_unused]] const ssize_t ignored = write(STDERR_FILENO, line, used);
}

}  // namespace kova_host
