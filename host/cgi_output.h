// A handler's raw output read as CGI output: header lines up to an empty line
// become the HTTP headers, the rest is the body. Output held in a file is read
// for its headers only; its body is sent from the file.

#ifndef KOVA_HOST_CGI_OUTPUT_H_
#define KOVA_HOST_CGI_OUTPUT_H_

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace kova_host {

// Headers that don't end within this many bytes make the output malformed.
inline constexpr size_t kMaxCgiHead = 64 * 1024;

struct CgiReply {
  int status = 200;  // from a "Status: 404 Not Found" line
  std::string content_type = "application/octet-stream";
  std::vector<std::pair<std::string, std::string>> headers;  // the others, in order
  std::string body;                                          // not set for output in a file
};

// Lines end in CRLF or LF. Headers that the HTTP server writes itself
// (Content-Length, Transfer-Encoding, Connection) are dropped. False with
// `error` when there is no empty line, a line is no "Name: value" header, or
// the status is not a number from 100 to 599.
bool ParseCgiOutput(std::string_view output, CgiReply& reply, std::string& error);

// Reads the headers from the first bytes of the `size` bytes of output in the
// file `fd`, as ParseCgiOutput does, and sets `body_start` to where the body
// begins. False with `error` as ParseCgiOutput, when the headers run past
// kMaxCgiHead bytes, or when the file can't be read.
bool ReadCgiHead(int fd, uint64_t size, CgiReply& reply, uint64_t& body_start, std::string& error);

}  // namespace kova_host

#endif  // KOVA_HOST_CGI_OUTPUT_H_
