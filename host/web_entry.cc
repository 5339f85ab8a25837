#include "host/web_entry.h"

#include <exception>
#include <map>
#include <set>

#include "common/answer_envelope.h"
#include "common/method_list.h"
#include "host/cgi_output.h"
#include "host/host_log.h"
#include "host/json_text.h"
#include "kova/webapi.h"

namespace kova_host {

constexpr char kInfoApi[] = "KOVA.API.Info";
constexpr char kAuthApi[] = "KOVA.API.Auth";

// A request on its way: its parameters' texts once decoded, the API, version
// and method, and what the access log learns of it.
struct WebEntry::Call {
  EntryRequest request;
  ReplyDone done;
  bool answered = false;
  std::map<std::string, std::string> fields;
  std::string api, method;
  int version = 0;
  AccessRecord access;

  void Answer(EntryReply reply) {
    if (answered) return;
    answered = true;
    access.code = reply.access.code;
    reply.access = access;
    done(std::move(reply));
  }

  const std::string* Field(const std::string& name) const {
    auto it = fields.find(name);
    return it == fields.end() ? nullptr : &it->second;
  }
};

namespace {

const std::set<std::string> kHostParams = {"api", "version", "method", "_sid", "_token"};

EntryReply Json(const Json::Value& envelope, int status = 200) {
  EntryReply reply;
  reply.status = status;
  reply.body = ToJson(envelope);
  reply.headers.emplace_back("Cache-Control", "no-store");
  reply.access.code = envelope["success"].asBool() ? 0 : envelope["error"]["code"].asInt();
  return reply;
}

EntryReply Error(int code, const std::string& reason, int status = 200) {
  return Json(ErrorReason(code, reason), status);
}

bool ParseVersion(const std::string& text, int& version) {
  if (text.empty() || text.size() > 9 || text.find_first_not_of("0123456789") != text.npos) {
    return false;
  }
  version = std::stoi(text);
  return true;
}

// The value of cookie `name` in a Cookie header, "" when absent.
std::string CookieValue(const std::string& header, const std::string& name) {
  size_t start = 0;
  while (start < header.size()) {
    size_t end = header.find(';', start);
    if (end == std::string::npos) end = header.size();
    std::string pair = header.substr(start, end - start);
    pair.erase(0, pair.find_first_not_of(' '));
    if (pair.compare(0, name.size() + 1, name + "=") == 0) return pair.substr(name.size() + 1);
    start = end + 1;
  }
  return "";
}

// Compares in time that depends on the lengths only.
bool SameText(const std::string& a, const std::string& b) {
  unsigned char differ = a.size() != b.size();
  for (size_t i = 0; i < a.size() && i < b.size(); ++i) differ |= a[i] ^ b[i];
  return differ == 0;
}

// The interface language: a "lang" parameter of three letters ("enu", "ger"),
// else German when Accept-Language puts it first, else English.
std::string Language(const std::string* param, const std::string& accept) {
  if (param != nullptr && param->size() == 3 &&
      param->find_first_not_of("abcdefghijklmnopqrstuvwxyz") == std::string::npos) {
    return *param;
  }
  const std::string first = accept.substr(0, accept.find_first_of(",;-_ "));
  if (first == "de") return "ger";
  return "enu";
}

std::string SessionCookie(const std::string& sid) {
  return std::string(kSessionCookie) + "=" + sid + (sid.empty() ? "; Max-Age=0" : "") +
         "; Path=/; HttpOnly; SameSite=Strict";
}

}  // namespace

template <typename Make>
void WebEntry::AnswerWith(const CallPtr& call, Make make) {
  try {
    if (std::optional<EntryReply> reply = make()) call->Answer(std::move(*reply));
    return;
  } catch (const std::exception& e) {
    HostLog("entry: %s", e.what());
  } catch (...) {
    HostLog("entry: unknown exception");
  }
  call->Answer(Error(KOVA::kAPIErrorUnknown, "the host failed", 500));
}

void WebEntry::Handle(EntryRequest request, ReplyDone done) {
  auto call = std::make_shared<Call>();
  call->request = std::move(request);
  call->done = std::move(done);
  AnswerWith(call, [&] { return Dispatch(call); });
}

std::optional<EntryReply> WebEntry::Dispatch(const CallPtr& call_ptr) {
  Call& call = *call_ptr;
  const EntryRequest& request = call.request;
  FormFields fields;
  std::string error;
  if (!DecodeForm(request.query, fields, error)) {
    return Error(KOVA::kAPIErrorBadParameter, error, 400);
  }
  if (request.http_method == "POST") {
    const std::string type = request.content_type.substr(0, request.content_type.find(';'));
    if (!type.empty() && type != "application/x-www-form-urlencoded") {
      return Error(KOVA::kAPIErrorBadParameter,
                   "send parameters as application/x-www-form-urlencoded", 415);
    }
    if (!DecodeForm(request.body, fields, error)) {
      return Error(KOVA::kAPIErrorBadParameter, error, 400);
    }
  }
  if (fields.size() > kMaxParams) {
    return Error(KOVA::kAPIErrorBadParameter,
                 "more than " + std::to_string(kMaxParams) + " parameters", 400);
  }
  for (auto& [name, value] : fields) {
    if (!call.fields.emplace(name, std::move(value)).second) {
      return Error(KOVA::kAPIErrorBadParameter, "parameter " + name + " comes twice", 400);
    }
  }
  for (const char* name : {"api", "version", "method"}) {
    if (call.Field(name) == nullptr || call.Field(name)->empty()) {
      return Error(KOVA::kAPIErrorBadParameter, std::string("missing parameter ") + name);
    }
  }
  call.api = *call.Field("api");
  call.method = *call.Field("method");
  call.access.api = call.api;
  call.access.method = call.method;
  if (!ParseVersion(*call.Field("version"), call.version)) {
    return Error(KOVA::kAPIErrorBadParameter, "version must be a whole number");
  }
  if (call.api == kInfoApi || call.api == kAuthApi) {
    if (call.version != 1) return Error(KOVA::kAPIErrorBadVersion, "no such version");
    if (call.api == kInfoApi && call.method == "query") return Info();
    if (call.api == kAuthApi && call.method == "login") return SignIn(call_ptr);
    if (call.api == kAuthApi && call.method == "logout") return SignOut(call);
    return Error(KOVA::kAPIErrorNoSuchMethod, "no such method");
  }
  return RunModule(call_ptr);
}

EntryReply WebEntry::Info() const {
  // api -> version -> methods, the host's own APIs first.
  std::map<std::string, std::map<int, std::vector<std::string>>> apis;
  apis[kAuthApi][1] = {"login", "logout"};
  apis[kInfoApi][1] = {"query"};
  for (const Json::Value& row : *runners_.Methods()) {
    apis[row["api"].asString()][row["version"].asInt()].push_back(row["method"].asString());
  }
  Json::Value list(Json::arrayValue);
  for (const auto& [api, versions] : apis) {
    Json::Value entry;
    entry["api"] = api;
    entry["admin"] = api != kAuthApi && api != kInfoApi;
    entry["versions"] = Json::Value(Json::arrayValue);
    for (const auto& [version, methods] : versions) {
      Json::Value item;
      item["version"] = version;
      item["methods"] = Json::Value(Json::arrayValue);
      for (const std::string& method : methods) item["methods"].append(method);
      entry["versions"].append(item);
    }
    list.append(entry);
  }
  Json::Value data;
  data["apis"] = list;
  return Json(kova::SuccessEnvelope(data));
}

std::optional<EntryReply> WebEntry::SignIn(const CallPtr& call_ptr) {
  Call& call = *call_ptr;
  const EntryRequest& request = call.request;
  if (request.http_method != "POST") {
    return Error(KOVA::kAPIErrorBadParameter, "sign in with a POST request");
  }
  const std::string* account = call.Field("account");
  const std::string* password = call.Field("password");
  if (account == nullptr || account->empty() || password == nullptr || password->empty() ||
      account->size() > 64 || password->size() > kMaxPassword) {
    return Error(KOVA::kAPIErrorBadParameter, "give an account and a password");
  }
  call.access.user = *account;
  std::vector<std::string> keys = {"account:" + *account, "address:" + request.remote_addr};
  const TimePoint now = std::chrono::steady_clock::now();
  if (const int wait = throttle_.Reserve(keys, now); wait > 0) {
    Json::Value errors;
    errors["reason"] = "too many failed sign-ins; try again later";
    errors["retry_after"] = wait;
    EntryReply reply = Json(kova::ErrorEnvelope(kErrorSignInThrottled, errors));
    reply.headers.emplace_back("Retry-After", std::to_string(wait));
    return reply;
  }
  run_blocking_([this, call_ptr, keys = std::move(keys)] {
    AnswerWith(call_ptr, [&] { return std::optional(CheckPassword(*call_ptr, keys)); });
  });
  return std::nullopt;
}

EntryReply WebEntry::CheckPassword(Call& call, const std::vector<std::string>& keys) {
  const std::string* account = call.Field("account");
  const std::string* password = call.Field("password");
  bool admin = false;
  const int checked = check_password_(*account, *password, admin);
  if (checked < 0) {
    throttle_.Cancel(keys);
    return Error(KOVA::kAPIErrorUnknown, "the accounts can't be read");
  }
  // A wrong password was counted when the attempt was reserved.
  if (checked == 0) return Error(kErrorSignInFailed, "wrong account name or password");
  throttle_.Succeeded(keys);
  Session session;
  const std::string sid =
      sessions_.Create(*account, admin, Language(call.Field("lang"), call.request.accept_language),
                       std::chrono::steady_clock::now(), session);
  Json::Value data;
  data["sid"] = sid;
  data["token"] = session.token;
  data["account"] = *account;
  data["admin"] = admin;
  EntryReply reply = Json(kova::SuccessEnvelope(data));
  reply.headers.emplace_back("Set-Cookie", SessionCookie(sid));
  return reply;
}

EntryReply WebEntry::SignOut(Call& call) {
  std::string sid;
  Session session;
  EntryReply refused;
  if (!FindSession(call, sid, session, refused)) return refused;
  sessions_.Remove(sid);
  EntryReply reply = Json(kova::SuccessEnvelope(Json::Value()));
  reply.headers.emplace_back("Set-Cookie", SessionCookie(""));
  return reply;
}

bool WebEntry::FindSession(Call& call, std::string& sid, Session& session, EntryReply& refused) {
  const EntryRequest& request = call.request;
  const std::string* sid_param = call.Field("_sid");
  const bool by_cookie = sid_param == nullptr;
  sid = by_cookie ? CookieValue(request.cookie, kSessionCookie) : *sid_param;
  if (sid.empty()) {
    refused = Error(KOVA::kAPIErrorNoSession, "not signed in");
    return false;
  }
  const TimePoint now = std::chrono::steady_clock::now();
  const std::optional<Session> found = sessions_.Find(sid, now);
  if (!found) {
    refused = Error(KOVA::kAPIErrorNoSession, "the session is unknown or has expired");
    return false;
  }
  call.access.user = found->account;
  if (by_cookie) {
    const std::string* token_param = call.Field("_token");
    const std::string token = !request.token_header.empty() ? request.token_header
                              : token_param != nullptr      ? *token_param
                                                            : "";
    if (token.empty() || !SameText(token, found->token)) {
      refused = Error(KOVA::kAPIErrorBadToken, "the session's token is missing or wrong");
      return false;
    }
  }
  sessions_.Touch(sid, now);
  session = *found;
  return true;
}

std::optional<EntryReply> WebEntry::RunModule(const CallPtr& call_ptr) {
  Call& call = *call_ptr;
  const int missing =
      kova::FindInMethodList(*runners_.Methods(), call.api, call.version, call.method);
  if (missing == KOVA::kAPIErrorNoSuchAPI) return Error(missing, "no such API");
  if (missing == KOVA::kAPIErrorBadVersion) return Error(missing, "no such version");
  if (missing != 0) return Error(missing, "no such method");

  std::string sid;
  Session session;
  EntryReply refused;
  if (!FindSession(call, sid, session, refused)) return refused;
  if (!session.admin) return Error(KOVA::kAPIErrorNotPermitted, "for administrators only");

  RunnerCall runner_call{call.api,        call.version,
                         call.method,     Json::Value(Json::objectValue),
                         session.account, session.language};
  for (const auto& [name, text] : call.fields) {
    if (kHostParams.count(name) != 0) continue;
    if (!ParamValue(text, runner_call.params[name])) {
      return Error(KOVA::kAPIErrorBadParameter,
                   "parameter " + name + " nests deeper than " + std::to_string(kMaxParamDepth));
    }
  }
  runners_.Submit(
      runner_call, [call_ptr](CallResult result, RunnerAnswer answer, const std::string& error) {
        AnswerWith(call_ptr, [&] {
          return std::optional(ModuleReply(*call_ptr, result, std::move(answer), error));
        });
      });
  return std::nullopt;
}

EntryReply WebEntry::ModuleReply(const Call& call, CallResult result, RunnerAnswer answer,
                                 const std::string& error) {
  if (result == CallResult::kBusy) {
    EntryReply reply = Error(KOVA::kAPIErrorUnknown, error + "; try again shortly", 503);
    reply.headers.emplace_back("Retry-After", "1");
    return reply;
  }
  if (result != CallResult::kAnswered) {
    return Error(KOVA::kAPIErrorUnknown, error + "; the call was abandoned");
  }
  EntryReply reply;
  reply.access.code = answer.code;
  if (!answer.raw) {
    reply.body = std::move(answer.body);
    reply.headers.emplace_back("Cache-Control", "no-store");
    return reply;
  }
  // Output that came in a file is read for its headers only; the body is sent
  // from the file.
  CgiReply cgi;
  std::string fault;
  uint64_t body_start = 0;
  const bool in_file = answer.output.valid();
  const bool parsed =
      in_file ? ReadCgiHead(answer.output.get(), answer.output_size, cgi, body_start, fault)
              : ParseCgiOutput(answer.body, cgi, fault);
  if (!parsed) {
    HostLog("%s v%d %s: %s", call.api.c_str(), call.version, call.method.c_str(), fault.c_str());
    return Error(KOVA::kAPIErrorUnknown, "the handler's output is malformed");
  }
  reply.status = cgi.status;
  reply.content_type = cgi.content_type;
  if (in_file) {
    reply.file = {std::move(answer.output), body_start, answer.output_size - body_start};
  } else {
    reply.body = std::move(cgi.body);
  }
  for (auto& header : cgi.headers) reply.headers.push_back(std::move(header));
  return reply;
}

}  // namespace kova_host
