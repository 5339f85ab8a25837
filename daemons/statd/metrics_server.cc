#include "statd/metrics_server.h"

#include <strings.h>

#include <boost/asio/ip/tcp.hpp>
#include <boost/beast/core.hpp>
#include <boost/beast/http.hpp>
#include <optional>
#include <thread>
#include <utility>

#include "statd/metrics_text.h"

namespace statd {

namespace asio = boost::asio;
namespace beast = boost::beast;
namespace http = beast::http;
using tcp = asio::ip::tcp;

// What the sampling loop hands over and every connection reads.
struct MetricsServer::Shared {
  std::mutex mutex;
  std::shared_ptr<const std::string> texts[2];  // per MetricsFormat
  std::string token;
};

// One listener with its thread; sessions live on its io_context.
struct MetricsServer::Runner {
  size_t connections = 0;  // touched on the thread only
  asio::io_context context{1};
  tcp::acceptor acceptor{context};
  std::thread thread;
};

namespace {

using Request = http::request<http::empty_body>;
using Response = http::response<http::string_body>;

Response Plain(const Request& request, http::status status, std::string body) {
  Response response(status, request.version());
  response.set(http::field::content_type, "text/plain; charset=utf-8");
  response.body() = std::move(body);
  return response;
}

// The answer to `request`: guards first, then the text.
std::string_view View(beast::string_view text) { return {text.data(), text.size()}; }

Response Answer(const Request& request, MetricsServer::Shared& shared) {
  const std::string_view target(request.target().data(), request.target().size());
  if (target.substr(0, target.find('?')) != "/metrics") {
    return Plain(request, http::status::not_found, "Only /metrics is served here.\n");
  }
  if (request.method() != http::verb::get && request.method() != http::verb::head) {
    Response response = Plain(request, http::status::method_not_allowed, "GET or HEAD only.\n");
    response.set(http::field::allow, "GET, HEAD");
    return response;
  }
  const MetricsFormat format = FormatFor(View(request[http::field::accept]));
  std::shared_ptr<const std::string> text;
  std::string token;
  {
    std::lock_guard lock(shared.mutex);
    text = shared.texts[static_cast<int>(format)];
    token = shared.token;
  }
  if (!token.empty()) {
    const std::string_view given = View(request[http::field::authorization]);
    constexpr std::string_view kBearer = "Bearer ";
    const bool bearer = given.size() >= kBearer.size() &&
                        strncasecmp(given.data(), kBearer.data(), kBearer.size()) == 0;
    const std::string_view sent = bearer ? given.substr(kBearer.size()) : std::string_view();
    if (!bearer || !SameSecret(sent, token)) {
      Response response = Plain(request, http::status::unauthorized, "A bearer token is needed.\n");
      response.set(http::field::www_authenticate, "Bearer");
      return response;
    }
  }
  if (text == nullptr) {
    return Plain(request, http::status::service_unavailable, "No sample yet.\n");
  }
  Response response(http::status::ok, request.version());
  response.set(http::field::content_type, format == MetricsFormat::kOpenMetrics
                                              ? kOpenMetricsContentType
                                              : kPrometheusContentType);
  response.body() = *text;
  return response;
}

class Session : public std::enable_shared_from_this<Session> {
 public:
  Session(tcp::socket socket, MetricsServer::Runner& runner,
          std::shared_ptr<MetricsServer::Shared> shared, const MetricsLimits& limits)
      : stream_(std::move(socket)), runner_(runner), shared_(std::move(shared)), limits_(limits) {
    ++runner_.connections;
  }
  ~Session() { --runner_.connections; }

  void Read() {
    parser_.emplace();
    parser_->header_limit(static_cast<uint32_t>(limits_.max_header));
    stream_.expires_after(limits_.timeout);
    http::async_read(stream_, buffer_, *parser_,
                     [self = shared_from_this()](beast::error_code error, size_t) {
                       if (!error) self->Write();
                     });
  }

 private:
  void Write() {
    const Request& request = parser_->get();
    response_ = Answer(request, *shared_);
    response_.keep_alive(request.keep_alive());
    response_.prepare_payload();
    if (request.method() == http::verb::head) {
      // The length of the body GET would get, without the body.
      const size_t length = response_.body().size();
      response_.body().clear();
      response_.content_length(length);
    }
    stream_.expires_after(limits_.timeout);
    http::async_write(stream_, response_,
                      [self = shared_from_this()](beast::error_code error, size_t) {
                        if (error || !self->response_.keep_alive()) {
                          beast::error_code ignored;
                          self->stream_.socket().shutdown(tcp::socket::shutdown_send, ignored);
                          return;
                        }
                        self->Read();
                      });
  }

  beast::tcp_stream stream_;
  MetricsServer::Runner& runner_;
  std::shared_ptr<MetricsServer::Shared> shared_;
  const MetricsLimits& limits_;
  beast::flat_buffer buffer_;
  std::optional<http::request_parser<http::empty_body>> parser_;
  Response response_;
};

void Accept(MetricsServer::Runner& runner, std::shared_ptr<MetricsServer::Shared> shared,
            const MetricsLimits& limits) {
  runner.acceptor.async_accept(
      [&runner, shared, &limits](beast::error_code error, tcp::socket socket) {
        if (error == asio::error::operation_aborted) return;
        if (!error && runner.connections < limits.max_connections) {
          std::make_shared<Session>(std::move(socket), runner, shared, limits)->Read();
        }
        // Over the cap, the socket closes here.
        Accept(runner, shared, limits);
      });
}

}  // namespace

bool ParseListenAddress(const std::string& text, std::string& address, uint16_t& port,
                        std::string& error) {
  const size_t colon = text.rfind(':');
  const std::string digits = colon == std::string::npos ? "" : text.substr(colon + 1);
  address = colon == std::string::npos ? "" : text.substr(0, colon);
  if (address.size() >= 2 && address.front() == '[' && address.back() == ']') {
    address = address.substr(1, address.size() - 2);
  }
  unsigned long number = 0;
  bool digits_ok = !digits.empty() && digits.size() <= 5;
  for (char c : digits) {
    digits_ok = digits_ok && c >= '0' && c <= '9';
    number = number * 10 + static_cast<unsigned long>(c - '0');
  }
  beast::error_code bad;
  asio::ip::make_address(address, bad);
  if (!digits_ok || number > 65535 || bad) {
    error = "\"" + text + "\" is not ADDRESS:PORT (such as 127.0.0.1:9477)";
    return false;
  }
  port = static_cast<uint16_t>(number);
  return true;
}

bool SameSecret(std::string_view a, std::string_view b) {
  // Every byte of the longer one is looked at, whatever differs first.
  const size_t length = std::max(a.size(), b.size());
  unsigned char differ = a.size() == b.size() ? 0 : 1;
  for (size_t i = 0; i < length; ++i) {
    const unsigned char x = i < a.size() ? static_cast<unsigned char>(a[i]) : 0;
    const unsigned char y = i < b.size() ? static_cast<unsigned char>(b[i]) : 0;
    differ |= static_cast<unsigned char>(x ^ y);
  }
  return differ == 0;
}

MetricsServer::MetricsServer(MetricsLimits limits)
    : limits_(limits), shared_(std::make_shared<Shared>()) {}

MetricsServer::~MetricsServer() { Stop(); }

bool MetricsServer::Start(const std::string& listen, std::string& error) {
  Stop();
  std::string address;
  uint16_t port = 0;
  if (!ParseListenAddress(listen, address, port, error)) return false;
  auto runner = std::make_unique<Runner>();
  const tcp::endpoint endpoint(asio::ip::make_address(address), port);
  beast::error_code failed;
  runner->acceptor.open(endpoint.protocol(), failed);
  if (!failed) runner->acceptor.set_option(asio::socket_base::reuse_address(true), failed);
  if (!failed) runner->acceptor.bind(endpoint, failed);
  if (!failed) runner->acceptor.listen(asio::socket_base::max_listen_connections, failed);
  if (failed) {
    error = "can't listen on " + listen + ": " + failed.message();
    return false;
  }
  const tcp::endpoint local = runner->acceptor.local_endpoint(failed);
  const std::string host = local.address().to_string();
  bound_ = (local.address().is_v6() ? "[" + host + "]" : host) + ":" + std::to_string(local.port());
  Accept(*runner, shared_, limits_);
  Runner& running = *runner;
  runner->thread = std::thread([&running] { running.context.run(); });
  runner_ = std::move(runner);
  return true;
}

void MetricsServer::Stop() {
  if (runner_ == nullptr) return;
  runner_->context.stop();
  runner_->thread.join();
  runner_.reset();  // the io_context goes first, and with it every session
  bound_.clear();
}

void MetricsServer::SetToken(std::string token) {
  std::lock_guard lock(shared_->mutex);
  shared_->token = std::move(token);
}

void MetricsServer::Publish(std::string prometheus, std::string openmetrics) {
  auto first = std::make_shared<const std::string>(std::move(prometheus));
  auto second = std::make_shared<const std::string>(std::move(openmetrics));
  std::lock_guard lock(shared_->mutex);
  shared_->texts[static_cast<int>(MetricsFormat::kPrometheus)] = std::move(first);
  shared_->texts[static_cast<int>(MetricsFormat::kOpenMetrics)] = std::move(second);
}

}  // namespace statd
