#include "host/front_end.h"

#include <httplib.h>
#include <signal.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <future>
#include <thread>

#include "host/access_log.h"
#include "host/host_log.h"
#include "host/json_text.h"
#include "host/monitor.h"
#include "host/runner_pool.h"
#include "host/web_entry.h"
#include "kova/webapi.h"

namespace kova_host {
namespace {

constexpr char kEntryPath[] = "/webapi/entry.cgi";

// Media types of the static folder's files, with the charset where it is text.
struct StaticType {
  const char* extension;
  const char* mime;
};
constexpr StaticType kStaticTypes[] = {
    {"html", "text/html; charset=utf-8"},
    {"js", "text/javascript; charset=utf-8"},
    {"css", "text/css; charset=utf-8"},
    {"json", "application/json; charset=utf-8"},
    {"svg", "image/svg+xml"},
    {nullptr, nullptr},
};

EntryRequest ToEntry(const httplib::Request& request) {
  const size_t query = request.target.find('?');
  EntryRequest entry;
  entry.http_method = request.method;
  entry.query = query == std::string::npos ? "" : request.target.substr(query + 1);
  entry.body = request.body;
  entry.content_type = request.get_header_value("Content-Type");
  entry.cookie = request.get_header_value("Cookie");
  entry.token_header = request.get_header_value("X-KOVA-Token");
  entry.accept_language = request.get_header_value("Accept-Language");
  entry.remote_addr = request.remote_addr;
  return entry;
}

// What the access log tells of the request a thread is serving.
AccessRecord& CurrentAccess() {
  thread_local AccessRecord record;
  return record;
}
thread_local std::chrono::steady_clock::time_point request_start;

// Hands the request to the entry and waits for its reply.
void Serve(WebEntry& entry, EntryRequest request, httplib::Response& response) {
  std::promise<EntryReply> promise;
  std::future<EntryReply> future = promise.get_future();
  entry.Handle(std::move(request),
               [&promise](EntryReply reply) { promise.set_value(std::move(reply)); });
  const EntryReply reply = future.get();
  response.status = reply.status;
  for (const auto& [name, value] : reply.headers) response.set_header(name, value);
  response.set_content(reply.body, reply.content_type);
  CurrentAccess() = reply.access;
}

// Errors that no handler answered (an unknown path, a body over the limit)
// get an envelope too.
httplib::Server::HandlerResponse OnError(const httplib::Request&, httplib::Response& response) {
  if (!response.body.empty()) return httplib::Server::HandlerResponse::Unhandled;
  const char* reason = response.status == 413   ? "the request body is over 1 MiB"
                       : response.status == 404 ? "no such path"
                       : response.status == 414 ? "the request's URI is too long"
                                                : "the request is malformed";
  const int code = response.status == 404 ? KOVA::kAPIErrorNoSuchAPI : KOVA::kAPIErrorBadParameter;
  response.set_content(ToJson(ErrorReason(code, reason)), "application/json; charset=utf-8");
  CurrentAccess().code = code;
  return httplib::Server::HandlerResponse::Handled;
}

}  // namespace

int RunFrontEnd(int control, const Options& options, const Identity* account) {
  // SIGTERM and SIGINT are taken by one thread, which stops the server.
  sigset_t stop_signals;
  sigemptyset(&stop_signals);
  sigaddset(&stop_signals, SIGTERM);
  sigaddset(&stop_signals, SIGINT);
  pthread_sigmask(SIG_BLOCK, &stop_signals, nullptr);

  httplib::Server server;
  // Set before binding: accepted sockets inherit it from the listening one.
  server.set_tcp_nodelay(true);  // headers and body go out as written, not 40 ms later
  const int port = options.port == 0
                       ? server.bind_to_any_port(options.bind)
                       : (server.bind_to_port(options.bind, options.port) ? options.port : -1);
  if (port < 0) {
    HostLog("cannot listen on %s port %d", options.bind.c_str(), options.port);
    return 1;
  }
  std::string error;
  if (account != nullptr && !DropForGood(*account, error)) {
    HostLog("cannot give root up for %s: %s", account->name.c_str(), error.c_str());
    return 1;
  }
  if (prctl(PR_SET_PDEATHSIG, SIGTERM) != 0) return 1;
  if (chdir("/") != 0) return 1;

  MonitorClient monitor(control);
  RunnerPool runners(monitor, options.call_timeout, options.max_waiting_calls);
  if (!runners.Start(options.modules_dir, error)) {
    HostLog("%s", error.c_str());
    return 1;
  }
  SessionStore sessions(options.idle_timeout, 10000);
  LoginThrottle throttle;
  WebEntry entry(
      runners,
      [&monitor](const std::string& name, const std::string& password, bool& admin) {
        return monitor.CheckPassword(name, password, admin);
      },
      sessions, throttle, [](std::function<void()> work) { work(); });

  const auto handle = [&entry](const httplib::Request& request, httplib::Response& response) {
    Serve(entry, ToEntry(request), response);
  };
  server.Get(kEntryPath, handle);
  // The body is read here: the library itself would cap form bodies at 8 KiB.
  server.Post(kEntryPath, [&entry](const httplib::Request& request, httplib::Response& response,
                                   const httplib::ContentReader& content) {
    std::string body;
    const bool whole = content([&body](const char* data, size_t length) {
      body.append(data, length);
      return body.size() <= kMaxBody;
    });
    if (!whole) {
      response.status = body.size() > kMaxBody || response.status == 413 ? 413 : 400;
      return;
    }
    EntryRequest entry_request = ToEntry(request);
    entry_request.body = std::move(body);
    Serve(entry, std::move(entry_request), response);
  });
  server.set_payload_max_length(kMaxBody);
  server.set_keep_alive_max_count(1000);
  server.new_task_queue = [] { return new httplib::ThreadPool(16); };
  server.set_pre_routing_handler([](const httplib::Request&, httplib::Response&) {
    request_start = std::chrono::steady_clock::now();
    return httplib::Server::HandlerResponse::Unhandled;
  });
  server.set_error_handler(httplib::Server::HandlerWithResponse(OnError));
  server.set_exception_handler(
      [](const httplib::Request&, httplib::Response& response, std::exception_ptr) {
        response.status = 500;
        response.set_content(ToJson(ErrorReason(KOVA::kAPIErrorUnknown, "the host failed")),
                             "application/json; charset=utf-8");
      });
  server.set_logger([](const httplib::Request& request, const httplib::Response& response) {
    LogAccess(request.remote_addr, request.method, request.path, response.status, CurrentAccess(),
              std::chrono::steady_clock::now() - request_start);
    CurrentAccess() = AccessRecord();
  });
  // The web app loads nothing from another origin and runs no inline script or
  // style, so its pages can be held to this policy.
  server.set_default_headers({
      {"X-Content-Type-Options", "nosniff"},
      {"Content-Security-Policy",
       "default-src 'none'; script-src 'self'; style-src 'self'; img-src 'self'; "
       "connect-src 'self'; font-src 'self'; manifest-src 'self'; base-uri 'none'; "
       "form-action 'self'; frame-ancestors 'none'"},
      {"Referrer-Policy", "no-referrer"},
  });
  if (!options.static_dir.empty() && access(options.static_dir.c_str(), R_OK | X_OK) == 0) {
    for (const StaticType* type = kStaticTypes; type->extension != nullptr; ++type) {
      server.set_file_extension_and_mimetype_mapping(type->extension, type->mime);
    }
    server.set_mount_point("/", options.static_dir);
  }

  std::thread([&server, stop_signals] {
    int signal = 0;
    sigwait(&stop_signals, &signal);
    server.stop();
  }).detach();
  HostLog("listening on http://%s:%d/", options.bind.c_str(), port);
  const bool served = server.listen_after_bind();
  HostLog("stopped");
  return served ? 0 : 1;
}

}  // namespace kova_host
