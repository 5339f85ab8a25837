// The event rules are not served yet: their methods answer that they are not available.

#include "eventrule/EventRule.h"

namespace {

void NotAvailable(KOVA::APIResponse* response) {
  response->SetError(KOVA::kAPIErrorNoSuchMethod, Json::Value());
}

}  // namespace

void rule_list_v1(KOVA::APIRequest*, KOVA::APIResponse* response) { NotAvailable(response); }
void rule_get_v1(KOVA::APIRequest*, KOVA::APIResponse* response) { NotAvailable(response); }
void rule_set_v1(KOVA::APIRequest*, KOVA::APIResponse* response) { NotAvailable(response); }
void rule_delete_v1(KOVA::APIRequest*, KOVA::APIResponse* response) { NotAvailable(response); }
void rule_onoff_v1(KOVA::APIRequest*, KOVA::APIResponse* response) { NotAvailable(response); }
