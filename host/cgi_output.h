// A handler's raw output read as CGI output: header lines up to an empty line
// become the HTTP headers, the rest is the body.

#ifndef KOVA_HOST_CGI_OUTPUT_H_
#define KOVA_HOST_CGI_OUTPUT_H_

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace kova_host {

struct CgiReply {
  int status = 200;  // from a "Status: 404 Not Found" line
  std::string content_type = "application/octet-stream";
  std::vector<std::pair<std::string, std::string>> headers;  // the others, in order
  std::string body;
};

// Lines end in CRLF or LF. Headers that the HTTP server writes itself
// (Content-Length, Transfer-Encoding, Connection) are dropped. False with
// `error` when there is no empty line, a line is no "Name: value" header, or
// the status is not a number from 100 to 599.
bool ParseCgiOutput(std::string_view output, CgiReply& reply, std::string& error);

}  // namespace kova_host

#endif  // KOVA_HOST_CGI_OUTPUT_H_
