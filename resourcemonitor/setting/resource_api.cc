#include "setting/resource_api.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "api/error_report.h"
#include "kova/conf.h"
#include "kova/service.h"
#include "kova/transmitor.h"

namespace {

constexpr char kRealtimeKey[] = "resourcemonitor_realtime_max";
constexpr char kHistoryKey[] = "resourcemonitor_history";
constexpr char kEventKey[] = "resourcemonitor_performance_event";
constexpr char kDatabaseService[] = "pgsql";
constexpr char kEventDaemon[] = "kovaperfeventd";

// Failure points. Their lines are fixed: clients receive them as "err_line".
constexpr FailurePoint kReadRealtimeFailed{68, "Get Conf Failed", nullptr, nullptr, kErrorConf};
constexpr FailurePoint kReadHistoryForGetFailed{79, "Get Conf Failed", nullptr, nullptr,
                                                kErrorConf};
constexpr FailurePoint kReadEventFailed{91, "Get Conf Failed", nullptr, nullptr, kErrorConf};
constexpr FailurePoint kWrongType{.code = kErrorWrongType};
constexpr FailurePoint kTransmitFailed{113, "Transmition failed.", nullptr, nullptr,
                                       kErrorCollectorReload};
constexpr FailurePoint kReplyFailed{119, "Transmition Get Json Failed", nullptr, nullptr,
                                    kErrorCollectorReload};
constexpr FailurePoint kReloadRefused{125, "Get failed reload status", nullptr, nullptr,
                                      kErrorCollectorReload};
constexpr FailurePoint kNoVolume{139, "Not Found Volumes.", "error", "volume_no_volumes",
                                 kErrorNoVolume};
constexpr FailurePoint kDatabaseDown{143, "PGSQL Disable", "error", "db_connect_fail",
                                     kErrorDatabaseDown};
constexpr FailurePoint kReadHistoryFailed{151, "Get Conf Failed", nullptr, nullptr, kErrorConf};
constexpr FailurePoint kWriteHistoryOnFailed{164, "Set Conf Failed", nullptr, nullptr, kErrorConf};
constexpr FailurePoint kWriteHistoryOffFailed{170, "Set Conf Failed", nullptr, nullptr, kErrorConf};
constexpr FailurePoint kWriteEventOnFailed{207, "Set run key failed", nullptr, nullptr, kErrorConf};
// One message serves a failed start and a failed stop.
constexpr FailurePoint kStartDaemonFailed{212, "Stop kovaperfeventd service failed", nullptr,
                                          nullptr, kErrorConf};
constexpr FailurePoint kWriteEventOffFailed{217, "Set run key failed", nullptr, nullptr,
                                            kErrorConf};
constexpr FailurePoint kStopDaemonFailed{222, "Stop kovaperfeventd service failed", nullptr,
                                         nullptr, kErrorConf};

// Reads `key` of the settings file into `value`; an absent key
// reads as `absent`. False when the file can't be read.
bool ReadSetting(const char* key, char (&value)[1024], const char* absent, std::string& text) {
  const int found = QLIBCFileGetKeyValue(kKovaInfoConf, key, value, sizeof(value), 0);
  if (found < 0) return false;
  text = found > 0 ? value : absent;
  return true;
}

// The real-time range as stored text reads: its leading integer, at least 15.
int ParseDuration(const std::string& text) {
  const int duration = static_cast<int>(strtol(text.c_str(), nullptr, 10));
  return duration > 14 ? duration : 15;
}

// The step of the real-time range that a requested duration maps onto.
int DurationStep(int requested) {
  if (requested >= 120) return 120;
  if (requested >= 60) return 60;
  if (requested >= 30) return 30;
  return 15;
}

bool ApplyHistory(const Json::Value& param) {
  if (!param.isBool()) return Fail(kWrongType);
  const bool wanted = param.asBool();
  if (wanted && QLIBServiceIsRunning(kDatabaseService) == 0) {
    char volume[4095];
    memset(volume, 0, sizeof(volume));
    const int found = KOVAShareServiceVolumeGetbyLink(kDatabaseService, volume, sizeof(volume));
    return Fail(found == 1 ? kDatabaseDown : kNoVolume);
  }
  char stored[1024];
  memset(stored, 0, sizeof(stored));
  const int found = QLIBCFileGetKeyValue(kKovaInfoConf, kHistoryKey, stored, sizeof(stored), 0);
  if (found < 0) return Fail(kReadHistoryFailed);
  const bool stored_on = found > 0 && strcmp(stored, "yes") == 0;
  if (stored_on == wanted) return true;
  if (QLIBCINFOSetKeyValue(kHistoryKey, wanted ? "yes" : "no") < 0) {
    return Fail(wanted ? kWriteHistoryOnFailed : kWriteHistoryOffFailed);
  }
  return ReloadCollector();
}

// Rewrites the key and starts or stops the daemon on every request, changed or not.
bool ApplyEvent(const Json::Value& param) {
  if (!param.isBool()) return Fail(kWrongType);
  if (param.asBool()) {
    if (QLIBCINFOSetKeyValue(kEventKey, "yes") < 0) return Fail(kWriteEventOnFailed);
    if (QLIBServiceStart(kEventDaemon, 0) < 0) return Fail(kStartDaemonFailed);
  } else {
    if (QLIBCINFOSetKeyValue(kEventKey, "no") < 0) return Fail(kWriteEventOffFailed);
    if (QLIBServiceStop(kEventDaemon, 0) < 0) return Fail(kStopDaemonFailed);
  }
  return true;
}

// A failed write leaves the error record untouched.
bool ApplyDuration(const Json::Value& param) {
  if (!param.isInt()) return Fail(kWrongType);
  char text[1024];
  snprintf(text, sizeof(text), "%d", DurationStep(param.asInt()));
  return QLIBCINFOSetKeyValue(kRealtimeKey, text) >= 0;
}

}  // namespace

void get_v1(KOVA::APIRequest*, KOVA::APIResponse* response) {
  Json::Value reply;
  char value[1024];
  memset(value, 0, sizeof(value));
  std::string text;
  if (!ReadSetting(kRealtimeKey, value, "", text))
    return AnswerFailure(response, kReadRealtimeFailed);
  reply["duration"] = ParseDuration(text);
  if (!ReadSetting(kHistoryKey, value, "no", text)) {
    return AnswerFailure(response, kReadHistoryForGetFailed);
  }
  // History counts as on only while its database runs; the daemon isn't asked.
  reply["enable_history"] = text == "yes" && QLIBServiceIsRunning(kDatabaseService) != 0;
  if (!ReadSetting(kEventKey, value, "no", text)) return AnswerFailure(response, kReadEventFailed);
  reply["enable_event"] = text == "yes";
  response->SetSuccess(reply);
}

void set_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  if (!SetMonitorSettings(request)) return SetErrorFromReport(response);
  response->SetSuccess(Json::Value());
}

bool SetMonitorSettings(KOVA::APIRequest* request) {
  if (request->HasParam("enable_history") &&
      !ApplyHistory(request->GetParam("enable_history", Json::Value(false)))) {
    return false;
  }
  if (request->HasParam("enable_event") &&
      !ApplyEvent(request->GetParam("enable_event", Json::Value(false)))) {
    return false;
  }
  if (!request->HasParam("duration")) return true;
  return ApplyDuration(request->GetParam("duration", Json::Value(15)));
}

bool ReloadCollector() {
  Transmitor transmitor("localhost");
  Json::Value request;
  request["request"] = "reload";
  Json::Value reply;
  if (transmitor.Transmit(request) < 0) return Fail(kTransmitFailed);
  if (transmitor.GetDataJson(reply) < 0) return Fail(kReplyFailed);
  const Json::Value success =
      reply.isObject() ? reply.get("success", Json::Value()) : Json::Value();
  if (!success.isBool() || !success.asBool()) return Fail(kReloadRefused);
  return true;
}
