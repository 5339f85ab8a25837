// The event log is not served yet: its methods answer that they are not available.

#include "log/log.h"

namespace {

void NotAvailable(KOVA::APIResponse* response) {
  response->SetError(KOVA::kAPIErrorNoSuchMethod, Json::Value());
}

}  // namespace

void log_list_v1(KOVA::APIRequest*, KOVA::APIResponse* response) { NotAvailable(response); }
void log_clear_v1(KOVA::APIRequest*, KOVA::APIResponse* response) { NotAvailable(response); }
void log_export_v1(KOVA::APIRequest*, KOVA::APIResponse* response) { NotAvailable(response); }
