// The test platform's rule store: rules in memory, lists allocated per call and
// tracked until freed.

#include <unistd.h>

#include <cstdio>
#include <cstring>

#include "common/rule_record.h"
#include "fake/fake_state.h"
#include "kova/error.h"
#include "kova/perfevent.h"

namespace kova_fake {

void FailRuleWrite(int error) { TheState().rule_write_error = error; }

std::string AddRule(KOVAPERFEVENT_CONF_SETTING rule) {
  snprintf(rule.id, sizeof(rule.id), "%d", TheState().next_rule_id++);
  TheState().rules.push_back(rule);
  return rule.id;
}

std::vector<KOVAPERFEVENT_CONF_SETTING> Rules() { return TheState().rules; }

void SetRuleListAnswer(RuleListAnswer answer) { TheState().rule_list_answer = answer; }

int OpenRuleLists() { return static_cast<int>(TheState().open_rule_lists.size()); }

int UnprivilegedRuleWrites() { return TheState().unprivileged_rule_writes; }

namespace {

KOVAPERFEVENT_CONF_SETTING* FindRule(const char* id) {
  for (auto& rule : TheState().rules) {
    if (id != nullptr && strcmp(rule.id, id) == 0) return &rule;
  }
  return nullptr;
}

// Records a write to the store, counting it when made without root rights.
void RecordWrite(const std::string& call) {
  Record(call);
  if (geteuid() != 0) ++TheState().unprivileged_rule_writes;
}

// Fails a write as arranged by FailRuleWrite.
bool WriteFails() {
  if (TheState().rule_write_error == 0) return false;
  KOVA_SET_ERROR(TheState().rule_write_error);
  return true;
}

// Refuses a record that is none, as the platform's store does.
bool NotARecord(const KOVAPERFEVENT_CONF_SETTING* setting) {
  if (setting != nullptr && kova::IsStorableRule(*setting)) return false;
  KOVA_SET_ERROR(KOVA_ERR_INVALID);
  return true;
}

// Refuses a rule that repeats the object, resource and severity of a stored
// rule other than `own` (null for a new rule), as the platform's store does.
bool Repeats(const KOVAPERFEVENT_CONF_SETTING& setting, const KOVAPERFEVENT_CONF_SETTING* own) {
  for (const auto& rule : TheState().rules) {
    if (&rule != own && kova::SameRuleKey(rule, setting)) {
      KOVA_SET_ERROR(KOVA_ERR_PERFEVENT_DUPLICATE);
      return true;
    }
  }
  return false;
}

}  // namespace
}  // namespace kova_fake

using kova_fake::RuleListAnswer;
using kova_fake::TheState;

KovaPerfEventConfSettingNode* KOVAPerfEventConfListGet(const char* id) {
  kova_fake::Record(id == nullptr ? "KOVAPerfEventConfListGet"
                                  : "KOVAPerfEventConfListGet " + std::string(id));
  std::vector<KOVAPERFEVENT_CONF_SETTING> found;
  if (id == nullptr) {
    found = TheState().rules;
  } else if (const KOVAPERFEVENT_CONF_SETTING* rule = kova_fake::FindRule(id)) {
    found.push_back(*rule);
  } else {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return nullptr;
  }
  if (TheState().rule_list_answer == RuleListAnswer::kNull) {
    KOVA_SET_ERROR(KOVA_ERR_STORE);
    return nullptr;
  }
  if (TheState().rule_list_answer == RuleListAnswer::kEmptyHead) found.clear();
  // An empty answer is a head without a record.
  auto* head = new KovaPerfEventConfSettingNode{nullptr, nullptr};
  KovaPerfEventConfSettingNode* tail = head;
  for (size_t i = 0; i < found.size(); ++i) {
    if (i > 0) tail = tail->next = new KovaPerfEventConfSettingNode{nullptr, nullptr};
    tail->setting = new KOVAPERFEVENT_CONF_SETTING(found[i]);
  }
  TheState().open_rule_lists.insert(head);
  return head;
}

void KOVAPerfEventConfListFree(KovaPerfEventConfSettingNode* head) {
  if (head == nullptr) return;
  if (TheState().open_rule_lists.erase(head) == 0) {
    kova_fake::Record("KOVAPerfEventConfListFree not open");
    return;
  }
  kova_fake::Record("KOVAPerfEventConfListFree");
  while (head != nullptr) {
    KovaPerfEventConfSettingNode* next = head->next;
    delete head->setting;
    delete head;
    head = next;
  }
}

int KOVAPerfEventIsConfExisted(const char* id) { return kova_fake::FindRule(id) != nullptr; }

int KOVAPerfEventConfAdd(KOVAPERFEVENT_CONF_SETTING* setting) {
  kova_fake::RecordWrite("KOVAPerfEventConfAdd");
  if (kova_fake::WriteFails()) return -1;
  if (kova_fake::NotARecord(setting) || kova_fake::Repeats(*setting, nullptr)) return -1;
  snprintf(setting->id, sizeof(setting->id), "%d", TheState().next_rule_id++);
  TheState().rules.push_back(*setting);
  return 0;
}

int KOVAPerfEventConfSet(const KOVAPERFEVENT_CONF_SETTING* setting) {
  kova_fake::RecordWrite(std::string("KOVAPerfEventConfSet ") +
                         (setting != nullptr ? setting->id : "(null)"));
  if (kova_fake::WriteFails() || kova_fake::NotARecord(setting)) return -1;
  KOVAPERFEVENT_CONF_SETTING* stored = kova_fake::FindRule(setting->id);
  if (stored == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return -1;
  }
  if (kova_fake::Repeats(*setting, stored)) return -1;
  *stored = *setting;
  return 0;
}

int KOVAPerfEventConfDelete(const char* id) {
  kova_fake::RecordWrite(std::string("KOVAPerfEventConfDelete ") + id);
  auto& rules = TheState().rules;
  for (auto it = rules.begin(); it != rules.end(); ++it) {
    if (strcmp(it->id, id) == 0) {
      rules.erase(it);
      return 0;
    }
  }
  KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
  return -1;
}
