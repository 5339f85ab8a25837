// The methods of "KOVA.ResourceMonitor.Setting": get and set of the resource
// monitor's settings in the system settings file.
//
// Three keys: the real-time charts' range ("resourcemonitor_realtime_max", in
// seconds: 15, 30, 60 or 120), history recording into the history database
// ("resourcemonitor_history") and the performance-event daemon
// ("resourcemonitor_performance_event"), the last two "yes" or "no".

#ifndef RESOURCEMONITOR_SETTING_RESOURCE_API_H_
#define RESOURCEMONITOR_SETTING_RESOURCE_API_H_

#include "kova/webapi.h"

// Answers {"duration", "enable_history", "enable_event"}, or the error record's
// code (6102) when the settings file can't be read.
void get_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);

// Applies "enable_history", "enable_event" and "duration", those present, in
// that order; answers null data, or the error record after the first failure.
void set_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);

// The work of set_v1. What a step wrote stays when a later step fails. Returns
// false after the first failure, with the error record filled (except when the
// duration can't be written, which leaves the record as it was).
bool SetMonitorSettings(KOVA::APIRequest* request);

// Asks the statistics-collection service to reload. False, with the record
// filled (6105), when it can't be reached or doesn't answer {"success": true}.
bool ReloadCollector();

#endif  // RESOURCEMONITOR_SETTING_RESOURCE_API_H_
