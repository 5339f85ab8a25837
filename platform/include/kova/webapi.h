// The host web-API framework as a web-API module sees it.
//
// A module is a shared object that exports two tables: the methods it serves
// (`APITableEntry` rows, from `GetAPITable`) and the checks the host runs before
// some of them (`APICheckEntry` rows, from `GetAPICheckTable`). For each call the
// host builds an `APIRequest`, runs the row's check, calls the row's handler, and
// sends what the handler settled on the `APIResponse`. `APIRunner` lets a module
// call another registered web API in the same process.

#ifndef KOVA_WEBAPI_H_
#define KOVA_WEBAPI_H_

#include <json/value.h>

#include <cstdint>
#include <string>

#include "kova/export.h"

namespace KOVA {

// Error codes of the host itself. Modules use 101 for a parameter they reject.
enum APIErrorCode : int {
  kAPIErrorUnknown = 100,       // the call failed for a reason the host can't name
  kAPIErrorBadParameter = 101,  // a parameter is missing, malformed or of the wrong type
  kAPIErrorNoSuchAPI = 102,     // no module serves the named API
  kAPIErrorNoSuchMethod = 103,  // the API has no such method
  kAPIErrorBadVersion = 104,    // the API has no such version
  kAPIErrorNotPermitted = 105,  // a check refused the call, or the user may not make it
  kAPIErrorNoSession = 106,     // no signed-in session, or it has expired
  kAPIErrorBadToken = 107,      // the session's token is missing or wrong
};

// The parameters, the caller and the interface language of one call.
class KOVA_API APIRequest {
 public:
  // `params` is the JSON object of the call's parameters; any other value means none.
  APIRequest(Json::Value params, std::string user, std::string ui_language);

  // True when the call carries a parameter of that name, whatever its JSON type.
  bool HasParam(const std::string& name) const;
  // The parameter's value, or a copy of `fallback` when the call doesn't carry it.
  Json::Value GetParam(const std::string& name, const Json::Value& fallback) const;
  // The language code of the caller's interface, such as "enu".
  std::string GetUILanguage() const;
  // The name of the user making the call.
  const std::string& GetUser() const;

 private:
  Json::Value params_;
  std::string user_;
  std::string ui_language_;
};

// The answer to one call. A handler settles it once, with SetSuccess or SetError.
class KOVA_API APIResponse {
 public:
  enum class State { kUnset, kSuccess, kError };

  // Marks the call successful with `data`, a null value when there is nothing to return.
  void SetSuccess(const Json::Value& data);
  // Marks the call failed with `code`; `data` is sent to the caller beside it.
  void SetError(int code, const Json::Value& data);
  // With false the host sends nothing of its own for the call: what the handler
  // wrote to standard output (CGI header lines, an empty line, the body) is the reply.
  void SetEnableOutput(bool enable);

  State GetState() const;
  // The code given to SetError, 0 when the call did not fail.
  int GetErrorCode() const;
  // The data given to the last SetSuccess or SetError.
  const Json::Value& GetData() const;
  bool IsOutputEnabled() const;
  // How many times SetSuccess and SetError were called; a well-behaved handler makes it 1.
  int GetSettleCount() const;

 private:
  State state_ = State::kUnset;
  int error_code_ = 0;
  Json::Value data_;
  bool output_enabled_ = true;
  int settle_count_ = 0;
};

}  // namespace KOVA

// A method's handler: reads the request, settles the response before returning.
using APIHandler = void (*)(KOVA::APIRequest* request, KOVA::APIResponse* response);
// A check run before a handler: non-zero lets the call through, 0 refuses it.
using APICheck = int (*)(KOVA::APIRequest* request);

// One method a module serves. A table ends at a row whose fields are all zero.
struct APITableEntry {
  const char* api;     // full API name, such as "KOVA.ResourceMonitor.Setting"
  intptr_t version;    // API version
  const char* method;  // method name, such as "get"
  APIHandler handler;
};

// One check the host runs before the method's handler. A table ends at an all-zero row.
struct APICheckEntry {
  const char* api;
  intptr_t version;
  const char* method;
  APICheck check;
  intptr_t reserved1;  // always 0
  intptr_t reserved2;  // always 0
};

// The entry points a module exports with C linkage, under these names.
using GetAPITableFunc = APITableEntry* (*)();
using GetAPICheckTableFunc = APICheckEntry* (*)();
inline constexpr char kGetAPITableSymbol[] = "GetAPITable";
inline constexpr char kGetAPICheckTableSymbol[] = "GetAPICheckTable";

namespace KOVA {

// The registry of web APIs that can be called in process, and the call itself.
class KOVA_API APIRunner {
 public:
  // Runs the registered method (api, version, method) with `params` as the user
  // `user`: its check first, when it has one, then its handler. Fills `out` with
  // {"success": true, "data": DATA} ("data" left out when null) or
  // {"success": false, "error": {"code": CODE, "errors": DATA}} ("errors" left out
  // when null). Returns 0 when the check or the handler ran; -1 when no such method
  // is registered, `out` then holding the error 102, 103 or 104.
  static int Exec(Json::Value& out, const char* api, int version, const char* method,
                  const Json::Value& params, const char* user);

  // Runs the registered method (api, version, method) on `request` and
  // `response`: its check first, when it has one, then its handler. Returns 0
  // when the handler ran, kAPIErrorNotPermitted when the check refused the call,
  // or 102, 103 or 104 when no such method is registered. Exceptions of the
  // check or the handler pass through.
  static int Call(const char* api, int version, const char* method, APIRequest& request,
                  APIResponse& response);

  // Every registered method as {"api", "version", "method"}, ordered by api,
  // version and method.
  static Json::Value List();

  // Registers every row of `table` up to its terminator, and the rows of `checks`
  // (may be null) for the methods of `table`. Returns the number of methods added.
  // Returns -1 and adds nothing when a row has no handler or names a method that
  // is already registered.
  static int Register(const APITableEntry* table, const APICheckEntry* checks);

  // Removes the methods of `table`, and their checks, from the registry.
  static void Unregister(const APITableEntry* table);
};

}  // namespace KOVA

#endif  // KOVA_WEBAPI_H_
