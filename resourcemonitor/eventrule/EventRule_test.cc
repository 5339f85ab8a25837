#include "eventrule/EventRule.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdio>
#include <functional>
#include <map>
#include <ostream>
#include <regex>
#include <tuple>

#include "fake/kova_fake.h"
#include "kova/conf.h"
#include "kova/error.h"
#include "setting/resource_api.h"
#include "test_support/host_call.h"
#include "test_support/run_in_child.h"

namespace {

using kova_fake::RuleListAnswer;
using kova_test::CallHandler;
using kova_test::ParseJson;
using Strings = std::vector<std::string>;

constexpr char kReloadFailed[] =
    "EventRule:N Failed to reload kovaperfeventd [0x1001 fake_system.cc:N]";
constexpr char kInfo[] = "/var/packages/Foo/INFO";
constexpr char kSupportKey[] = "support_performance_event_internal";

// Arrangements of the rule store shared by the tables.
const std::function<void()> kAsIs = [] {};
const std::function<void()> kDuplicate = [] { kova_fake::FailRuleWrite(0x2300); };
const std::function<void()> kStoreFails = [] { kova_fake::FailRuleWrite(KOVA_ERR_STORE); };
const std::function<void()> kNoList = [] { kova_fake::SetRuleListAnswer(RuleListAnswer::kNull); };
const std::function<void()> kEmptyList = [] {
  kova_fake::SetRuleListAnswer(RuleListAnswer::kEmptyHead);
};

// The in-process LUN API: the data it answers for each uuid; other uuids fail.
std::map<std::string, Json::Value> gLuns;
std::string gLunUser;
void LunGet(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  gLunUser = request->GetUser();
  auto lun = gLuns.find(request->GetParam("uuid", Json::Value()).asString());
  if (lun == gLuns.end()) return response->SetError(6102, Json::Value());
  response->SetSuccess(lun->second);
}

class EventRuleTest : public ::testing::Test {
 protected:
  void SetUp() override { kova_fake::Reset(); }
};

// Stores a rule with every field set; its presets differ from the written ones.
void Seed(int type, const char* service, int enable = 1) {
  KOVAPERFEVENT_CONF_SETTING rule{
      {}, static_cast<KOVAPERFEVENT_EVENT_TYPE>(type), {}, 1, 2, 80, 1, 2, enable};
  snprintf(rule.service, sizeof(rule.service), "%s", service);
  kova_fake::AddRule(rule);
}

// A stored rule, field by field.
struct Rule {
  std::string id;
  int type;
  std::string service;
  int resource, severity, threshold, preset_a, preset_b, enable;
  bool operator==(const Rule&) const = default;
};
using Rules = std::vector<Rule>;

std::ostream& operator<<(std::ostream& out, const Rule& r) {
  return out << "{" << r.id << " type " << r.type << " " << r.service << " resource " << r.resource
             << " severity " << r.severity << " threshold " << r.threshold << " presets "
             << r.preset_a << "/" << r.preset_b << " enable " << r.enable << "}";
}

Rules StoredRules() {
  Rules rules;
  for (const KOVAPERFEVENT_CONF_SETTING& r : kova_fake::Rules()) {
    rules.push_back({r.id, r.type, r.service, r.resource, r.severity, r.threshold, r.preset_a,
                     r.preset_b, r.enable});
  }
  return rules;
}

// The two rules each table starts from: 1 off, 2 on.
const Rule kOff1{"1", 0, "x", 1, 2, 80, 1, 2, 0};
const Rule kOn2{"2", 0, "y", 1, 2, 80, 1, 2, 1};
const Rule kOn1{"1", 0, "x", 1, 2, 80, 1, 2, 1};
const Rule kOff2{"2", 0, "y", 1, 2, 80, 1, 2, 0};
const Rules kSeeded = {kOff1, kOn2};

void SeedTwo() {
  Seed(0, "x", 0);
  Seed(0, "y", 1);
}

// Lines logged at error priority, with source lines written as "N".
Strings ErrorLog() {
  Strings lines;
  for (const auto& line : kova_fake::Syslog()) {
    if (line.priority != LOG_ERR) continue;
    lines.push_back(std::regex_replace(line.text, std::regex(":[0-9]+"), ":N"));
  }
  return lines;
}

// Every list handed out was freed, and only once.
void ExpectListsFreed(const std::string& label) {
  EXPECT_EQ(kova_fake::OpenRuleLists(), 0) << label;
  EXPECT_THAT(kova_fake::Calls(),
              ::testing::Not(::testing::Contains("KOVAPerfEventConfListFree not open")))
      << label;
}

TEST_F(EventRuleTest, TranslateNameFallsBackAtEachStep) {
  const APITableEntry luns[] = {{"KOVA.Core.ISCSI.LUN", 1, "get", LunGet}, {}};
  ASSERT_EQ(KOVA::APIRunner::Register(luns, nullptr), 1);
  gLuns = {{"u1", ParseJson(R"({"lun": {"name": "LUN 1"}})")},
           {"u3", ParseJson(R"({"lun": "LUN 1"})")}};
  kova_fake::SetServiceDisplayName("smb", "File Service");
  kova_fake::SetServiceDisplayName("foo", "pkgctl-Foo");
  kova_fake::SetConf(kInfo, "displayname_ger", "DE");
  kova_fake::SetConf(kInfo, "displayname", "Foo");
  const std::string long_language = "abcdefghijklmnopqrstuvwxy";
  kova_fake::SetConf(kInfo, "displayname_" + long_language, "Full");
  kova_fake::SetConf(kInfo, "displayname_abcdefghijklmnopqrs", "Cut");
  // type, object, language, display name
  const std::tuple<int, const char*, std::string, const char*> cases[] = {
      {1, "smb", "enu", "File Service"},
      {1, "nfs", "enu", "nfs"},
      {1, "foo", "ger", "DE"},
      {1, "foo", "enu", "Foo"},
      // Without a display name the package name comes from the empty buffer, and
      // neither INFO key is found.
      {1, "pkgctl-Foo", "enu", "pkgctl-Foo"},
      // The key keeps 19 characters of the language.
      {1, "foo", long_language, "Cut"},
      {2, "u1", "enu", "LUN 1"},
      {2, "u2", "enu", "u2"},
      {2, "u3", "enu", ""},
      {0, "smb", "enu", "smb"},
  };
  for (const auto& [type, object, language, name] : cases) {
    EXPECT_EQ(translateName(language, static_cast<KOVAPERFEVENT_EVENT_TYPE>(type), object), name)
        << object << " " << language;
  }
  EXPECT_EQ(gLunUser, "admin");
  KOVA::APIRunner::Unregister(luns);
}

TEST_F(EventRuleTest, GetAnswersTheRuleObjectOnForExactlyOne) {
  for (int enable : {1, 2}) {
    kova_fake::Reset();
    Seed(0, "other");
    Seed(1, "foo", enable);
    kova_fake::SetServiceDisplayName("foo", "pkgctl-Foo");
    kova_fake::SetConf(kInfo, "displayname_ger", "Foo DE");
    Json::Value expected = ParseJson(R"({"id": "2", "enable": true, "service": "foo",
        "name": "Foo DE", "type": 1, "severity": 2, "resource": 1, "threshold": 80})");
    expected["enable"] = enable == 1;
    EXPECT_EQ(CallHandler(rule_get_v1, R"({"id": "2"})", "ger").GetData(), expected) << enable;
    ExpectListsFreed("get");
  }
}

// One call of a handler on rules 1 and 2 while the daemon's reload fails.
struct HandlerRow {
  std::string params;
  std::function<void()> arrange;
  int code;  // 0: success
  Rules stored;
  Strings error_log;
};

// A Setting failure fills the record first: the rule paths set only its code,
// so a rule error answers the rest of what that failure left.
void RunHandlerRows(APIHandler handler, const std::vector<HandlerRow>& rows) {
  kova_fake::SetVolumeLookup("pgsql", 1, "/volume1");
  ASSERT_EQ(CallHandler(set_v1, R"({"enable_history": true})").GetErrorCode(), 6104);
  const Json::Value earlier = ParseJson(R"({"err_line": 143, "err_msg": "PGSQL Disable",
      "err_session": "error", "err_key": "db_connect_fail"})");
  for (const HandlerRow& row : rows) {
    kova_fake::Reset();
    SeedTwo();
    kova_fake::FailService("kovaperfeventd", "reload", -1);
    row.arrange();
    KOVA::APIResponse response = CallHandler(handler, row.params);
    EXPECT_EQ(response.GetSettleCount(), 1) << row.params;
    EXPECT_EQ(response.GetErrorCode(), row.code) << row.params;
    const bool plain = row.code == 0 || row.code == 101;
    EXPECT_EQ(response.GetData(), plain ? Json::Value() : earlier) << row.params;
    EXPECT_EQ(StoredRules(), row.stored) << row.params;
    EXPECT_EQ(ErrorLog(), row.error_log) << row.params;
    ExpectListsFreed(row.params);
  }
}

const Strings kReloadFailedLog = {kReloadFailed};

TEST_F(EventRuleTest, GetAnswers101Or6102ForARuleItCannotName) {
  RunHandlerRows(rule_get_v1, {
                                  {"{}", kAsIs, 101, kSeeded, {}},
                                  {R"({"id": ""})", kAsIs, 101, kSeeded, {}},
                                  {R"({"id": "9"})", kAsIs, 6102, kSeeded, {}},
                                  {R"({"id": "1"})", kEmptyList, 6102, kSeeded, {}},
                              });
}

TEST_F(EventRuleTest, SetAddsOrChangesARuleAndReloadsTheDaemon) {
  const std::string s200(200, 's');
  const std::string full = R"({"service": ")" + s200 + R"(", "type": 1, "severity": 2,
      "resource": 3, "threshold": 90, "enable": true})";
  const Rule created{"3", 1, s200.substr(0, 127), 3, 2, 90, 5, 30, 1};
  const Rule blank3{"3", 0, "", 0, 0, 0, 5, 30, 0};
  const Rule blank2{"2", 0, "", 0, 0, 0, 5, 30, 0};
  RunHandlerRows(
      rule_set_v1,
      {
          {R"({"id": "9", "service": "x"})", kAsIs, 6107, kSeeded, {}},
          {R"({"service": "x"})", kDuplicate, 6106, kSeeded, {}},
          // The store refuses a rule that repeats another's object, resource and severity.
          {R"({"service": "x", "resource": 1, "severity": 2})", kAsIs, 6106, kSeeded, {}},
          {R"({"id": "1"})", kStoreFails, 6102, kSeeded, {}},
          {R"({"id": "1"})", kNoList, 6102, kSeeded, {}},
          {R"({"id": "1"})", kEmptyList, 6102, kSeeded, {}},
          {"{}", kAsIs, 0, {kOff1, kOn2, blank3}, kReloadFailedLog},
          {full, kAsIs, 0, {kOff1, kOn2, created}, kReloadFailedLog},
          // A change writes absent parameters as 0, empty or off.
          {R"({"id": "2"})", kAsIs, 0, {kOff1, blank2}, kReloadFailedLog},
      });
}

TEST_F(EventRuleTest, DeleteRemovesTheIdsItCanReadAndReloads) {
  RunHandlerRows(rule_delete_v1,
                 {
                     {"{}", kAsIs, 101, kSeeded, {}},
                     {R"({"id_list": "1"})", kAsIs, 101, kSeeded, {}},
                     {R"({"id_list": [12, "1", null, "9", {"id": "2"}, ["2"], "1"]})",
                      kAsIs,
                      0,
                      {kOn2},
                      kReloadFailedLog},
                     {R"({"id_list": []})", kAsIs, 0, kSeeded, kReloadFailedLog},
                 });
}

TEST_F(EventRuleTest, OnOffSwitchesEachValidPairAndLogsTheRest) {
  const char* both = R"({"id_list": [{"id": "1", "enable": true}, {"id": "2", "enable": false}]})";
  const char* mixed = R"({"id_list": [{"id": "1", "enable": true}, {"id": "2"}, {"enable": false},
      "2", {"id": ["1"], "enable": false}, {"id": "1", "enable": "false"},
      {"id": "9", "enable": false},
      {"id": "2", "enable": false}]})";
  Strings invalid(5, "EventRule:N obj is not valid, it should contain 'id' & 'enable'");
  invalid.push_back(kReloadFailed);
  const Strings failed = {"EventRule:N Failed to enable [1]'s enable (true)",
                          "EventRule:N Failed to enable [2]'s enable (false)", kReloadFailed};
  RunHandlerRows(rule_onoff_v1,
                 {
                     {R"({"id_list": {"id": "1", "enable": true}})", kAsIs, 101, kSeeded, {}},
                     {mixed, kAsIs, 0, {kOn1, kOff2}, invalid},
                     {both, kStoreFails, 0, kSeeded, failed},
                     {both, kNoList, 0, kSeeded, kReloadFailedLog},
                     {both, kEmptyList, 0, kSeeded, kReloadFailedLog},
                 });
}

// What a handler's answer shows: the ids of a page, or the id of a rule.
std::string Shown(const Json::Value& data) {
  if (!data.isObject()) return "";
  if (data.isMember("rules")) {
    std::string ids;
    for (const Json::Value& rule : data["rules"]) ids += rule["id"].asString() + " ";
    return ids;
  }
  return data.isMember("id") ? data["id"].asString() : "";
}

// Rules 1 (off) and 2 (on) are stored first. A parameter converts as the JSON
// library converts it; 101 answers only one that the library refuses.
TEST_F(EventRuleTest, ParametersConvertAsTheJsonLibraryDoes) {
  const struct {
    APIHandler handler;
    const char* params;
    int code;           // 0: success
    const char* shown;  // the ids of a page, or the id of a rule
    Rules stored;
  } cases[] = {
      {rule_get_v1, R"({"id": 2})", 0, "2", kSeeded},
      {rule_get_v1, R"({"id": true})", 6102, "", kSeeded},  // the text "true" names no rule
      {rule_get_v1, R"({"id": ["2"]})", 101, "", kSeeded},
      {rule_get_v1, R"({"id": {}})", 101, "", kSeeded},
      {rule_set_v1,
       R"({"id": 1, "enable": 1, "service": 7, "type": 1.9, "severity": true, "resource": -0.5,
           "threshold": 90.0})",
       0,
       "",
       {{"1", 1, "7", 0, 1, 90, 5, 30, 1}, kOn2}},
      {rule_set_v1,
       R"({"enable": null, "service": false, "type": null})",
       0,
       "",
       {kOff1, kOn2, {"3", 0, "false", 0, 0, 0, 5, 30, 0}}},
      {rule_set_v1, R"({"id": 2, "enable": "true"})", 101, "", kSeeded},
      {rule_set_v1, R"({"enable": [true]})", 101, "", kSeeded},
      {rule_set_v1, R"({"service": {"name": "smb"}})", 101, "", kSeeded},
      {rule_set_v1, R"({"resource": "1"})", 101, "", kSeeded},
      {rule_set_v1, R"({"threshold": 2147483648})", 101, "", kSeeded},
      {rule_set_v1, R"({"severity": -2147483649})", 101, "", kSeeded},
      {rule_set_v1, R"({"type": 1e300})", 101, "", kSeeded},
      {rule_set_v1, R"({"id": [1]})", 101, "", kSeeded},
      {rule_onoff_v1,
       R"({"id_list": [{"id": 2, "enable": 0}, {"id": "1", "enable": 1}]})",
       0,
       "",
       {kOn1, kOff2}},
      {rule_onoff_v1, R"({"id_list": [{"id": "2", "enable": null}]})", 0, "", {kOff1, kOff2}},
      {rule_list_v1, R"({"offset": true, "limit": 1.5})", 0, "2 ", kSeeded},
      {rule_list_v1, R"({"offset": "1"})", 101, "", kSeeded},
      {rule_list_v1, R"({"limit": 1e300})", 101, "", kSeeded},
  };
  for (const auto& c : cases) {
    kova_fake::Reset();
    SeedTwo();
    const KOVA::APIResponse response = CallHandler(c.handler, c.params);
    EXPECT_EQ(response.GetErrorCode(), c.code) << c.params;
    EXPECT_EQ(Shown(response.GetData()), c.shown) << c.params;
    EXPECT_EQ(StoredRules(), c.stored) << c.params;
    if (c.code == 101) {
      EXPECT_EQ(response.GetData(), Json::Value()) << c.params;
    }
    ExpectListsFreed(c.params);
  }
}

// Five rules are stored and the support switch is "yes" unless a case says otherwise.
TEST_F(EventRuleTest, ListCutsThePageCountsAllRulesAndPassesSupportThrough) {
  const auto support_off = [] { kova_fake::SetConf(kKovaInfoConf, kSupportKey, "no"); };
  const auto unreadable = [] { kova_fake::FailConfRead(kKovaInfoConf, -2); };
  // params, arrangement, "total", ids on the page, "support_internal"
  const std::tuple<const char*, std::function<void()>, unsigned, Strings, int> cases[] = {
      {"{}", kAsIs, 5, {"1", "2", "3", "4", "5"}, 1},
      {R"({"offset": 1, "limit": 3})", support_off, 5, {"2", "3", "4"}, 0},
      {R"({"limit": 0})", unreadable, 5, {}, -2},
      {R"({"offset": 5})", kAsIs, 5, {}, 1},
      {R"({"offset": -1})", kAsIs, 5, {}, 1},
      {R"({"offset": 3.0, "limit": -7})", kAsIs, 5, {"4", "5"}, 1},
      {"{}", kNoList, 0, {}, 1},
      {"{}", kEmptyList, 0, {}, 1},
  };
  for (const auto& [params, arrange, total, ids, support] : cases) {
    kova_fake::Reset();
    for (const char* service : {"a", "b", "c", "d", "e"}) Seed(0, service);
    kova_fake::SetConf(kKovaInfoConf, kSupportKey, "yes");
    arrange();
    const Json::Value data = CallHandler(rule_list_v1, params).GetData();
    EXPECT_EQ(data["total"], Json::Value(total)) << params;
    EXPECT_TRUE(data["rules"].isArray()) << params;
    Strings page;
    for (const Json::Value& rule : data["rules"]) page.push_back(rule["id"].asString());
    EXPECT_EQ(page, ids) << params;
    EXPECT_EQ(data["support_internal"], support) << params;
    ExpectListsFreed(params);
  }
  // The reader appends to what the vector holds.
  kova_fake::SetRuleListAnswer(RuleListAnswer::kRules);
  std::vector<Json::Value> rules{Json::Value("kept")};
  ListEventRules("enu", rules);
  EXPECT_EQ(rules.size(), 6u);
  EXPECT_EQ(rules[0], "kept");
}

// Writes to the store need root; the host process runs with lowered effective ids.
TEST_F(EventRuleTest, WritersRaiseTheProcessAndReadersDoNot) {
  if (getuid() != 0) GTEST_SKIP() << "needs root to change effective ids";
  EXPECT_TRUE(kova_test::RunInChild([] {
    Seed(0, "a");
    ASSERT_EQ(setresgid(-1, 65534, -1), 0);
    ASSERT_EQ(setresuid(-1, 65534, -1), 0);
    CallHandler(rule_list_v1);
    CallHandler(rule_get_v1, R"({"id": "1"})");
    EXPECT_THAT(kova_fake::Syslog(), ::testing::IsEmpty());
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
