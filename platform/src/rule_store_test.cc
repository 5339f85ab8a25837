#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "kova/error.h"
#include "kova/perfevent.h"
#include "test_support/perfevent_rule.h"
#include "test_support/test_root.h"

namespace {

using kova_test::PerfEventRule;

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
    KOVAPERFEVENT_CONF_SETTING rule = PerfEventRule(
        PERFEVENT_TYPE_SERVICE, service, PERFEVENT_RESOURCE_CPU, PERFEVENT_SEVERITY_WARNING);
    ASSERT_EQ(KOVAPerfEventConfAdd(&rule), 0);
  }
  EXPECT_EQ(Listed(), (std::vector<std::string>{"1:smb", "2:nfs", "3:web"}));
  ASSERT_EQ(KOVAPerfEventConfDelete("2"), 0);
  EXPECT_EQ(KOVAPerfEventConfDelete("2"), -1);
  KOVAPERFEVENT_CONF_SETTING added =
      PerfEventRule(PERFEVENT_TYPE_ISCSI_LUN, "lun-uuid", PERFEVENT_RESOURCE_IO_RATE, 2, 5000);
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
  KOVAPERFEVENT_CONF_SETTING rule = PerfEventRule(
      PERFEVENT_TYPE_SYSTEM, "", PERFEVENT_RESOURCE_MEMORY, PERFEVENT_SEVERITY_CRITICAL);
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
  KOVAPERFEVENT_CONF_SETTING first = PerfEventRule(
      PERFEVENT_TYPE_SERVICE, "smb", PERFEVENT_RESOURCE_CPU, PERFEVENT_SEVERITY_WARNING, 80);
  KOVAPERFEVENT_CONF_SETTING critical = PerfEventRule(
      PERFEVENT_TYPE_SERVICE, "smb", PERFEVENT_RESOURCE_CPU, PERFEVENT_SEVERITY_CRITICAL, 95);
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

// The store keeps whatever a rule's fields hold, also what the daemon can't
// measure (it skips those), and refuses only what is no record.
TEST(RuleStoreTest, KeepsRulesTheDaemonCannotMeasureAndRefusesNonRecords) {
  kova_test::TestRoot root;
  const struct {
    const char* name;
    void (*change)(KOVAPERFEVENT_CONF_SETTING&);
    bool kept;
  } cases[] = {
      {"all fields left at zero",
       [](auto& r) {
         r = KOVAPERFEVENT_CONF_SETTING{};
         r.preset_a = 5;
         r.preset_b = 30;
       },
       true},
      {"a service without a name", [](auto& r) { memset(r.service, 0, sizeof(r.service)); }, true},
      {"a service's I/O", [](auto& r) { r.resource = PERFEVENT_RESOURCE_IO_RATE; }, true},
      {"a LUN's CPU", [](auto& r) { r.type = PERFEVENT_TYPE_ISCSI_LUN; }, true},
      {"an unknown type", [](auto& r) { r.type = static_cast<KOVAPERFEVENT_EVENT_TYPE>(7); }, true},
      {"an unknown severity", [](auto& r) { r.severity = 3; }, true},
      {"a percentage above 100", [](auto& r) { r.threshold = 101; }, true},
      {"a negative threshold", [](auto& r) { r.threshold = -1; }, true},
      {"no terminator", [](auto& r) { memset(r.service, 'x', sizeof(r.service)); }, false},
      {"enable 2", [](auto& r) { r.enable = 2; }, false},
      {"no sampling period", [](auto& r) { r.preset_a = 0; }, false},
      {"a negative duration", [](auto& r) { r.preset_b = -1; }, false},
  };
  // Each kept rule gets a service text of its own, so none repeats another.
  int service = 0;
  KOVAPERFEVENT_CONF_SETTING stored = PerfEventRule(
      PERFEVENT_TYPE_SERVICE, "base", PERFEVENT_RESOURCE_CPU, PERFEVENT_SEVERITY_WARNING);
  ASSERT_EQ(KOVAPerfEventConfAdd(&stored), 0);
  for (const auto& c : cases) {
    KOVAPERFEVENT_CONF_SETTING rule = PerfEventRule(
        PERFEVENT_TYPE_SERVICE, "", PERFEVENT_RESOURCE_CPU, PERFEVENT_SEVERITY_WARNING);
    snprintf(rule.service, sizeof(rule.service), "s%d", ++service);
    c.change(rule);
    KOVAPERFEVENT_CONF_SETTING added = rule;
    if (!c.kept) {
      EXPECT_EQ(KOVAPerfEventConfAdd(&added), -1) << c.name;
      EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_INVALID) << c.name;
    } else {
      ASSERT_EQ(KOVAPerfEventConfAdd(&added), 0) << c.name;
      // What is read back is what was written.
      KovaPerfEventConfSettingNode* list = KOVAPerfEventConfListGet(added.id);
      ASSERT_NE(list, nullptr) << c.name;
      EXPECT_EQ(memcmp(list->setting, &added, sizeof(added)), 0) << c.name;
      KOVAPerfEventConfListFree(list);
      ASSERT_EQ(KOVAPerfEventConfDelete(added.id), 0) << c.name;
    }
    // A change of a stored rule is judged alike.
    memcpy(rule.id, stored.id, sizeof(rule.id));
    EXPECT_EQ(KOVAPerfEventConfSet(&rule), c.kept ? 0 : -1) << c.name;
    if (!c.kept) {
      EXPECT_EQ(QLIBCErrGet(), KOVA_ERR_INVALID) << c.name;
    }
  }
  EXPECT_EQ(KOVAPerfEventConfAdd(nullptr), -1);
  EXPECT_EQ(KOVAPerfEventConfSet(nullptr), -1);
}

}  // namespace
