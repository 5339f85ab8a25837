#include "eventrule/EventRule.h"

#include <syslog.h>

#include <cstdint>
#include <cstdio>
#include <cstring>
#include <memory>

#include "api/critical_section.h"
#include "api/error_report.h"
#include "api/page.h"
#include "kova/conf.h"
#include "kova/error.h"
#include "kova/service.h"

namespace {

constexpr char kSource[] = "EventRule";
constexpr char kDaemon[] = "kovaperfeventd";
constexpr char kPackagePrefix[] = "pkgctl-";
constexpr size_t kPackagePrefixLength = sizeof(kPackagePrefix) - 1;
constexpr char kSupportInternalKey[] = "support_performance_event_internal";

// The rule paths set only the record's code.
constexpr FailurePoint kStoreFailed{.code = kErrorConf};
constexpr FailurePoint kDuplicate{.code = kErrorRuleDuplicate};
constexpr FailurePoint kUnknownRule{.code = kErrorRuleNotFound};

// Presets that every create and change writes, whatever the rule held.
constexpr int32_t kPresetA = 5;
constexpr int32_t kPresetB = 30;

// Owns a list fetched from the store and frees it once.
struct RuleListFree {
  void operator()(KovaPerfEventConfSettingNode* head) const { KOVAPerfEventConfListFree(head); }
};
using RuleList = std::unique_ptr<KovaPerfEventConfSettingNode, RuleListFree>;

// Converts `value` with the JSON library's conversion `as`. False, leaving
// `out` as it was, where the library refuses: an array or object as text, a
// text as a boolean or integer, a number out of the integer's range.
template <typename T>
bool Convert(const Json::Value& value, T (Json::Value::*as)() const, T& out) {
  try {
    out = (value.*as)();
    return true;
  } catch (const Json::Exception&) {
    return false;
  }
}

// The parameters of a set; absent ones convert as null: 0, empty or off.
struct RuleParams {
  std::string id;
  bool enable = false;
  std::string service;
  int32_t type = 0;
  int32_t severity = 0;
  int32_t resource = 0;
  int32_t threshold = 0;
};

template <typename T>
bool ConvertParam(const KOVA::APIRequest& request, const char* name, T (Json::Value::*as)() const,
                  T& out) {
  return Convert(request.GetParam(name, Json::Value()), as, out);
}

// Reads every parameter of a set. False when one can't be converted; it keeps
// its default and the others are read all the same.
bool ReadRuleParams(const KOVA::APIRequest& request, RuleParams& params) {
  bool read = ConvertParam(request, "id", &Json::Value::asString, params.id);
  read &= ConvertParam(request, "enable", &Json::Value::asBool, params.enable);
  read &= ConvertParam(request, "service", &Json::Value::asString, params.service);
  read &= ConvertParam(request, "type", &Json::Value::asInt, params.type);
  read &= ConvertParam(request, "severity", &Json::Value::asInt, params.severity);
  read &= ConvertParam(request, "resource", &Json::Value::asInt, params.resource);
  read &= ConvertParam(request, "threshold", &Json::Value::asInt, params.threshold);
  return read;
}

void AnswerBadParameter(KOVA::APIResponse* response) {
  response->SetError(kErrorBadParameter, Json::Value());
}

// The member `key` of `value`, null when `value` is no object or lacks it.
const Json::Value& Member(const Json::Value& value, const char* key) {
  return value.isObject() ? value[key] : Json::Value::nullSingleton();
}

// The text of a fixed-size field, up to its first NUL or its end.
template <size_t N>
std::string FieldText(const char (&field)[N]) {
  return std::string(field, strnlen(field, N));
}

std::string ServiceDisplayName(const std::string& language, const std::string& service) {
  char name[1024] = {};
  const std::string display = QLIBServicecfgDisplayNameGet(service.c_str(), name, sizeof(name)) < 0
                                  ? service
                                  : FieldText(name);
  if (display.compare(0, kPackagePrefixLength, kPackagePrefix) != 0) return display;
  // The package's name comes from the buffer, so a failed lookup leaves it empty.
  name[sizeof(name) - 1] = '\0';
  const char* package = strlen(name) > kPackagePrefixLength ? name + kPackagePrefixLength : "";
  char path[1024] = {};
  // A package name too long for the path can't name an INFO file.
  if (snprintf(path, sizeof(path), "/var/packages/%s/INFO", package) >=
      static_cast<int>(sizeof(path))) {
    return display;
  }
  // The key buffer holds at most 19 characters of the language code.
  char key[32] = {};
  snprintf(key, sizeof(key), "displayname_%s", language.c_str());
  if (QLIBCFileGetKeyValue(path, key, name, sizeof(name), 0) > 0) return FieldText(name);
  if (QLIBCFileGetKeyValue(path, "displayname", name, sizeof(name), 0) > 0) return FieldText(name);
  return display;
}

std::string LunName(const std::string& uuid) {
  Json::Value params;
  params["uuid"] = uuid;
  Json::Value answer;
  KOVA::APIRunner::Exec(answer, "KOVA.Core.ISCSI.LUN", 1, "get", params, "admin");
  const Json::Value& success = Member(answer, "success");
  if (!success.isBool() || !success.asBool()) return uuid;
  const Json::Value& name = Member(Member(Member(answer, "data"), "lun"), "name");
  return name.isString() ? name.asString() : std::string();
}

Json::Value RuleObject(const std::string& language, const KOVAPERFEVENT_CONF_SETTING& record) {
  const std::string service = FieldText(record.service);
  Json::Value rule;
  rule["id"] = FieldText(record.id);
  rule["enable"] = record.enable == 1;
  rule["service"] = service;
  rule["name"] = translateName(language, record.type, service);
  rule["type"] = static_cast<int>(record.type);
  rule["severity"] = record.severity;
  rule["resource"] = record.resource;
  rule["threshold"] = record.threshold;
  return rule;
}

// A failed reload is logged; the rules are stored all the same.
void ReloadDaemon() {
  if (QLIBServiceReload(kDaemon) == 0) return;
  syslog(LOG_ERR, "%s:%d Failed to reload %s [0x%04X %s:%d]", kSource, __LINE__, kDaemon,
         QLIBCErrGet(), QLIBCErrorGetFile(), QLIBCErrorGetLine());
}

void SwitchRule(const std::string& id, bool enable) {
  if (KOVAPerfEventIsConfExisted(id.c_str()) == 0) return;
  RuleList list(KOVAPerfEventConfListGet(id.c_str()));
  if (list == nullptr || list->setting == nullptr) return;
  list->setting->enable = enable ? 1 : 0;
  if (KOVAPerfEventConfSet(list->setting) != 0) {
    syslog(LOG_ERR, "%s:%d Failed to enable [%s]'s enable (%s)", kSource, __LINE__, id.c_str(),
           enable ? "true" : "false");
  }
}

}  // namespace

std::string translateName(const std::string& language, KOVAPERFEVENT_EVENT_TYPE type,
                          std::string object) {
  switch (type) {
    case PERFEVENT_TYPE_SERVICE:
      return ServiceDisplayName(language, object);
    case PERFEVENT_TYPE_ISCSI_LUN:
      return LunName(object);
    default:
      return object;
  }
}

bool GetEventRules(const std::string& language, std::string id, Json::Value& rule) {
  RuleList list(KOVAPerfEventConfListGet(id.c_str()));
  if (list == nullptr || list->setting == nullptr) return Fail(kStoreFailed);
  rule = RuleObject(language, *list->setting);
  return true;
}

void ListEventRules(const std::string& language, std::vector<Json::Value>& rules) {
  RuleList list(KOVAPerfEventConfListGet(nullptr));
  for (const KovaPerfEventConfSettingNode* node = list.get();
       node != nullptr && node->setting != nullptr; node = node->next) {
    rules.push_back(RuleObject(language, *node->setting));
  }
}

bool SetEventRules(KOVA::APIRequest* request) {
  // The handler has refused parameters that can't be converted.
  RuleParams params;
  ReadRuleParams(*request, params);
  KOVAPERFEVENT_CONF_SETTING created;
  memset(&created, 0, sizeof(created));
  KOVAPERFEVENT_CONF_SETTING* record = &created;
  RuleList stored;
  if (!params.id.empty()) {
    if (KOVAPerfEventIsConfExisted(params.id.c_str()) == 0) return Fail(kUnknownRule);
    stored.reset(KOVAPerfEventConfListGet(params.id.c_str()));
    if (stored == nullptr || stored->setting == nullptr) return Fail(kStoreFailed);
    // A change keeps only the stored id; every other field is written below.
    record = stored->setting;
  }
  snprintf(record->service, sizeof(record->service), "%s", params.service.c_str());
  record->resource = params.resource;
  record->threshold = params.threshold;
  record->type = static_cast<KOVAPERFEVENT_EVENT_TYPE>(params.type);
  record->severity = params.severity;
  record->enable = params.enable ? 1 : 0;
  record->preset_a = kPresetA;
  record->preset_b = kPresetB;
  const int written =
      params.id.empty() ? KOVAPerfEventConfAdd(record) : KOVAPerfEventConfSet(record);
  if (written < 0) {
    return Fail(QLIBCErrGet() == KOVA_ERR_PERFEVENT_DUPLICATE ? kDuplicate : kStoreFailed);
  }
  ReloadDaemon();
  return true;
}

void DelEventRules(const Json::Value& ids) {
  for (const Json::Value& id : ids) {
    if (id.isString() && KOVAPerfEventIsConfExisted(id.asCString()) != 0) {
      KOVAPerfEventConfDelete(id.asCString());
    }
  }
  ReloadDaemon();
}

void OnOffEventRules(const Json::Value& switches) {
  for (const Json::Value& element : switches) {
    // An element that is no object, or whose "id" or "enable" the JSON library
    // can't convert, is invalid too.
    std::string id;
    bool enable = false;
    if (!element.isObject() || !element.isMember("id") || !element.isMember("enable") ||
        !Convert(element["id"], &Json::Value::asString, id) ||
        !Convert(element["enable"], &Json::Value::asBool, enable)) {
      syslog(LOG_ERR, "%s:%d obj is not valid, it should contain 'id' & 'enable'", kSource,
             __LINE__);
      continue;
    }
    SwitchRule(id, enable);
  }
  ReloadDaemon();
}

void rule_list_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  int64_t offset = 0;
  int64_t limit = -1;
  if (!Convert(request->GetParam("offset", Json::Value(0)), &Json::Value::asInt64, offset) ||
      !Convert(request->GetParam("limit", Json::Value(-1)), &Json::Value::asInt64, limit)) {
    return AnswerBadParameter(response);
  }
  std::vector<Json::Value> rules;
  ListEventRules(request->GetUILanguage(), rules);
  Json::Value data;
  data["total"] = static_cast<Json::UInt>(rules.size());
  data["rules"] = Page(rules.size(), offset, limit, [&rules](size_t i) { return rules[i]; });
  data["support_internal"] = QLIBCFileCheckKeyValue(kKovaInfoConf, kSupportInternalKey, "yes", 0);
  response->SetSuccess(data);
}

void rule_get_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  std::string id;
  if (!ConvertParam(*request, "id", &Json::Value::asString, id) || id.empty()) {
    return AnswerBadParameter(response);
  }
  Json::Value rule;
  if (!GetEventRules(request->GetUILanguage(), id, rule)) {
    return SetErrorFromReport(response, rule);
  }
  response->SetSuccess(rule);
}

void rule_set_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  RuleParams params;
  if (!ReadRuleParams(*request, params)) return AnswerBadParameter(response);
  CriticalSection section;
  ENTERCriticalSection(section, kSource, __LINE__);
  const bool stored = SetEventRules(request);
  LEAVECriticalSection(section, kSource, __LINE__);
  if (!stored) return SetErrorFromReport(response);
  response->SetSuccess(Json::Value());
}

void rule_delete_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  const Json::Value ids = request->GetParam("id_list", Json::Value());
  if (!ids.isArray()) return AnswerBadParameter(response);
  CriticalSection section;
  ENTERCriticalSection(section, kSource, __LINE__);
  DelEventRules(ids);
  LEAVECriticalSection(section, kSource, __LINE__);
  response->SetSuccess(Json::Value());
}

void rule_onoff_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  const Json::Value switches = request->GetParam("id_list", Json::Value());
  if (!switches.isArray()) return AnswerBadParameter(response);
  CriticalSection section;
  ENTERCriticalSection(section, kSource, __LINE__);
  OnOffEventRules(switches);
  LEAVECriticalSection(section, kSource, __LINE__);
  response->SetSuccess(Json::Value());
}
