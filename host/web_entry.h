// /webapi/entry.cgi: decodes a call, signs users in and out, checks the
// session, and hands module calls to the runner.

#ifndef KOVA_HOST_WEB_ENTRY_H_
#define KOVA_HOST_WEB_ENTRY_H_

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "host/params.h"
#include "host/runner_client.h"
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
};

// Checks a password: 1 when it is the account's (`admin` set), 0 when not, -1 on failure.
using PasswordCheck =
    std::function<int(const std::string& account, const std::string& password, bool& admin)>;

class WebEntry {
 public:
  WebEntry(RunnerClient& runner, PasswordCheck check_password, SessionStore& sessions,
           LoginThrottle& throttle)
      : runner_(runner),
        check_password_(std::move(check_password)),
        sessions_(sessions),
        throttle_(throttle) {}

  // Never throws; every failure is an answer.
  EntryReply Handle(const EntryRequest& request);

 private:
  struct Call;
  EntryReply Dispatch(const EntryRequest& request, Call& call);
  EntryReply Info() const;
  EntryReply SignIn(const EntryRequest& request, const Call& call);
  EntryReply SignOut(const EntryRequest& request, const Call& call);
  EntryReply RunModule(const EntryRequest& request, const Call& call);
  // The call's session, or the error reply in `refused`.
  bool FindSession(const EntryRequest& request, const Call& call, std::string& sid,
                   Session& session, EntryReply& refused);

  RunnerClient& runner_;
  PasswordCheck check_password_;
  SessionStore& sessions_;
  LoginThrottle& throttle_;
};

}  // namespace kova_host

#endif  // KOVA_HOST_WEB_ENTRY_H_
