#include "eventrule/EventRule.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <functional>
#include <map>

#include "fake/host_call.h"
#include "fake/kova_fake.h"
#include "fake/run_in_child.h"
#include "kova/error.h"
#include "setting/resource_api.h"

namespace {

using kova_fake::CallHandler;
using kova_fake::ParseJson;
using kova_fake::RuleListAnswer;
using ::testing::Contains;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;
using ::testing::Not;

constexpr char kReload[] = "QLIBServiceReload kovaperfeventd";
constexpr char kFree[] = "KOVAPerfEventConfListFree";
constexpr char kInfo[] = "/var/packages/Foo/INFO";
constexpr char kSupportKey[] = "support_performance_event_internal";

// The in-process LUN API: the data it answers for each uuid; other uuids fail.
std::map<std::string, Json::Value> gLuns;
std::string gLunUser;

void LunGet(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  gLunUser = request->GetUser();
  auto lun = gLuns.find(request->GetParam("uuid", Json::Value()).asString());
  if (lun == gLuns.end()) return response->SetError(6102, Json::Value());
  response->SetSuccess(lun->second);
}

APITableEntry kLunTable[] = {{"KOVA.Core.ISCSI.LUN", 1, "get", LunGet}, {}};

class EventRuleTest : public ::testing::Test {
 protected:
  void SetUp() override {
    kova_fake::Reset();
    gLuns.clear();
    ASSERT_EQ(KOVA::APIRunner::Register(kLunTable, nullptr), 1);
  }
  void TearDown() override { KOVA::APIRunner::Unregister(kLunTable); }
};

// Stores a rule with every field set, presets included.
void Seed(int type, const char* service, int enable = 1) {
  KOVAPERFEVENT_CONF_SETTING rule{
      {}, static_cast<KOVAPERFEVENT_EVENT_TYPE>(type), {}, 1, 2, 80, 1, 2, enable};
  snprintf(rule.service, sizeof(rule.service), "%s", service);
  kova_fake::AddRule(rule);
}

// The store's records, each as "id:type:service:resource:severity:threshold:
// preset_a:preset_b:enable".
std::vector<std::string> StoredRules() {
  std::vector<std::string> rules;
  for (const KOVAPERFEVENT_CONF_SETTING& r : kova_fake::Rules()) {
    char text[1300];
    snprintf(text, sizeof(text), "%s:%d:%s:%d:%d:%d:%d:%d:%d", r.id, r.type, r.service, r.resource,
             r.severity, r.threshold, r.preset_a, r.preset_b, r.enable);
    rules.push_back(text);
  }
  return rules;
}

// Every list handed out was freed, and only once.
void ExpectListsFreed(const std::string& label) {
  EXPECT_EQ(kova_fake::OpenRuleLists(), 0) << label;
  EXPECT_THAT(kova_fake::Calls(), Not(Contains("KOVAPerfEventConfListFree not open"))) << label;
}

// Lines logged at error priority of the default facility.
std::vector<std::string> ErrorLog() {
  std::vector<std::string> lines;
  for (const auto& line : kova_fake::Syslog()) {
    if (line.priority == LOG_ERR) lines.push_back(line.text);
  }
  return lines;
}

TEST_F(EventRuleTest, TranslateNameShowsAServiceOrItsPackageByItsDisplayName) {
  const std::string long_language = "abcdefghijklmnopqrstuvwxy";
  const struct {
    const char* service;
    std::string language;
    const char* display;                      // the service's display name, if any
    std::map<std::string, std::string> info;  // keys of the package Foo's INFO file
    const char* name;
  } cases[] = {
      {"smb", "enu", "File Service", {}, "File Service"},
      {"smb", "enu", nullptr, {}, "smb"},
      {"foo", "ger", "pkgctl-Foo", {{"displayname_ger", "DE"}, {"displayname", "Foo"}}, "DE"},
      {"foo", "ger", "pkgctl-Foo", {{"displayname_enu", "EN"}, {"displayname", "Foo"}}, "Foo"},
      {"foo", "ger", "pkgctl-Foo", {}, "pkgctl-Foo"},
      {"foo", "enu", "Pkgctl-Foo", {{"displayname", "Foo"}}, "Pkgctl-Foo"},
      // Without a display name the package's name, taken from the buffer, is empty.
      {"pkgctl-Foo", "enu", nullptr, {{"displayname", "Foo"}}, "pkgctl-Foo"},
      // The key holds 19 characters of the language code.
      {"foo",
       long_language,
       "pkgctl-Foo",
       {{"displayname_" + long_language, "Full"}, {"displayname", "Foo"}},
       "Foo"},
      {"foo", long_language, "pkgctl-Foo", {{"displayname_abcdefghijklmnopqrs", "Cut"}}, "Cut"},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    if (c.display) kova_fake::SetServiceDisplayName(c.service, c.display);
    for (const auto& [key, value] : c.info) kova_fake::SetConf(kInfo, key, value);
    EXPECT_EQ(translateName(c.language, PERFEVENT_TYPE_SERVICE, c.service), c.name)
        << c.service << " " << c.language;
  }
}

TEST_F(EventRuleTest, TranslateNameShowsALunByItsNameAndOtherObjectsAsThemselves) {
  const struct {
    int type;
    const char* uuid;
    const char* data;  // what the LUN API answers for "u1"
    const char* name;
  } cases[] = {
      {2, "u1", R"({"lun": {"name": "LUN 1"}})", "LUN 1"},
      {2, "u2", R"({"lun": {"name": "LUN 1"}})", "u2"},
      {2, "u1", "null", ""},
      {2, "u1", R"({"lun": {}})", ""},
      {2, "u1", R"({"lun": "LUN 1"})", ""},
      {0, "u1", R"({"lun": {"name": "LUN 1"}})", "u1"},
      {-1, "u1", R"({"lun": {"name": "LUN 1"}})", "u1"},
      {3, "u1", R"({"lun": {"name": "LUN 1"}})", "u1"},
      {1, "u1", R"({"lun": {"name": "LUN 1"}})", "u1"},
  };
  for (const auto& c : cases) {
    gLuns["u1"] = ParseJson(c.data);
    EXPECT_EQ(translateName("enu", static_cast<KOVAPERFEVENT_EVENT_TYPE>(c.type), c.uuid), c.name)
        << c.type << " " << c.data;
  }
  EXPECT_EQ(gLunUser, "admin");
}

TEST_F(EventRuleTest, GetAnswersTheRuleObjectOnForExactlyOne) {
  for (int enable : {1, 0, 2, -1}) {
    kova_fake::Reset();
    Seed(0, "other");
    Seed(1, "foo", enable);
    kova_fake::SetServiceDisplayName("foo", "pkgctl-Foo");
    kova_fake::SetConf(kInfo, "displayname_ger", "Foo DE");
    KOVA::APIResponse response = CallHandler(rule_get_v1, R"({"id": "2"})", "ger");
    Json::Value expected = ParseJson(R"({"id": "2", "enable": false, "service": "foo",
        "name": "Foo DE", "type": 1, "severity": 2, "resource": 1, "threshold": 80})");
    expected["enable"] = enable == 1;
    EXPECT_EQ(response.GetData(), expected) << enable;
    EXPECT_THAT(kova_fake::Calls(),
                ElementsAre("KOVAPerfEventConfListGet 2",
                            "QLIBCFileGetKeyValue /var/packages/Foo/INFO displayname_ger", kFree));
  }
}

TEST_F(EventRuleTest, HandlersAnswer101ForParametersTheyCannotRead) {
  std::vector<std::pair<APIHandler, std::string>> requests;
  for (const char* params : {"{}", R"({"id": ""})", R"({"id": null})", R"({"id": 1})",
                             R"({"id": ["1"]})", R"({"id": {}})"}) {
    requests.push_back({rule_get_v1, params});
  }
  for (APIHandler handler : {rule_delete_v1, rule_onoff_v1}) {
    for (const char* params : {"{}", R"({"id_list": null})", R"({"id_list": "1"})",
                               R"({"id_list": 1})", R"({"id_list": {"id": "1"}})"}) {
      requests.push_back({handler, params});
    }
  }
  const struct {
    APIHandler handler;
    std::vector<std::string> names;
    std::vector<std::string> values;
  } groups[] = {
      {rule_set_v1, {"id", "service"}, {"1", "true", "[]", "{}"}},
      {rule_set_v1, {"enable"}, {"1", R"("true")", "[]", "{}"}},
      {rule_set_v1,
       {"type", "severity", "resource", "threshold"},
       {R"("1")", "true", "1.5", "2147483648", "[]", "{}"}},
      {rule_list_v1, {"offset", "limit"}, {R"("2")", "true", "1.5", "1e300", "[]", "{}"}},
  };
  for (const auto& group : groups) {
    for (const std::string& name : group.names) {
      for (const std::string& value : group.values) {
        requests.push_back({group.handler, "{\"" + name + "\": " + value + "}"});
      }
    }
  }
  Seed(1, "smb");
  for (const auto& [handler, params] : requests) {
    KOVA::APIResponse response = CallHandler(handler, params);
    EXPECT_EQ(response.GetErrorCode(), 101) << params;
    EXPECT_TRUE(response.GetData().isNull()) << params;
  }
  EXPECT_THAT(kova_fake::Calls(), IsEmpty());
}

// The rule paths set only the record's code: the rest is what a Setting failure left.
TEST_F(EventRuleTest, FailuresSetOnlyTheirCodeAndChangeNothing) {
  kova_fake::SetVolumeLookup("pgsql", 1, "/volume1");
  ASSERT_EQ(CallHandler(set_v1, R"({"enable_history": true})").GetErrorCode(), 6104);
  const auto duplicate = [] { kova_fake::FailRuleWrite(KOVA_ERR_PERFEVENT_DUPLICATE); };
  const auto store_fails = [] { kova_fake::FailRuleWrite(KOVA_ERR_STORE); };
  const auto no_list = [] { kova_fake::SetRuleListAnswer(RuleListAnswer::kNull); };
  const auto empty_list = [] { kova_fake::SetRuleListAnswer(RuleListAnswer::kEmptyHead); };
  const std::string get = "KOVAPerfEventConfListGet 1";
  const struct {
    APIHandler handler;
    const char* params;
    std::function<void()> arrange;
    int code;
    std::vector<std::string> calls;
  } cases[] = {
      {rule_get_v1, R"({"id": "9"})", [] {}, 6102, {"KOVAPerfEventConfListGet 9"}},
      {rule_get_v1, R"({"id": "1"})", no_list, 6102, {get}},
      {rule_get_v1, R"({"id": "1"})", empty_list, 6102, {get, kFree}},
      {rule_set_v1, R"({"id": "9", "service": "x"})", [] {}, 6107, {}},
      {rule_set_v1, R"({"service": "x"})", duplicate, 6106, {"KOVAPerfEventConfAdd"}},
      {rule_set_v1, R"({"id": "1"})", duplicate, 6106, {get, "KOVAPerfEventConfSet 1", kFree}},
      {rule_set_v1, R"({"service": "x"})", store_fails, 6102, {"KOVAPerfEventConfAdd"}},
      {rule_set_v1, R"({"id": "1"})", store_fails, 6102, {get, "KOVAPerfEventConfSet 1", kFree}},
      {rule_set_v1, R"({"id": "1"})", no_list, 6102, {get}},
      {rule_set_v1, R"({"id": "1"})", empty_list, 6102, {get, kFree}},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    Seed(1, "smb");
    const std::vector<std::string> before = StoredRules();
    c.arrange();
    KOVA::APIResponse response = CallHandler(c.handler, c.params);
    EXPECT_EQ(response.GetErrorCode(), c.code) << c.params;
    EXPECT_EQ(response.GetData(), ParseJson(R"({"err_line": 143, "err_msg": "PGSQL Disable",
        "err_session": "error", "err_key": "db_connect_fail"})"))
        << c.params;
    EXPECT_THAT(kova_fake::Calls(), ElementsAreArray(c.calls)) << c.params;
    EXPECT_EQ(StoredRules(), before) << c.params;
    ExpectListsFreed(c.params);
  }
}

// Rule "1" is stored beforehand; a create adds rule "2".
TEST_F(EventRuleTest, SetWritesEveryFieldOnCreateAndChange) {
  const std::string long_service(200, 's');
  const struct {
    std::string params;
    std::string stored;
  } cases[] = {
      {"{}", "2:0::0:0:0:5:30:0"},
      {R"({"id": null, "service": null, "type": null, "enable": null})", "2:0::0:0:0:5:30:0"},
      {R"({"service": "nfs", "type": 1, "severity": 2, "resource": 3, "threshold": 90,
          "enable": true})",
       "2:1:nfs:3:2:90:5:30:1"},
      {R"({"id": "1"})", "1:0::0:0:0:5:30:0"},
      {R"({"id": "1", "service": "iscsi", "type": 7, "severity": -1, "resource": 4,
          "threshold": 2.0, "enable": false})",
       "1:7:iscsi:4:-1:2:5:30:0"},
      {R"({"id": "1", "service": ")" + long_service + "\"}",
       "1:0:" + long_service.substr(0, 127) + ":0:0:0:5:30:0"},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    Seed(1, "smb");
    KOVA::APIResponse response = CallHandler(rule_set_v1, c.params);
    EXPECT_EQ(response.GetSettleCount(), 1);
    EXPECT_EQ(response.GetState(), KOVA::APIResponse::State::kSuccess) << c.params;
    EXPECT_TRUE(response.GetData().isNull());
    const bool change = c.stored[0] == '1';
    std::vector<std::string> stored{c.stored};
    if (!change) stored.insert(stored.begin(), "1:1:smb:1:2:80:1:2:1");
    EXPECT_EQ(StoredRules(), stored) << c.params;
    const std::vector<std::string> calls =
        change ? std::vector<std::string>{"KOVAPerfEventConfListGet 1", "KOVAPerfEventConfSet 1",
                                          kReload, kFree}
               : std::vector<std::string>{"KOVAPerfEventConfAdd", kReload};
    EXPECT_THAT(kova_fake::Calls(), ElementsAreArray(calls)) << c.params;
    ExpectListsFreed(c.params);
  }
}

TEST_F(EventRuleTest, DeleteSkipsWhatIsNoStoredId) {
  for (const char* service : {"a", "b", "c"}) Seed(0, service);
  EXPECT_EQ(CallHandler(rule_delete_v1,
                        R"({"id_list": [12, "1", null, "9", {"id": "2"}, ["3"], "3", "1"]})")
                .GetState(),
            KOVA::APIResponse::State::kSuccess);
  EXPECT_THAT(kova_fake::Calls(),
              ElementsAre("KOVAPerfEventConfDelete 1", "KOVAPerfEventConfDelete 3", kReload));
  ASSERT_EQ(kova_fake::Rules().size(), 1u);
  EXPECT_STREQ(kova_fake::Rules()[0].id, "2");
}

TEST_F(EventRuleTest, OnOffSwitchesOnlyValidElementsOfStoredRules) {
  Seed(0, "a", 0);
  Seed(0, "b", 1);
  Seed(0, "c", 1);
  KOVA::APIResponse response = CallHandler(rule_onoff_v1, R"({"id_list": [
      {"id": "1", "enable": true}, {"id": "2"}, {"enable": false}, "3", 3, null, [],
      {"id": 3, "enable": false}, {"id": "3", "enable": 0}, {"id": "9", "enable": false},
      {"id": "2", "enable": false}]})");
  EXPECT_EQ(response.GetState(), KOVA::APIResponse::State::kSuccess);
  EXPECT_THAT(StoredRules(),
              ElementsAre("1:0:a:1:2:80:1:2:1", "2:0:b:1:2:80:1:2:0", "3:0:c:1:2:80:1:2:1"));
  EXPECT_THAT(kova_fake::Calls(),
              ElementsAre("KOVAPerfEventConfListGet 1", "KOVAPerfEventConfSet 1", kFree,
                          "KOVAPerfEventConfListGet 2", "KOVAPerfEventConfSet 2", kFree, kReload));
  const std::vector<std::string> log = ErrorLog();
  EXPECT_EQ(log.size(), 8u);
  EXPECT_THAT(
      log,
      Each(MatchesRegex("EventRule:[0-9]+ obj is not valid, it should contain 'id' & 'enable'")));
}

TEST_F(EventRuleTest, OnOffGoesOnAfterARuleItCannotSwitch) {
  const struct {
    std::function<void()> arrange;
    std::vector<std::string> log;
  } cases[] = {
      {[] { kova_fake::FailRuleWrite(KOVA_ERR_STORE); },
       {"EventRule:[0-9]+ Failed to enable \\[1\\]'s enable \\(true\\)",
        "EventRule:[0-9]+ Failed to enable \\[2\\]'s enable \\(false\\)"}},
      {[] { kova_fake::SetRuleListAnswer(RuleListAnswer::kNull); }, {}},
      {[] { kova_fake::SetRuleListAnswer(RuleListAnswer::kEmptyHead); }, {}},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    Seed(0, "a", 0);
    Seed(0, "b", 1);
    c.arrange();
    const std::vector<std::string> before = StoredRules();
    CallHandler(rule_onoff_v1,
                R"({"id_list": [{"id": "1", "enable": true}, {"id": "2", "enable": false}]})");
    EXPECT_EQ(StoredRules(), before);
    const std::vector<std::string> log = ErrorLog();
    ASSERT_EQ(log.size(), c.log.size());
    for (size_t i = 0; i < log.size(); ++i) EXPECT_THAT(log[i], MatchesRegex(c.log[i]));
    const auto& calls = kova_fake::Calls();
    EXPECT_EQ(std::count(calls.begin(), calls.end(), "KOVAPerfEventConfListGet 2"), 1);
    EXPECT_EQ(calls.back(), kReload);
    ExpectListsFreed(std::to_string(c.log.size()));
  }
}

TEST_F(EventRuleTest, WritersReloadOnceAndOnlyLogAFailedReload) {
  const struct {
    APIHandler handler;
    const char* params;
  } cases[] = {
      {rule_set_v1, "{}"},
      {rule_set_v1, R"({"id": "1", "enable": true})"},
      {rule_delete_v1, R"({"id_list": ["1", "1"]})"},
      {rule_delete_v1, R"({"id_list": []})"},
      {rule_onoff_v1, R"({"id_list": [{"id": "1", "enable": false}, {"id": "1"}]})"},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    Seed(0, "a");
    kova_fake::FailService("kovaperfeventd", "reload", -1);
    EXPECT_EQ(CallHandler(c.handler, c.params).GetState(), KOVA::APIResponse::State::kSuccess)
        << c.params;
    const auto& calls = kova_fake::Calls();
    EXPECT_EQ(std::count(calls.begin(), calls.end(), kReload), 1) << c.params;
    const std::vector<std::string> log = ErrorLog();
    ASSERT_FALSE(log.empty()) << c.params;
    EXPECT_THAT(log.back(), MatchesRegex("EventRule:[0-9]+ Failed to reload kovaperfeventd "
                                         "\\[0x1001 fake_system.cc:[0-9]+\\]"));
  }
}

TEST_F(EventRuleTest, ListCutsThePageAndCountsAllRules) {
  const struct {
    const char* params;
    std::vector<std::string> ids;
  } cases[] = {
      {"{}", {"1", "2", "3", "4", "5"}},
      {R"({"offset": 2, "limit": 3})", {"3", "4", "5"}},
      {R"({"offset": 1, "limit": 2})", {"2", "3"}},
      {R"({"offset": 4, "limit": 10})", {"5"}},
      {R"({"limit": 0})", {}},
      {R"({"offset": 5})", {}},
      {R"({"offset": 6, "limit": 1})", {}},
      {R"({"offset": -1})", {}},
      {R"({"offset": 1e12})", {}},
      {R"({"offset": 3.0, "limit": -7})", {"4", "5"}},
      {R"({"offset": null, "limit": null})", {"1", "2", "3", "4", "5"}},
  };
  for (const char* service : {"a", "b", "c", "d", "e"}) Seed(0, service);
  kova_fake::SetConf("/etc/kovainfo.conf", kSupportKey, "yes");
  for (const auto& c : cases) {
    const Json::Value data = CallHandler(rule_list_v1, c.params).GetData();
    EXPECT_EQ(data["total"].type(), Json::uintValue);
    EXPECT_EQ(data["total"].asUInt(), 5u) << c.params;
    EXPECT_TRUE(data["rules"].isArray()) << c.params;
    std::vector<std::string> ids;
    for (const Json::Value& rule : data["rules"]) ids.push_back(rule["id"].asString());
    EXPECT_EQ(ids, c.ids) << c.params;
    EXPECT_EQ(data["support_internal"], 1);
  }
  ExpectListsFreed("list");
}

TEST_F(EventRuleTest, ListPassesSupportThroughAndShowsNoRulesFromAnEmptyAnswer) {
  const struct {
    const char* support;  // the stored switch; null: reading the file fails
    RuleListAnswer answer;
    int support_internal;
  } cases[] = {
      {"no", RuleListAnswer::kRules, 0},
      {"Yes", RuleListAnswer::kNull, 0},
      {nullptr, RuleListAnswer::kEmptyHead, -2},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    Seed(0, "a");
    kova_fake::SetRuleListAnswer(c.answer);
    if (c.support) kova_fake::SetConf("/etc/kovainfo.conf", kSupportKey, c.support);
    if (!c.support) kova_fake::FailConfRead("/etc/kovainfo.conf", -2);
    const Json::Value data = CallHandler(rule_list_v1, R"({"offset": 1})").GetData();
    EXPECT_EQ(data["total"].asUInt(), c.answer == RuleListAnswer::kRules ? 1u : 0u);
    EXPECT_EQ(data["rules"], Json::Value(Json::arrayValue));
    EXPECT_EQ(data["support_internal"], c.support_internal);
    ExpectListsFreed(std::to_string(c.support_internal));
  }
  // The reader appends to what the vector holds.
  kova_fake::SetRuleListAnswer(RuleListAnswer::kRules);
  std::vector<Json::Value> rules{Json::Value("kept")};
  ListEventRules("enu", rules);
  ASSERT_EQ(rules.size(), 2u);
  EXPECT_EQ(rules[0], "kept");
}

// Writes to the store need root; the host process runs with lowered effective ids.
TEST_F(EventRuleTest, WritersRaiseTheProcessAndReadersDoNot) {
  if (getuid() != 0) GTEST_SKIP() << "needs root to change effective ids";
  EXPECT_TRUE(kova_fake::RunInChild([] {
    Seed(0, "a");
    ASSERT_EQ(setresgid(-1, 65534, -1), 0);
    ASSERT_EQ(setresuid(-1, 65534, -1), 0);
    CallHandler(rule_list_v1);
    CallHandler(rule_get_v1, R"({"id": "1"})");
    EXPECT_THAT(kova_fake::Syslog(), IsEmpty());
    CallHandler(rule_set_v1, R"({"id": "1", "enable": true})");
    CallHandler(rule_set_v1, "{}");
    CallHandler(rule_onoff_v1, R"({"id_list": [{"id": "1", "enable": false}]})");
    CallHandler(rule_delete_v1, R"({"id_list": ["1", "2"]})");
    EXPECT_EQ(geteuid(), 65534u);
    EXPECT_EQ(getegid(), 65534u);
    EXPECT_TRUE(kova_fake::Rules().empty());
    EXPECT_EQ(kova_fake::UnprivilegedRuleWrites(), 0);
  }));
}

}  // namespace
