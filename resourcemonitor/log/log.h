// The methods of "KOVA.ResourceMonitor.Log": list, clear and export of the
// performance-event log.

#ifndef RESOURCEMONITOR_LOG_LOG_H_
#define RESOURCEMONITOR_LOG_LOG_H_

#include "kova/webapi.h"

void log_list_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
void log_clear_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
void log_export_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);

#endif  // RESOURCEMONITOR_LOG_LOG_H_
