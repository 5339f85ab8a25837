// The access log: one line per HTTP request on standard error, with the web
// API, method, user and answer code of a call and how long it took. Parameters
// are never logged, so no password, session id or token reaches the log.

#ifndef KOVA_HOST_ACCESS_LOG_H_
#define KOVA_HOST_ACCESS_LOG_H_

#include <chrono>
#include <string>

namespace kova_host {

// What the request's handler learnt, for the request's line.
struct AccessRecord {
  std::string api, method, user;
  int code = -1;  // the answer's code, 0 for success; -1 when no call was answered
};

// The line for a request that took `took` and its record, without the trailing
// newline. Names are cut short; blanks, quotes, backslashes, control bytes and
// bytes from 0x80 are written as \xNN, so every line is printable ASCII.
std::string AccessLine(const std::string& remote, const std::string& http_method,
                       const std::string& path, int status, const AccessRecord& record,
                       std::chrono::steady_clock::duration took);

// Writes the line of a request that just ended.
void LogAccess(const std::string& remote, const std::string& http_method, const std::string& path,
               int status, const AccessRecord& record, std::chrono::steady_clock::duration took);

}  // namespace kova_host

#endif  // KOVA_HOST_ACCESS_LOG_H_
