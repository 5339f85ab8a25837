#include "eventrule/EventRule.h"

#include <syslog.h>

#include <cstdint>
#include <cstdio>
#include <cstring>
#include <memory>

#include "api/critical_section.h"
#include "api/error_report.h"
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

// A parameter's expected JSON type; null counts as absent.
struct ParamType {
  const char* name;
  bool (Json::Value::*is)() const;
};

constexpr ParamType kListParams[] = {
    {"offset", &Json::Value::isInt64},
    {"limit", &Json::Value::isInt64},
    {nullptr, nullptr},
};

constexpr ParamType kSetParams[] = {
    {"id", &Json::Value::isString},      {"enable", &Json::Value::isBool},
    {"service", &Json::Value::isString}, {"type", &Json::Value::isInt},
    {"severity", &Json::Value::isInt},   {"resource", &Json::Value::isInt},
    {"threshold", &Json::Value::isInt},  {nullptr, nullptr},
};

bool WellTyped(const KOVA::APIRequest& request, const ParamType* params) {
  for (const ParamType* param = params; param->name != nullptr; ++param) {
    const Json::Value value = request.GetParam(param->name, Json::Value());
    if (!value.isNull() && !(value.*param->is)()) return false;
  }
  return true;
}

// Readers that give the default for an absent parameter or one of another type.
std::string TextParam(const KOVA::APIRequest& request, const char* name) {
  const Json::Value value = request.GetParam(name, Json::Value());
  return value.isString() ? value.asString() : std::string();
}

int64_t Int64Param(const KOVA::APIRequest& request, const char* name, int64_t fallback) {
  const Json::Value value = request.GetParam(name, Json::Value());
  return value.isInt64() ? value.asInt64() : fallback;
}

int32_t IntParam(const KOVA::APIRequest& request, const char* name) {
  const Json::Value value = request.GetParam(name, Json::Value());
  return value.isInt() ? value.asInt() : 0;
}

bool BoolParam(const KOVA::APIRequest& request, const char* name) {
  const Json::Value value = request.GetParam(name, Json::Value());
  return value.isBool() && value.asBool();
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

// The rules of the page from `offset`, at most `limit` of them when it is positive.
Json::Value Page(const std::vector<Json::Value>& rules, int64_t offset, int64_t limit) {
  Json::Value page(Json::arrayValue);
  if (offset < 0 || limit == 0) return page;
  for (size_t i = static_cast<size_t>(offset); i < rules.size(); ++i) {
    if (limit > 0 && page.size() == static_cast<uint64_t>(limit)) break;
    page.append(rules[i]);
  }
  return page;
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
  const std::string id = TextParam(*request, "id");
  KOVAPERFEVENT_CONF_SETTING created;
  memset(&created, 0, sizeof(created));
  KOVAPERFEVENT_CONF_SETTING* record = &created;
  RuleList stored;
  if (!id.empty()) {
    if (KOVAPerfEventIsConfExisted(id.c_str()) == 0) return Fail(kUnknownRule);
    stored.reset(KOVAPerfEventConfListGet(id.c_str()));
    if (stored == nullptr || stored->setting == nullptr) return Fail(kStoreFailed);
    // A change keeps only the stored id; every other field is written below.
    record = stored->setting;
  }
  snprintf(record->service, sizeof(record->service), "%s", TextParam(*request, "service").c_str());
  record->resource = IntParam(*request, "resource");
  record->threshold = IntParam(*request, "threshold");
  record->type = static_cast<KOVAPERFEVENT_EVENT_TYPE>(IntParam(*request, "type"));
  record->severity = IntParam(*request, "severity");
  record->enable = BoolParam(*request, "enable") ? 1 : 0;
  record->preset_a = kPresetA;
  record->preset_b = kPresetB;
  const int written = id.empty() ? KOVAPerfEventConfAdd(record) : KOVAPerfEventConfSet(record);
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
    // Elements that are no objects, or whose members have other types, are invalid too.
    if (!Member(element, "id").isString() || !Member(element, "enable").isBool()) {
      syslog(LOG_ERR, "%s:%d obj is not valid, it should contain 'id' & 'enable'", kSource,
             __LINE__);
      continue;
    }
    SwitchRule(element["id"].asString(), element["enable"].asBool());
  }
  ReloadDaemon();
}

void rule_list_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  if (!WellTyped(*request, kListParams)) return AnswerBadParameter(response);
  const int64_t offset = Int64Param(*request, "offset", 0);
  const int64_t limit = Int64Param(*request, "limit", -1);
  std::vector<Json::Value> rules;
  ListEventRules(request->GetUILanguage(), rules);
  Json::Value data;
  data["total"] = static_cast<Json::UInt>(rules.size());
  data["rules"] = Page(rules, offset, limit);
  data["support_internal"] = QLIBCFileCheckKeyValue(kKovaInfoConf, kSupportInternalKey, "yes", 0);
  response->SetSuccess(data);
}

void rule_get_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  const std::string id = TextParam(*request, "id");
  if (id.empty()) return AnswerBadParameter(response);
  Json::Value rule;
  if (!GetEventRules(request->GetUILanguage(), id, rule)) {
    return SetErrorFromReport(response, rule);
  }
  response->SetSuccess(rule);
}

void rule_set_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  if (!WellTyped(*request, kSetParams)) return AnswerBadParameter(response);
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
