#include "host/front_end.h"

#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <boost/asio/post.hpp>
#include <boost/asio/thread_pool.hpp>
#include <thread>

#include "host/host_log.h"
#include "host/http_server.h"
#include "host/json_text.h"
#include "host/monitor.h"
#include "host/runner_pool.h"
#include "host/web_entry.h"
#include "kova/webapi.h"

namespace kova_host {
namespace {

constexpr char kEntryPath[] = "/webapi/entry.cgi";
constexpr int kServerThreads = 2;
constexpr int kBlockingThreads = 2;  // password checks, which wait for the monitor

EntryRequest ToEntry(HttpRequest request) {
  EntryRequest entry;
  entry.http_method = std::move(request.method);
  entry.query = std::move(request.query);
  entry.body = std::move(request.body);
  entry.content_type = request.Header("Content-Type");
  entry.cookie = request.Header("Cookie");
  entry.token_header = request.Header("X-KOVA-Token");
  entry.accept_language = request.Header("Accept-Language");
  entry.remote_addr = std::move(request.remote);
  return entry;
}

HttpReply ToHttp(EntryReply reply) {
  return {reply.status,
          std::move(reply.content_type),
          std::move(reply.body),
          std::move(reply.headers),
          std::move(reply.access),
          std::move(reply.file)};
}

// The answers the server gives itself carry the envelope too: 102 for a path
// that is not there, 100 when the host is too busy, 101 for the rest.
HttpReply ErrorReply(int status, const std::string& reason) {
  const int code = status == 404   ? KOVA::kAPIErrorNoSuchAPI
                   : status >= 500 ? KOVA::kAPIErrorUnknown
                                   : KOVA::kAPIErrorBadParameter;
  HttpReply reply;
  reply.status = status;
  reply.content_type = "application/json; charset=utf-8";
  reply.body = ToJson(ErrorReason(code, reason));
  reply.access.code = code;
  return reply;
}

// Thousands of connections need as many descriptors: the soft limit goes up
// to the hard one.
void RaiseDescriptorLimit(size_t connections) {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
  limit.rlim_cur = limit.rlim_max;
  setrlimit(RLIMIT_NOFILE, &limit);
  if (limit.rlim_max != RLIM_INFINITY && limit.rlim_max < connections + 64) {
    HostLog("warning: %llu open files allowed, fewer than --max-connections needs",
            static_cast<unsigned long long>(limit.rlim_max));
  }
}

}  // namespace

int RunFrontEnd(int control, const Options& options, const Identity* account) {
  // SIGTERM and SIGINT are taken by one thread, which stops the server.
  sigset_t stop_signals;
  sigemptyset(&stop_signals);
  sigaddset(&stop_signals, SIGTERM);
  sigaddset(&stop_signals, SIGINT);
  pthread_sigmask(SIG_BLOCK, &stop_signals, nullptr);
  RaiseDescriptorLimit(options.max_connections);

  HttpLimits limits;
  limits.max_connections = options.max_connections;
  limits.max_per_address = options.max_per_address;
  limits.header_timeout = options.header_timeout;
  limits.body_timeout = options.body_timeout;
  limits.keepalive_timeout = options.keepalive_timeout;
  limits.send_timeout = options.send_timeout;
  limits.max_body = kMaxBody;
  // Declared first: calls still under way when it stops post their answers
  // to it, so it goes last.
  HttpServer server(limits);
  std::string error;
  const int port = server.Listen(options.bind, options.port, error);
  if (port < 0) {
    HostLog("cannot listen on %s port %d: %s", options.bind.c_str(), options.port, error.c_str());
    return 1;
  }
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
  boost::asio::thread_pool blocking(kBlockingThreads);
  WebEntry entry(
      runners,
      [&monitor](const std::string& name, const std::string& password, bool& admin) {
        return monitor.CheckPassword(name, password, admin);
      },
      sessions, throttle,
      [&blocking](std::function<void()> work) { boost::asio::post(blocking, std::move(work)); });

  HttpSite site;
  site.handler_path = kEntryPath;
  site.handler = [&entry](HttpRequest request, HttpDone done) {
    entry.Handle(ToEntry(std::move(request)),
                 [done = std::move(done)](EntryReply reply) { done(ToHttp(std::move(reply))); });
  };
  site.static_dir = options.static_dir;
  // The web app loads nothing from another origin and runs no inline script or
  // style, so its pages can be held to this policy.
  site.default_headers = {
      {"X-Content-Type-Options", "nosniff"},
      {"Content-Security-Policy",
       "default-src 'none'; script-src 'self'; style-src 'self'; img-src 'self'; "
       "connect-src 'self'; font-src 'self'; manifest-src 'self'; base-uri 'none'; "
       "form-action 'self'; frame-ancestors 'none'"},
      {"Referrer-Policy", "no-referrer"},
  };
  site.error_reply = ErrorReply;

  std::thread([&server, stop_signals] {
    int signal = 0;
    sigwait(&stop_signals, &signal);
    server.Stop();
  }).detach();
  HostLog("listening on http://%s:%d/", options.bind.c_str(), port);
  server.Run(std::move(site), kServerThreads);
  blocking.stop();
  blocking.join();
  HostLog("stopped");
  return 0;
}

}  // namespace kova_host
