// The rule store of the performance-event daemon, in SQLite.

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <string>

#include "common/rule_record.h"
#include "kova/error.h"
#include "kova/perfevent.h"
#include "src/privilege.h"
#include "src/sqlite_db.h"
#include "src/system_root.h"

namespace kova {
namespace {

constexpr char kStorePath[] = "/var/lib/kova/perfevent/rules.db";

// Ids are AUTOINCREMENT keys, so a deleted rule's id never comes back. The
// unique key is the one that KOVA_ERR_PERFEVENT_DUPLICATE reports.
constexpr char kSchema[] =
    "CREATE TABLE IF NOT EXISTS rules("
    "id INTEGER PRIMARY KEY AUTOINCREMENT, type INTEGER NOT NULL, service TEXT NOT NULL, "
    "resource INTEGER NOT NULL, severity INTEGER NOT NULL, threshold INTEGER NOT NULL, "
    "preset_a INTEGER NOT NULL, preset_b INTEGER NOT NULL, enable INTEGER NOT NULL, "
    "UNIQUE(type, service, resource, severity))";

constexpr char kColumns[] =
    "SELECT id, type, service, resource, severity, threshold, preset_a, preset_b, enable "
    "FROM rules";

// The rule id written in `text`, 0 when it is no id the store could have given.
int64_t ParseId(const char* text) {
  if (text == nullptr || text[0] < '1' || text[0] > '9' || strlen(text) > 18) return 0;
  for (const char* c = text; *c != '\0'; ++c) {
    if (*c < '0' || *c > '9') return 0;
  }
  return strtoll(text, nullptr, 10);
}

// Opens the store; a missing store is created only when `create` is set.
bool OpenStore(Database& db, bool create, bool& missing) {
  return db.Open(RootPath(kStorePath), create, kSchema, &missing);
}

KOVAPERFEVENT_CONF_SETTING* ReadRule(const Statement& row) {
  auto* rule = new (std::nothrow) KOVAPERFEVENT_CONF_SETTING{};
  if (rule == nullptr) return nullptr;
  snprintf(rule->id, sizeof(rule->id), "%lld", static_cast<long long>(row.Int(0)));
  rule->type = static_cast<KOVAPERFEVENT_EVENT_TYPE>(row.Int(1));
  const std::string_view service = row.Text(2);
  memcpy(rule->service, service.data(), std::min(service.size(), sizeof(rule->service) - 1));
  rule->resource = static_cast<int32_t>(row.Int(3));
  rule->severity = static_cast<int32_t>(row.Int(4));
  rule->threshold = static_cast<int32_t>(row.Int(5));
  rule->preset_a = static_cast<int32_t>(row.Int(6));
  rule->preset_b = static_cast<int32_t>(row.Int(7));
  rule->enable = static_cast<int32_t>(row.Int(8));
  return rule;
}

// Binds the fields of `rule` to ?1..?8 in column order, after the id.
void BindRule(Statement& statement, const KOVAPERFEVENT_CONF_SETTING& rule) {
  statement.Bind(1, rule.type)
      .Bind(2, std::string_view(rule.service, strnlen(rule.service, sizeof(rule.service))))
      .Bind(3, rule.resource)
      .Bind(4, rule.severity)
      .Bind(5, rule.threshold)
      .Bind(6, rule.preset_a)
      .Bind(7, rule.preset_b)
      .Bind(8, rule.enable);
}

// The platform error of a failed write: a duplicate or a store failure.
int WriteFailed(const Database& db) {
  const bool duplicate = sqlite3_extended_errcode(db.get()) == SQLITE_CONSTRAINT_UNIQUE;
  KOVA_SET_ERROR(duplicate ? KOVA_ERR_PERFEVENT_DUPLICATE : KOVA_ERR_STORE);
  return -1;
}

}  // namespace
}  // namespace kova

KovaPerfEventConfSettingNode* KOVAPerfEventConfListGet(const char* id) {
  const int64_t wanted = id != nullptr ? kova::ParseId(id) : 0;
  if (id != nullptr && wanted == 0) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return nullptr;
  }
  kova::RootScope root;
  kova::Database db;
  bool missing = false;
  const bool open = kova::OpenStore(db, false, missing);
  if (!open && !missing) {
    KOVA_SET_ERROR(KOVA_ERR_STORE);
    return nullptr;
  }
  auto* head = new (std::nothrow) KovaPerfEventConfSettingNode{nullptr, nullptr};
  if (head == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_NOMEM);
    return nullptr;
  }
  if (!open) {  // no store yet: no rules
    if (id == nullptr) return head;
    delete head;
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return nullptr;
  }
  const std::string sql = std::string(kova::kColumns) + (id ? " WHERE id = ?" : " ORDER BY id");
  kova::Statement select(db, sql.c_str());
  if (id != nullptr) select.Bind(1, wanted);
  KovaPerfEventConfSettingNode* tail = nullptr;
  int step;
  while ((step = select.Step()) == SQLITE_ROW) {
    KOVAPERFEVENT_CONF_SETTING* rule = kova::ReadRule(select);
    KovaPerfEventConfSettingNode* node =
        tail == nullptr ? head : new (std::nothrow) KovaPerfEventConfSettingNode{nullptr, nullptr};
    if (rule == nullptr || node == nullptr) {
      delete rule;
      KOVAPerfEventConfListFree(head);
      KOVA_SET_ERROR(KOVA_ERR_NOMEM);
      return nullptr;
    }
    node->setting = rule;
    if (tail != nullptr) tail->next = node;
    tail = node;
  }
  if (step != SQLITE_DONE || (id != nullptr && head->setting == nullptr)) {
    KOVAPerfEventConfListFree(head);
    KOVA_SET_ERROR(step != SQLITE_DONE ? KOVA_ERR_STORE : KOVA_ERR_NOT_FOUND);
    return nullptr;
  }
  return head;
}

void KOVAPerfEventConfListFree(KovaPerfEventConfSettingNode* head) {
  while (head != nullptr) {
    KovaPerfEventConfSettingNode* next = head->next;
    delete head->setting;
    delete head;
    head = next;
  }
}

int KOVAPerfEventIsConfExisted(const char* id) {
  const int64_t wanted = kova::ParseId(id);
  if (wanted == 0) return 0;
  kova::RootScope root;
  kova::Database db;
  bool missing = false;
  if (!kova::OpenStore(db, false, missing)) return 0;
  kova::Statement select(db, "SELECT 1 FROM rules WHERE id = ?");
  return select.Bind(1, wanted).Step() == SQLITE_ROW ? 1 : 0;
}

int KOVAPerfEventConfAdd(KOVAPERFEVENT_CONF_SETTING* setting) {
  if (setting == nullptr || !kova::IsStorableRule(*setting)) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  kova::RootScope root;
  kova::Database db;
  bool missing = false;
  if (!kova::OpenStore(db, true, missing)) {
    KOVA_SET_ERROR(KOVA_ERR_STORE);
    return -1;
  }
  kova::Statement insert(db,
                         "INSERT INTO rules(type, service, resource, severity, threshold, "
                         "preset_a, preset_b, enable) VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8)");
  kova::BindRule(insert, *setting);
  if (insert.Step() != SQLITE_DONE) return kova::WriteFailed(db);
  memset(setting->id, 0, sizeof(setting->id));
  snprintf(setting->id, sizeof(setting->id), "%lld",
           static_cast<long long>(sqlite3_last_insert_rowid(db.get())));
  return 0;
}

int KOVAPerfEventConfSet(const KOVAPERFEVENT_CONF_SETTING* setting) {
  if (setting == nullptr || !kova::IsStorableRule(*setting)) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  const int64_t id = kova::ParseId(setting->id);
  kova::RootScope root;
  kova::Database db;
  bool missing = false;
  if (id == 0 || !kova::OpenStore(db, false, missing)) {
    KOVA_SET_ERROR(id == 0 || missing ? KOVA_ERR_NOT_FOUND : KOVA_ERR_STORE);
    return -1;
  }
  kova::Statement update(db,
                         "UPDATE rules SET type = ?1, service = ?2, resource = ?3, severity = ?4, "
                         "threshold = ?5, preset_a = ?6, preset_b = ?7, enable = ?8 WHERE id = ?9");
  kova::BindRule(update, *setting);
  if (update.Bind(9, id).Step() != SQLITE_DONE) return kova::WriteFailed(db);
  if (sqlite3_changes(db.get()) == 0) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return -1;
  }
  return 0;
}

int KOVAPerfEventConfDelete(const char* id) {
  const int64_t wanted = kova::ParseId(id);
  kova::RootScope root;
  kova::Database db;
  bool missing = false;
  if (wanted == 0 || !kova::OpenStore(db, false, missing)) {
    KOVA_SET_ERROR(wanted == 0 || missing ? KOVA_ERR_NOT_FOUND : KOVA_ERR_STORE);
    return -1;
  }
  kova::Statement remove(db, "DELETE FROM rules WHERE id = ?");
  if (remove.Bind(1, wanted).Step() != SQLITE_DONE) {
    KOVA_SET_ERROR(KOVA_ERR_STORE);
    return -1;
  }
  if (sqlite3_changes(db.get()) == 0) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return -1;
  }
  return 0;
}
