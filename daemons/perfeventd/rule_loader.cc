#include "perfeventd/rule_loader.h"

#include <sys/stat.h>

#include <cstring>

#include "kova/perfevent.h"
#include "src/system_root.h"

namespace perfeventd {
namespace {

constexpr char kStorePath[] = "/var/lib/kova/perfevent/rules.db";

// Frees the list on every path out.
struct ListOwner {
  KovaPerfEventConfSettingNode* head;
  ~ListOwner() { KOVAPerfEventConfListFree(head); }
};

}  // namespace

bool LoadEnabledRules(std::vector<Rule>& rules) {
  ListOwner list{KOVAPerfEventConfListGet(nullptr)};
  if (list.head == nullptr) return false;
  std::vector<Rule> enabled;
  for (const KovaPerfEventConfSettingNode* node = list.head; node != nullptr && node->setting;
       node = node->next) {
    const KOVAPERFEVENT_CONF_SETTING& record = *node->setting;
    if (record.enable != 1) continue;
    Rule rule;
    rule.id.assign(record.id, strnlen(record.id, sizeof(record.id)));
    rule.type = record.type;
    rule.object.assign(record.service, strnlen(record.service, sizeof(record.service)));
    rule.resource = record.resource;
    rule.severity = record.severity;
    rule.threshold = record.threshold;
    rule.period = record.preset_a;
    rule.duration = record.preset_b;
    enabled.push_back(std::move(rule));
  }
  rules = std::move(enabled);
  return true;
}

void StoreWatch::Mark() {
  const std::string path = kova::RootPath(kStorePath);
  database_ = kova::StampOf(path);
  journal_ = kova::StampOf(path + "-wal");
}

bool StoreWatch::Changed() const {
  const std::string path = kova::RootPath(kStorePath);
  return !(database_ == kova::StampOf(path)) || !(journal_ == kova::StampOf(path + "-wal"));
}

}  // namespace perfeventd
