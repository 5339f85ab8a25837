// A web-API module for the host's tests, "KOVA.Test.Ids": "raise" sets the
// effective ids to root and leaves them so; "ids" tells the ids a call runs with.

#include <unistd.h>

#include "kova/webapi.h"

namespace {

Json::Value Ids() {
  uid_t ruid, euid, suid;
  getresuid(&ruid, &euid, &suid);
  Json::Value ids;
  ids["ruid"] = ruid;
  ids["euid"] = euid;
  ids["suid"] = suid;
  ids["egid"] = getegid();
  return ids;
}

void Raise(KOVA::APIRequest*, KOVA::APIResponse* response) {
  const bool raised = setresuid(-1, 0, -1) == 0 && setresgid(-1, 0, -1) == 0;
  if (!raised) return response->SetError(KOVA::kAPIErrorNotPermitted, Ids());
  response->SetSuccess(Ids());
}

void Show(KOVA::APIRequest*, KOVA::APIResponse* response) { response->SetSuccess(Ids()); }

}  // namespace

extern "C" {

__attribute__((visibility("default"))) APITableEntry gTable[] = {
    {"KOVA.Test.Ids", 1, "raise", Raise},
    {"KOVA.Test.Ids", 1, "ids", Show},
    {nullptr, 0, nullptr, nullptr},
};

__attribute__((visibility("default"))) APITableEntry* GetAPITable() { return gTable; }
__attribute__((visibility("default"))) APICheckEntry* GetAPICheckTable() { return nullptr; }

}  // extern "C"
