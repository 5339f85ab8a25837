// For tests: kova-webapid started for real on a free port over a temporary
// system root, and called over HTTP the way a browser would.

#ifndef KOVA_TEST_SUPPORT_WEBAPID_H_
#define KOVA_TEST_SUPPORT_WEBAPID_H_

#include <gtest/gtest.h>
#include <httplib.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <fstream>
#include <regex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "test_support/host_call.h"

namespace kova_test {

inline constexpr char kEntryPath[] = "/webapi/entry.cgi";

using Params = std::vector<std::pair<std::string, std::string>>;

// A form-encoded body or query: Form({{"api", "X"}, {"version", "1"}}).
inline std::string Form(const Params& fields) {
  std::string out;
  for (const auto& [name, value] : fields) {
    out += (out.empty() ? "" : "&") + httplib::detail::encode_query_param(name) + "=" +
           httplib::detail::encode_query_param(value);
  }
  return out;
}

struct Reply {
  int status = 0;
  Json::Value json;  // null when the body is no JSON
  std::string body;
  httplib::Headers headers;
};

// The error code of a failed call's answer.
inline int Code(const Reply& reply) { return reply.json["error"]["code"].asInt(); }

// The program `program` run with `args` and "--port 0", its standard error in
// <root>/host.log; stopped with SIGTERM when destroyed.
class WebApid {
 public:
  WebApid(const std::string& program, const std::string& root, std::vector<std::string> args)
      : log_(root + "/host.log") {
    // The HTTP client here writes without MSG_NOSIGNAL: a host that closes a
    // connection must fail the request, not kill the test.
    signal(SIGPIPE, SIG_IGN);
    std::vector<std::string> argv = {program, "--port", "0"};
    argv.insert(argv.end(), args.begin(), args.end());
    // Emptied first, so that an earlier host's port is never read from it.
    std::ofstream(log_, std::ios::trunc).close();
    pid_ = fork();
    if (pid_ == 0) {
      signal(SIGPIPE, SIG_DFL);  // the host as it runs anywhere else
      freopen(log_.c_str(), "w", stderr);
      std::vector<char*> raw;
      for (std::string& arg : argv) raw.push_back(arg.data());
      raw.push_back(nullptr);
      execv(raw[0], raw.data());
      _exit(127);
    }
    const std::regex listening("listening on http://127.0.0.1:([0-9]+)/");
    for (int i = 0; i < 200 && port_ == 0; ++i) {
      std::smatch match;
      const std::string log = Log();
      if (std::regex_search(log, match, listening)) port_ = std::stoi(match[1]);
      if (port_ == 0) std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    EXPECT_NE(port_, 0) << Log();
  }
  ~WebApid() {
    kill(pid_, SIGTERM);
    int status = 0;
    for (int i = 0; i < 100 && waitpid(pid_, &status, WNOHANG) == 0; ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    if (waitpid(pid_, &status, WNOHANG) == 0) {
      ADD_FAILURE() << "kova-webapid did not stop on SIGTERM:\n" << Log();
      kill(pid_, SIGKILL);
      waitpid(pid_, &status, 0);
    }
  }
  WebApid(const WebApid&) = delete;
  WebApid& operator=(const WebApid&) = delete;

  int port() const { return port_; }
  pid_t pid() const { return pid_; }  // the monitor's
  std::string Log() const {
    std::ifstream in(log_);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }

  // Sends `form` by GET (as the query) or POST (as the body) to the entry.
  Reply Send(const std::string& method, const std::string& form,
             const httplib::Headers& headers = {}) const {
    httplib::Client client("127.0.0.1", port_);
    client.set_read_timeout(std::chrono::seconds(30));
    httplib::Result result =
        method == "GET"
            ? client.Get(std::string(kEntryPath) + "?" + form, headers)
            : client.Post(kEntryPath, headers, form, "application/x-www-form-urlencoded");
    Reply reply;
    if (!result) {
      ADD_FAILURE() << "no answer to " << form;
      return reply;
    }
    reply.status = result->status;
    reply.body = result->body;
    reply.headers = result->headers;
    try {
      reply.json = ParseJson(result->body);
    } catch (const std::exception&) {
    }
    return reply;
  }

  // Calls api/method, version 1, with `params` and the session of `sid` as a parameter.
  Reply Call(const std::string& api, const std::string& method, Params params = {},
             const std::string& sid = "", const httplib::Headers& headers = {}) const {
    params.insert(params.begin(), {{"api", api}, {"version", "1"}, {"method", method}});
    if (!sid.empty()) params.emplace_back("_sid", sid);
    return Send("POST", Form(params), headers);
  }

  Reply SignIn(const std::string& account, const std::string& password) const {
    return Call("KOVA.API.Auth", "login", {{"account", account}, {"password", password}});
  }
  // The session id of a sign-in, empty when it failed.
  std::string Sid(const std::string& account, const std::string& password) const {
    return SignIn(account, password).json["data"]["sid"].asString();
  }

 private:
  std::string log_;
  pid_t pid_ = -1;
  int port_ = 0;
};

// Runs the `kova` command `tool` with `args` (a shell text), `input` on its
// standard input; its exit status.
inline int RunKova(const std::string& tool, const std::string& args,
                   const std::string& input = "") {
  FILE* command = popen((tool + " " + args + " >/dev/null").c_str(), "w");
  if (command == nullptr) return -1;
  fputs((input + "\n").c_str(), command);
  return pclose(command);
}

}  // namespace kova_test

#endif  // KOVA_TEST_SUPPORT_WEBAPID_H_
