// The host's messages on standard error, one whole line per write so that the
// lines of its processes don't mix.

#ifndef KOVA_HOST_HOST_LOG_H_
#define KOVA_HOST_HOST_LOG_H_

namespace kova_host {

// Writes "kova-webapid: " and the formatted text as one line.
void HostLog(const char* format, ...) __attribute__((format(printf, 1, 2)));

}  // namespace kova_host

#endif  // KOVA_HOST_HOST_LOG_H_
