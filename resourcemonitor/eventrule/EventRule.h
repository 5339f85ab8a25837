// The methods of "KOVA.ResourceMonitor.EventRule": list, get, set, delete and
// onoff of the rules of the performance-event daemon.

#ifndef RESOURCEMONITOR_EVENTRULE_EVENTRULE_H_
#define RESOURCEMONITOR_EVENTRULE_EVENTRULE_H_

#include "kova/webapi.h"

void rule_list_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
void rule_get_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
void rule_set_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
void rule_delete_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
void rule_onoff_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);

#endif  // RESOURCEMONITOR_EVENTRULE_EVENTRULE_H_
