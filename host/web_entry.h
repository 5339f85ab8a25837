// /webapi/entry.cgi: decodes a call, signs users in and out, checks the
// session, and hands module calls to the runner.

#ifndef KOVA_HOST_WEB_ENTRY_H_
#define KOVA_HOST_WEB_ENTRY_H_

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "host/access_log.h"
#include "host/http_server.h"
#include "host/params.h"
#include "host/runner_pool.h"
#include "host/sessions.h"

namespace kova_host {

// The host's own error codes beside KOVA::APIErrorCode (100 to 107).
inline constexpr int kErrorSignInFailed = 108;     // wrong account name or password
inline constexpr int kErrorSignInThrottled = 109;  // too many failed sign-ins: wait

inline constexpr size_t kMaxParams = 100;
inline constexpr size_t kMaxPassword = 1024;
inline constexpr char kSessionCookie[] = "kova_sid";

struct EntryRequest {
  std::string http_method;  // "GET" or "POST"
  std::string query;        // the query string, still encoded
  std::string body;         // a POST's body, still encoded
  std::string content_type;
  std::string cookie;        // the Cookie header
  std::string token_header;  // the X-KOVA-Token header
  std::string accept_language;
  std::string remote_addr;
};

struct EntryReply {
  int status = 200;
  std::string content_type = "application/json; charset=utf-8";
  std::string body;
  std::vector<std::pair<std::string, std::string>> headers;
  AccessRecord access;  // what the access log tells of the call
  FileBody file;        // a module's large raw output: the body instead of `body`
};

// Receives the reply to a request.
using ReplyDone = std::function<void(EntryReply reply)>;
// Runs work that blocks (a password check) away from the threads that serve
// connections.
using BlockingRunner = std::function<void(std::function<void()> work)>;

// Checks a password: 1 when it is the account's (`admin` set), 0 when not, -1 on failure.
using PasswordCheck =
    std::function<int(const std::string& account, const std::string& password, bool& admin)>;

class WebEntry {
 public:
  WebEntry(RunnerPool& runners, PasswordCheck check_password, SessionStore& sessions,
           LoginThrottle& throttle, BlockingRunner run_blocking)
      : runners_(runners),
        check_password_(std::move(check_password)),
        sessions_(sessions),
        throttle_(throttle),
        run_blocking_(std::move(run_blocking)) {}

  // Answers `request` through `done`, exactly once: before returning, or later
  // on another thread (a module runner's dispatcher, or the blocking runner's).
  // Never throws; every failure is an answer.
  void Handle(EntryRequest request, ReplyDone done);

 private:
  struct Call;
  using CallPtr = std::shared_ptr<Call>;
  // The reply, or nothing when the call is answered later.
  std::optional<EntryReply> Dispatch(const CallPtr& call);
  EntryReply Info() const;
  std::optional<EntryReply> SignIn(const CallPtr& call);
  EntryReply CheckPassword(Call& call, const std::vector<std::string>& keys);
  EntryReply SignOut(Call& call);
  std::optional<EntryReply> RunModule(const CallPtr& call);
  static EntryReply ModuleReply(const Call& call, CallResult result, RunnerAnswer answer,
                                const std::string& error);
  // The call's session, or the error reply in `refused`.
  bool FindSession(Call& call, std::string& sid, Session& session, EntryReply& refused);
  // Answers with `make`'s reply, or with an error when it throws.
  template <typename Make>
  static void AnswerWith(const CallPtr& call, Make make);

  RunnerPool& runners_;
  PasswordCheck check_password_;
  SessionStore& sessions_;
  LoginThrottle& throttle_;
  BlockingRunner run_blocking_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_WEB_ENTRY_H_
