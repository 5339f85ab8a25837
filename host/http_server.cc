#include "host/http_server.h"

#include <strings.h>
#include <unistd.h>

#include <algorithm>
#include <boost/asio/dispatch.hpp>
#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/ip/tcp.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/steady_timer.hpp>
#include <boost/asio/strand.hpp>
#include <boost/asio/write.hpp>
#include <boost/beast/core/flat_buffer.hpp>
#include <boost/beast/core/string.hpp>
#include <boost/beast/http.hpp>
#include <cerrno>
#include <cstring>
#include <memory>
#include <mutex>
#include <optional>
#include <thread>
#include <unordered_map>
#include <unordered_set>

#include "host/host_log.h"
#include "host/static_files.h"

namespace kova_host {
namespace {

namespace net = boost::asio;
namespace http = boost::beast::http;
using boost::system::error_code;
using tcp = net::ip::tcp;
using Clock = std::chrono::steady_clock;

// How long a connection that is being closed may still send what it had
// started (a refused body), so that it reads the answer instead of a reset.
constexpr auto kLinger = std::chrono::seconds(5);
// How long accepting pauses when the process is out of descriptors.
constexpr auto kAcceptPause = std::chrono::milliseconds(100);
constexpr char kContinue[] = "HTTP/1.1 100 Continue\r\n\r\n";

// Whether a header's name or value can be written as it is: no line breaks.
bool Safe(std::string_view text) {
  return text.find_first_of(std::string_view("\r\n\0", 3)) == text.npos;
}

// "the request body is over 1 MiB"
std::string BodyTooLarge(size_t max_body) {
  const bool mib = max_body % (size_t{1} << 20) == 0;
  return "the request body is over " + std::to_string(mib ? max_body >> 20 : max_body) +
         (mib ? " MiB" : " bytes");
}

bool IsParseError(const error_code& ec) {
  return ec.category() == make_error_code(http::error::end_of_stream).category() &&
         ec != http::error::end_of_stream && ec != http::error::partial_message;
}

class Connection;

}  // namespace

std::string HttpRequest::Header(std::string_view name) const {
  for (const auto& [field, value] : headers) {
    if (field.size() == name.size() && strncasecmp(field.data(), name.data(), name.size()) == 0) {
      return value;
    }
  }
  return "";
}

struct HttpServer::Impl {
  explicit Impl(const HttpLimits& limits)
      : limits(limits), body_too_large(BodyTooLarge(limits.max_body)) {}

  void Accept();
  void OnAccepted(tcp::socket socket);
  void Release(const std::string& address);

  const HttpLimits limits;
  const std::string body_too_large;
  HttpSite site;
  StaticFiles files;
  bool serve_files = false;

  // Declared before the I/O context: connections that its end destroys
  // still give their places back here.
  std::mutex mutex;
  size_t total = 0;
  std::unordered_map<std::string, size_t> per_address;
  std::unordered_set<Connection*> live;

  net::io_context io;
  tcp::acceptor acceptor{io};
  net::steady_timer accept_pause{io};
  bool pausing = false;  // accepting waits for descriptors to be freed
};

namespace {

// One client's connection, its handlers run one at a time on its strand.
class Connection : public std::enable_shared_from_this<Connection> {
 public:
  Connection(HttpServer::Impl& server, tcp::socket socket, std::string remote, bool counted)
      : server_(server),
        executor_(socket.get_executor()),
        socket_(std::move(socket)),
        timer_(executor_),
        remote_(std::move(remote)),
        counted_(counted) {}
  ~Connection() {
    std::lock_guard<std::mutex> lock(server_.mutex);
    server_.live.erase(this);
    if (counted_) server_.Release(remote_);
  }

  // Serves the connection, or answers `refusal` with 503 and closes it.
  void Start(const char* refusal) {
    {
      std::lock_guard<std::mutex> lock(server_.mutex);
      server_.live.insert(this);
    }
    if (refusal != nullptr) {
      started_ = Clock::now();
      AnswerError(503, refusal, false);
      return;
    }
    Deadline(server_.limits.header_timeout);
    ReadHeader();
  }

  // Closes the socket; only while no thread runs the server.
  void CloseNow() { Close(); }

 private:
  // Arms the one timer: when it runs out, the connection is closed.
  void Deadline(Clock::duration after) {
    timer_.expires_after(after);
    timer_.async_wait([self = shared_from_this()](const error_code& ec) {
      // A wait that was re-armed after it ran out may still arrive without error.
      if (!ec && self->timer_.expiry() <= Clock::now()) self->Close();
    });
  }

  void Close() {
    timer_.cancel();
    error_code ignored;
    socket_.shutdown(tcp::socket::shutdown_both, ignored);
    socket_.close(ignored);
  }

  // Between requests: the next one's header time starts with its first byte.
  void AwaitRequest() {
    if (buffer_.size() > 0) {
      Deadline(server_.limits.header_timeout);
      ReadHeader();
      return;
    }
    buffer_.shrink_to_fit();
    Deadline(server_.limits.keepalive_timeout);
    socket_.async_wait(tcp::socket::wait_read, [self = shared_from_this()](const error_code& ec) {
      if (ec) return;
      self->Deadline(self->server_.limits.header_timeout);
      self->ReadHeader();
    });
  }

  void ReadHeader() {
    parser_.emplace();
    parser_->header_limit(static_cast<uint32_t>(server_.limits.max_header));
    parser_->body_limit(server_.limits.max_body);
    http::async_read_header(
        socket_, buffer_, *parser_,
        [self = shared_from_this()](const error_code& ec, size_t) { self->OnHeader(ec); });
  }

  void OnHeader(const error_code& ec) {
    started_ = Clock::now();
    to_handler_ = false;
    if (ec == http::error::header_limit) {
      // The request line is taken as soon as it is whole: without it, the
      // line alone was over the limit, which only a long URI makes.
      const size_t target = parser_->get().target().size();
      const bool long_target = target == 0 || target > server_.limits.max_target;
      AnswerError(
          long_target ? 414 : 431,
          long_target ? "the request's URI is too long" : "the request's header is too large",
          false);
      return;
    }
    if (ec == http::error::body_limit) {  // by its Content-Length
      AnswerError(413, server_.body_too_large, false);
      return;
    }
    if (IsParseError(ec)) {
      AnswerError(400, "the request is malformed", false);
      return;
    }
    if (ec) {
      Close();  // gone, or out of time
      return;
    }
    const http::request<http::string_body>& request = parser_->get();
    version_ = request.version();
    keep_alive_ = request.keep_alive();
    method_ = std::string(request.method_string());
    const std::string_view target = request.target();
    path_ = std::string(target.substr(0, target.find('?')));
    query_ = path_.size() < target.size() ? std::string(target.substr(path_.size() + 1)) : "";
    to_handler_ = path_ == server_.site.handler_path;
    const bool get = method_ == "GET" || method_ == "HEAD";
    if (target.size() > server_.limits.max_target) {
      AnswerError(414, "the request's URI is too long", false);
    } else if (!get && !(to_handler_ && method_ == "POST")) {
      AnswerError(405, "the method is not allowed here", parser_->is_done());
    } else if (parser_->is_done()) {
      Dispatch();
    } else if (parser_->content_length() && *parser_->content_length() > server_.limits.max_body) {
      AnswerError(413, server_.body_too_large, false);
    } else {
      Deadline(server_.limits.body_timeout);
      if (version_ >= 11 && boost::beast::iequals(request[http::field::expect], "100-continue")) {
        net::async_write(socket_, net::buffer(kContinue, sizeof(kContinue) - 1),
                         [self = shared_from_this()](const error_code& ec, size_t) {
                           if (ec) return self->Close();
                           self->ReadBody();
                         });
      } else {
        ReadBody();
      }
    }
  }

  void ReadBody() {
    http::async_read(socket_, buffer_, *parser_,
                     [self = shared_from_this()](const error_code& ec, size_t) {
                       if (ec == http::error::body_limit) {
                         self->AnswerError(413, self->server_.body_too_large, false);
                       } else if (IsParseError(ec)) {
                         self->AnswerError(400, "the request is malformed", false);
                       } else if (ec) {
                         self->Close();
                       } else {
                         self->Dispatch();
                       }
                     });
  }

  void Dispatch() {
    // No deadline while the handler works; a run-out wait already queued sees
    // the new expiry and leaves the connection alone.
    timer_.expires_at(Clock::time_point::max());
    if (to_handler_) {
      HttpRequest request;
      request.method = method_ == "HEAD" ? "GET" : method_;
      request.path = path_;
      request.query = query_;
      request.body = std::move(parser_->get().body());
      request.remote = remote_;
      for (const auto& field : parser_->get()) {
        request.headers.emplace_back(field.name_string(), field.value());
      }
      parser_.reset();
      HttpDone done = [self = shared_from_this()](HttpReply reply) {
        net::post(self->executor_, [self, reply = std::move(reply)]() mutable {
          self->Answer(std::move(reply), self->keep_alive_);
        });
      };
      try {
        server_.site.handler(std::move(request), std::move(done));
      } catch (const std::exception& e) {
        HostLog("http: %s", e.what());
        Answer(server_.site.error_reply(500, "the host failed"), false);
      }
      return;
    }
    parser_.reset();
    StaticFile file;
    if (server_.serve_files && server_.files.Find(path_, file)) {
      HttpReply reply;
      reply.content_type = std::move(file.content_type);
      reply.body = std::move(file.content);
      Answer(std::move(reply), keep_alive_);
    } else {
      Answer(server_.site.error_reply(404, "no such path"), keep_alive_);
    }
  }

  // An error the server answers itself; `keep` when the request was read whole.
  void AnswerError(int status, const std::string& reason, bool keep) {
    HttpReply reply = server_.site.error_reply(status, reason);
    if (status == 503) reply.headers.emplace_back("Retry-After", "1");
    if (status == 405) {
      reply.headers.emplace_back("Allow", to_handler_ ? "GET, HEAD, POST" : "GET, HEAD");
    }
    Answer(std::move(reply), keep && keep_alive_);
  }

  void Answer(HttpReply reply, bool keep) {
    response_ = {};
    response_.version(version_);
    // Only a final status ends the answer.
    if (reply.status < 200 || reply.status > 599) reply.status = 500;
    response_.result(static_cast<unsigned>(reply.status));
    for (const auto& [name, value] : server_.site.default_headers) response_.insert(name, value);
    if (!reply.content_type.empty() && Safe(reply.content_type)) {
      response_.set(http::field::content_type, reply.content_type);
    }
    for (const auto& [name, value] : reply.headers) {
      if (Safe(name) && Safe(value)) response_.insert(name, value);
    }
    response_.keep_alive(keep);
    status_ = reply.status;
    access_ = std::move(reply.access);
    Deadline(server_.limits.send_timeout);
    if (reply.file.fd.valid()) {
      file_ = std::move(reply.file);
      response_.content_length(file_.length);
      if (method_ == "HEAD") file_.length = 0;  // Content-Length stays the GET's
      head_writer_.emplace(response_);
      http::async_write_header(socket_, *head_writer_,
                               [self = shared_from_this(), keep](const error_code& ec, size_t) {
                                 if (ec) return self->OnWritten(ec, keep);
                                 self->SendFilePart(keep);
                               });
      return;
    }
    response_.body() = std::move(reply.body);
    response_.prepare_payload();
    if (method_ == "HEAD") response_.body().clear();  // Content-Length stays the GET's
    http::async_write(socket_, response_,
                      [self = shared_from_this(), keep](const error_code& ec, size_t) {
                        self->OnWritten(ec, keep);
                      });
  }

  // Reads the next part of the file's body and sends it, the next once it is
  // sent; ends the answer after the last. A file that ends early cuts the
  // connection, since its length was promised.
  void SendFilePart(bool keep) {
    if (file_.length == 0) return OnWritten({}, keep);
    if (!part_) part_ = std::make_unique<char[]>(kFilePart);
    const size_t want = static_cast<size_t>(std::min<uint64_t>(file_.length, kFilePart));
    ssize_t got;
    do {
      got = pread(file_.fd.get(), part_.get(), want, static_cast<off_t>(file_.offset));
    } while (got < 0 && errno == EINTR);
    if (got <= 0) {
      const int fault = got == 0 ? EIO : errno;
      HostLog("http: cannot read an answer's body from its file: %s", strerror(fault));
      return OnWritten(error_code(fault, boost::system::system_category()), keep);
    }
    file_.offset += static_cast<uint64_t>(got);
    file_.length -= static_cast<uint64_t>(got);
    Deadline(server_.limits.send_timeout);
    net::async_write(socket_, net::buffer(part_.get(), static_cast<size_t>(got)),
                     [self = shared_from_this(), keep](const error_code& ec, size_t) {
                       if (ec) return self->OnWritten(ec, keep);
                       self->SendFilePart(keep);
                     });
  }

  void OnWritten(const error_code& ec, bool keep) {
    LogAccess(remote_, method_, path_, status_, access_, Clock::now() - started_);
    head_writer_.reset();
    file_ = FileBody();
    part_.reset();
    response_ = {};
    method_.clear();
    path_.clear();
    if (ec) {
      Close();
    } else if (keep) {
      AwaitRequest();
    } else {
      Linger();
    }
  }

  // Says it is done and reads what the client still sends, until it closes too.
  void Linger() {
    parser_.reset();
    buffer_.clear();
    error_code ignored;
    socket_.shutdown(tcp::socket::shutdown_send, ignored);
    Deadline(kLinger);
    Drain();
  }

  void Drain() {
    socket_.async_read_some(buffer_.prepare(4096),
                            [self = shared_from_this()](const error_code& ec, size_t) {
                              if (ec) return self->Close();
                              self->Drain();
                            });
  }

  HttpServer::Impl& server_;
  const net::any_io_executor executor_;
  tcp::socket socket_;
  net::steady_timer timer_;
  const std::string remote_;
  const bool counted_;

  boost::beast::flat_buffer buffer_;
  std::optional<http::request_parser<http::string_body>> parser_;
  http::response<http::string_body> response_;
  // An answer whose body comes from a file: its header's writer, the file, and
  // the part being sent.
  std::optional<http::response_serializer<http::string_body>> head_writer_;
  FileBody file_;
  std::unique_ptr<char[]> part_;

  // The request being served.
  unsigned version_ = 11;
  bool keep_alive_ = false;
  bool to_handler_ = false;
  std::string method_, path_, query_;
  Clock::time_point started_;
  int status_ = 0;
  AccessRecord access_;
};

}  // namespace

void HttpServer::Impl::Accept() {
  acceptor.async_accept(net::make_strand(io), [this](const error_code& ec, tcp::socket socket) {
    if (!acceptor.is_open()) return;
    if (ec == net::error::no_descriptors || ec == net::error::no_buffer_space ||
        ec == net::error::no_memory || ec.value() == ENFILE) {
      if (!pausing) HostLog("http: cannot accept connections: %s", ec.message().c_str());
      pausing = true;
      accept_pause.expires_after(kAcceptPause);
      accept_pause.async_wait([this](const error_code& wait) {
        if (!wait) Accept();
      });
      return;
    }
    if (!ec) {
      pausing = false;
      OnAccepted(std::move(socket));
    }
    Accept();
  });
}

void HttpServer::Impl::OnAccepted(tcp::socket socket) {
  error_code ec;
  const tcp::endpoint peer = socket.remote_endpoint(ec);
  if (ec) return;
  socket.set_option(tcp::no_delay(true), ec);  // answers go out as written
  std::string address = peer.address().to_string();
  const char* refusal = nullptr;
  {
    std::lock_guard<std::mutex> lock(mutex);
    size_t& from_address = per_address[address];
    if (total >= limits.max_connections) {
      refusal = "the host has too many connections";
    } else if (from_address >= limits.max_per_address) {
      refusal = "too many connections from your address";
    } else {
      ++total;
      ++from_address;
    }
    if (from_address == 0) per_address.erase(address);
  }
  const net::any_io_executor strand = socket.get_executor();
  auto connection = std::make_shared<Connection>(*this, std::move(socket), std::move(address),
                                                 refusal == nullptr);
  net::dispatch(strand, [connection, refusal] { connection->Start(refusal); });
}

void HttpServer::Impl::Release(const std::string& address) {
  --total;
  auto it = per_address.find(address);
  if (it != per_address.end() && --it->second == 0) per_address.erase(it);
}

HttpServer::HttpServer(const HttpLimits& limits) : impl_(std::make_unique<Impl>(limits)) {}

HttpServer::~HttpServer() = default;

int HttpServer::Listen(const std::string& address, int port, std::string& error) {
  error_code ec;
  tcp::resolver resolver(impl_->io);
  const auto endpoints = resolver.resolve(
      address, std::to_string(port), tcp::resolver::passive | tcp::resolver::numeric_service, ec);
  for (const auto& entry : endpoints) {
    tcp::acceptor& acceptor = impl_->acceptor;
    acceptor.open(entry.endpoint().protocol(), ec);
    if (!ec) acceptor.set_option(tcp::acceptor::reuse_address(true), ec);
    if (!ec) acceptor.bind(entry.endpoint(), ec);
    if (!ec) acceptor.listen(net::socket_base::max_listen_connections, ec);
    if (!ec) return acceptor.local_endpoint().port();
    error_code ignored;
    acceptor.close(ignored);
  }
  error = ec ? ec.message() : "no such address";
  return -1;
}

void HttpServer::Run(HttpSite site, int threads) {
  Impl& impl = *impl_;
  impl.site = std::move(site);
  impl.serve_files = !impl.site.static_dir.empty() && impl.files.Open(impl.site.static_dir);
  auto work = net::make_work_guard(impl.io);
  impl.Accept();
  std::vector<std::thread> others;
  for (int i = 1; i < threads; ++i) others.emplace_back([&impl] { impl.io.run(); });
  impl.io.run();
  for (std::thread& thread : others) thread.join();

  // No thread runs the server any more: close everything from here.
  error_code ignored;
  impl.acceptor.close(ignored);
  std::lock_guard<std::mutex> lock(impl.mutex);
  for (Connection* connection : impl.live) connection->CloseNow();
}

void HttpServer::Stop() { impl_->io.stop(); }

}  // namespace kova_host
