// The methods of "KOVA.ResourceMonitor.Log": list, clear and export of the
// performance-event log.

#ifndef RESOURCEMONITOR_LOG_LOG_HANDLERS_H_
#define RESOURCEMONITOR_LOG_LOG_HANDLERS_H_

#include <string>

#include "kova/webapi.h"

void log_list_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
void log_clear_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
// Writes the filtered log as a "csv" or "html" download to standard output,
// with its HTTP header lines, after turning the host's own output off.
void log_export_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);

// The text of one data cell of an export: HTML-escaped, or for CSV wrapped in
// double quotes when it holds a comma.
std::string FormatExportCell(bool html, const std::string& text);

#endif  // RESOURCEMONITOR_LOG_LOG_HANDLERS_H_
