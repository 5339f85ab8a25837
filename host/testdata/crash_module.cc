// A web-API module for the host's tests, "KOVA.Test.Crash": it aborts, hangs,
// throws, leaves a temporary file or writes its own output, small or large,
// when asked to.

#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <stdexcept>

#include "host/testdata/pattern.h"
#include "kova/conf.h"
#include "kova/webapi.h"

namespace {

void Abort(KOVA::APIRequest* request, KOVA::APIResponse*) {
  usleep(request->GetParam("delay_ms", 0).asUInt() * 1000);
  abort();
}

void Sleep(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  sleep(request->GetParam("seconds", 5).asUInt());
  response->SetSuccess(Json::Value());
}

// The runner's pid, the caller and one parameter as the handler sees it.
void Echo(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  Json::Value data;
  data["pid"] = static_cast<int>(getpid());
  data["user"] = request->GetUser();
  data["language"] = request->GetUILanguage();
  data["value"] = request->GetParam("value", Json::Value());
  data["has_sid"] = request->HasParam("_sid");
  response->SetSuccess(data);
}

void Raw(KOVA::APIRequest*, KOVA::APIResponse* response) {
  response->SetEnableOutput(false);
  printf("Status: 202 Accepted\nContent-Type: text/plain\r\nX-Test: yes\r\n\r\nhello\n");
}

// A download of `size` bytes (20 MB unless given) of kova_test::PatternByte.
void Big(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  response->SetEnableOutput(false);
  const uint64_t size = request->GetParam("size", 20000000).asUInt64();
  printf(
      "Content-Type: application/octet-stream\r\n"
      "Content-Disposition: attachment; filename=\"big.bin\"\r\n\r\n");
  char part[65536];
  for (uint64_t done = 0; done < size;) {
    const size_t count = static_cast<size_t>(std::min<uint64_t>(sizeof(part), size - done));
    for (size_t i = 0; i < count; ++i) part[i] = kova_test::PatternByte(done + i);
    fwrite(part, 1, count, stdout);
    done += count;
  }
}

void Garbage(KOVA::APIRequest*, KOVA::APIResponse* response) {
  response->SetEnableOutput(false);
  printf("no headers here");
}

void Throw(KOVA::APIRequest*, KOVA::APIResponse*) { throw std::runtime_error("on purpose"); }

// Makes a temporary file the way the log reader does, then aborts.
void LeaveTemp(KOVA::APIRequest*, KOVA::APIResponse*) {
  char name[4096];
  QLIBCFileITmpName("/tmp/kovalog", name, sizeof(name));
  abort();
}

int Refuse(KOVA::APIRequest*) { return 0; }

}  // namespace

extern "C" {

__attribute__((visibility("default"))) APITableEntry gTable[] = {
    {"KOVA.Test.Crash", 1, "abort", Abort},
    {"KOVA.Test.Crash", 1, "sleep", Sleep},
    {"KOVA.Test.Crash", 1, "echo", Echo},
    {"KOVA.Test.Crash", 1, "raw", Raw},
    {"KOVA.Test.Crash", 1, "big", Big},
    {"KOVA.Test.Crash", 1, "garbage", Garbage},
    {"KOVA.Test.Crash", 1, "throw", Throw},
    {"KOVA.Test.Crash", 1, "refused", Echo},
    {"KOVA.Test.Crash", 1, "leave_temp", LeaveTemp},
    {nullptr, 0, nullptr, nullptr},
};

__attribute__((visibility("default"))) APICheckEntry gCheckTable[] = {
    {"KOVA.Test.Crash", 1, "refused", Refuse, 0, 0},
    {nullptr, 0, nullptr, nullptr, 0, 0},
};

__attribute__((visibility("default"))) APITableEntry* GetAPITable() { return gTable; }
__attribute__((visibility("default"))) APICheckEntry* GetAPICheckTable() { return gCheckTable; }

}  // extern "C"
