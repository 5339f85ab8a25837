// The access log: one line per HTTP request on standard error, with the web
// API, method, user and answer code of a call and how long it took. Parameters
// are never logged, so no password, session id or token reaches the log.

#ifndef KOVA_HOST_ACCESS_LOG_H_
#define KOVA_HOST_ACCESS_LOG_H_

#include <chrono>
#include <string>

namespace kova_host {

// What the request's handler learnt, for the request's line. One per thread:
// a request is handled on one thread from start to end.
struct AccessRecord {
  std::chrono::steady_clock::time_point start{};
  std::string api, method, user;
  int code = -1;  // the answer's code, 0 for success; -1 when no call was answered
};
AccessRecord& CurrentAccess();

// The line for a request and its record, without the trailing newline. Names
// are cut short and stripped of blanks and control characters.
std::string AccessLine(const std::string& remote, const std::string& http_method,
                       const std::string& path, int status, const AccessRecord& record,
                       std::chrono::steady_clock::time_point end);

// Writes the line of the request that just ended and clears the record.
void LogAccess(const std::string& remote, const std::string& http_method, const std::string& path,
               int status);

}  // namespace kova_host

#endif  // KOVA_HOST_ACCESS_LOG_H_
