#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "kova/error.h"
#include "kova/perfevent.h"
#include "test_support/test_root.h"

namespace {

KOVAPERFEVENT_CONF_SETTING Rule(KOVAPERFEVENT_EVENT_TYPE type, const char* service,
                                int32_t resource, int32_t severity, int32_t threshold = 80) {
  KOVAPERFEVENT_CONF_SETTING rule{};
  rule.type = type;
  snprintf(rule.service, sizeof(rule.service), "%s", service);
  rule.resource = resource;
  rule.severity = severity;
  rule.threshold = threshold;
  rule.preset_a = 5;
  rule.preset_b = 30;
  rule.enable = 1;
  return rule;
}

// The ids and objects of all rules, in list order.
std::vector<std::string> Listed() {
  std::vector<std::string> out;
  KovaPerfEventConfSettingNode* head = KOVAPerfEventConfListGet(nullptr);
  EXPECT_NE(head, nullptr);
  for (auto* node = head; node != nullptr && node->setting != nullptr; node = node->next) {
    out.push_back(std::string(node->setting->id) + ":" + node->setting->service);
  }
  KOVAPerfEventConfListFree(head);
  return out;
}

TEST(RuleStoreTest, AssignsIdsThatAreNeverReusedAndListsInCreationOrder) {
  kova_test::TestRoot root;
  EXPECT_EQ(Listed(), std::vector<std::string>());  // no store yet: an empty list
  EXPECT_EQ(KOVAPerfEventConfListGet("1"), nullptr);
  for (const char* service : {"smb", "nfs", "web"}) {
    KOVAPERFEVENT_CONF_SETTING rule =
        Rule(PERFEVENT_TYPE_SERVICE, service, PERFEVENT_RESOURCE_CPU, PERFEVENT_SEVERITY_WARNING);
    ASSERT_EQ(KOVAPerfEventConfAdd(&rule), 0);
  }
  EXPECT_EQ(Listed(), (std::vector<std::string>{"1:smb", "2:nfs", "3:web"}));
  ASSERT_EQ(KOVAPerfEventConfDelete("2"), 0);
  EXPECT_EQ(KOVAPerfEventConfDelete("2"), -1);
  KOVAPERFEVENT_CONF_SETTING added =
      Rule(PERFEVENT_TYPE_ISCSI_LUN, "lun-uuid", PERFEVENT_RESOURCE_IO_RATE, 2, 5000);
  ASSERT_EQ(KOVAPerfEventConfAdd(&added), 0);
  EXPECT_STREQ(added.id, "4");
  EXPECT_EQ(Listed(), (std::vector<std::string>{"1:smb", "3:web", "4:lun-uuid"}));

  const struct {
    const char* id;
    int exists;
  } ids[] = {{"1", 1}, {"2", 0}, {"4", 1}, {"04", 0}, {"4x", 0}, {"", 0}, {nullptr, 0}};
  for (const auto& c : ids) EXPECT_EQ(KOVAPerfEventIsConfExisted(c.id), c.exists) << c.id;
}

TEST(RuleStoreTest, ChangesARecordOfAListInPlace) {
  kova_test::TestRoot root;
  KOVAPERFEVENT_CONF_SETTING rule =
      Rule(PERFEVENT_TYPE_SYSTEM, "", PERFEVENT_RESOURCE_MEMORY, PERFEVENT_SEVERITY_CRITICAL);
  ASSERT_EQ(KOVAPerfEventConfAdd(&rule), 0);
  KovaPerfEventConfSettingNode* list = KOVAPerfEventConfListGet(rule.id);
  ASSERT_NE(list, nullptr);
  ASSERT_NE(list->setting, nullptr);
  EXPECT_EQ(memcmp(list->setting, &rule, sizeof(rule)), 0);
  EXPECT_EQ(list->next, nullptr);
  list->setting->enable = 0;
  list->setting->threshold = 95;
  ASSERT_EQ(KOVAPerfEventConfSet(list->setting), 0);
  KOVAPerfEventConfListFree(list);

  list = KOVAPerfEventConfListGet(rule.id);
  ASSERT_NE(list, nullptr);
  EXPECT_EQ(list->setting->enable, 0);
  EXPECT_EQ(list->setting->threshold, 95);
  KOVAPerfEventConfListFree(list);
  KOVAPerfEventConfListFree(nullptr);

  KOVAPERFEVENT_CONF_SETTING unknown = rule;
  strcpy(unknown.id, "77");
  EXPECT_EQ(KOVAPerfEventConfSet(&unknown), -1);
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_NOT_FOUND);
}

TEST(RuleStoreTest, RefusesDuplicatesOfObjectResourceAndSeverity) {
  kova_test::TestRoot root;
  KOVAPERFEVENT_CONF_SETTING first =
      Rule(PERFEVENT_TYPE_SERVICE, "smb", PERFEVENT_RESOURCE_CPU, PERFEVENT_SEVERITY_WARNING, 80);
  KOVAPERFEVENT_CONF_SETTING critical =
      Rule(PERFEVENT_TYPE_SERVICE, "smb", PERFEVENT_RESOURCE_CPU, PERFEVENT_SEVERITY_CRITICAL, 95);
  ASSERT_EQ(KOVAPerfEventConfAdd(&first), 0);
  ASSERT_EQ(KOVAPerfEventConfAdd(&critical), 0);

  KOVAPERFEVENT_CONF_SETTING again = first;
  again.threshold = 50;
  memset(again.id, 0, sizeof(again.id));
  EXPECT_EQ(KOVAPerfEventConfAdd(&again), -1);
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_PERFEVENT_DUPLICATE);
  EXPECT_STREQ(again.id, "");

  critical.severity = PERFEVENT_SEVERITY_WARNING;  // would now repeat the first
  EXPECT_EQ(KOVAPerfEventConfSet(&critical), -1);
  EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_PERFEVENT_DUPLICATE);
  EXPECT_EQ(Listed(), (std::vector<std::string>{"1:smb", "2:smb"}));
}

TEST(RuleStoreTest, RefusesRulesTheDaemonCannotWatch) {
  kova_test::TestRoot root;
  auto with = [](auto change) {
    KOVAPERFEVENT_CONF_SETTING rule =
        Rule(PERFEVENT_TYPE_SERVICE, "smb", PERFEVENT_RESOURCE_CPU, PERFEVENT_SEVERITY_WARNING);
    change(rule);
    return rule;
  };
  KOVAPERFEVENT_CONF_SETTING refused[] = {
      with([](auto& r) { r.resource = PERFEVENT_RESOURCE_IO_RATE; }),  // a service has no I/O
      with([](auto& r) { r.type = PERFEVENT_TYPE_ISCSI_LUN; }),        // a LUN has no CPU
      with([](auto& r) { r.severity = 3; }),
      with([](auto& r) { r.threshold = 101; }),
      with([](auto& r) { memset(r.service, 'x', sizeof(r.service)); }),  // no terminator
  };
  for (KOVAPERFEVENT_CONF_SETTING& rule : refused) {
    EXPECT_EQ(KOVAPerfEventConfAdd(&rule), -1);
    EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_INVALID);
  }
  EXPECT_EQ(KOVAPerfEventConfAdd(nullptr), -1);
  EXPECT_EQ(Listed(), std::vector<std::string>());
}

}  // namespace
