// An event-driven HTTP/1.1 server: one path answered by a handler, everything
// else from a static folder. A few threads serve every connection; one that
// waits for its client holds no thread, and deadlines and caps keep slow, idle
// or too many clients from taking the server over.

#ifndef KOVA_HOST_HTTP_SERVER_H_
#define KOVA_HOST_HTTP_SERVER_H_

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "host/access_log.h"
#include "host/unique_fd.h"

namespace kova_host {

using HttpHeaders = std::vector<std::pair<std::string, std::string>>;

struct HttpRequest {
  std::string method;  // "GET" (for HEAD too) or "POST"
  std::string path;    // the target up to "?", as sent
  std::string query;   // after "?", still encoded
  std::string body;
  std::string remote;   // the client's address
  HttpHeaders headers;  // names and values as sent

  // The first header named `name` (in any case), "" when there is none.
  std::string Header(std::string_view name) const;
};

// A body sent from a file part by part as it is read: `length` bytes from
// `offset`. The server closes the file once the answer is sent or given up.
struct FileBody {
  UniqueFd fd;
  uint64_t offset = 0;
  uint64_t length = 0;
};

struct HttpReply {
  int status = 200;
  std::string content_type;
  std::string body;
  HttpHeaders headers;
  AccessRecord access;  // what the access log tells of the request
  FileBody file{};      // when it holds a file: the body instead of `body`
};

// Receives the reply to a request, once, on any thread.
using HttpDone = std::function<void(HttpReply reply)>;
using HttpHandler = std::function<void(HttpRequest request, HttpDone done)>;
// The reply for an error the server answers itself: a status and its reason.
using HttpErrorReply = std::function<HttpReply(int status, const std::string& reason)>;

// A body sent from a file goes out in parts of this size, each read when the
// one before was sent: a download holds no more than this in memory.
inline constexpr size_t kFilePart = 256 * 1024;

struct HttpLimits {
  size_t max_connections = 10000;
  size_t max_per_address = 256;  // connections from one client address
  // From the moment a request's first byte is awaited (on a kept-alive
  // connection: from its first byte) to the end of its header.
  std::chrono::steady_clock::duration header_timeout = std::chrono::seconds(10);
  std::chrono::steady_clock::duration body_timeout = std::chrono::seconds(30);
  // Between requests on a kept-alive connection.
  std::chrono::steady_clock::duration keepalive_timeout = std::chrono::seconds(60);
  // For the client to take an answer: a whole answer held in memory, or each
  // part (kFilePart bytes) of a body sent from a file.
  std::chrono::steady_clock::duration send_timeout = std::chrono::seconds(60);
  size_t max_body = size_t{1} << 20;
  size_t max_target = 8192;   // longer: 414
  size_t max_header = 16384;  // request line and header fields; longer: 431
};

struct HttpSite {
  std::string handler_path;  // GET, HEAD (as GET, without the body) and POST
  HttpHandler handler;
  std::string static_dir;       // the rest: GET and HEAD; none when empty or unreadable
  HttpHeaders default_headers;  // on every answer
  HttpErrorReply error_reply;
};

class HttpServer {
 public:
  explicit HttpServer(const HttpLimits& limits);
  ~HttpServer();
  HttpServer(const HttpServer&) = delete;
  HttpServer& operator=(const HttpServer&) = delete;

  // Listens on `address` (a name or a number) and `port`, 0 for any free one.
  // The port, or -1 with `error`.
  int Listen(const std::string& address, int port, std::string& error);

  // Serves `site` on `threads` threads until Stop(); then closes every
  // connection and returns.
  void Run(HttpSite site, int threads);

  // Makes Run return; safe from any thread.
  void Stop();

  struct Impl;  // the server's state, shared with its connections

 private:
  std::unique_ptr<Impl> impl_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_HTTP_SERVER_H_
