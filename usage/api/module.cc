#include "api/module.h"

#include "query/usage_api.h"

StringBundle gStringBundle("usage", nullptr, nullptr, nullptr, nullptr, nullptr);

extern "C" {

APITableEntry gTable[] = {
    {"KOVA.ResourceMonitor.Usage", 1, "catalog", usage_catalog_v1},
    {"KOVA.ResourceMonitor.Usage", 1, "realtime", usage_realtime_v1},
    {"KOVA.ResourceMonitor.Usage", 1, "history", usage_history_v1},
    {nullptr, 0, nullptr, nullptr},
};

// The host's own check (a signed-in administrator) is all these methods need.
APICheckEntry gCheckTable[] = {
    {nullptr, 0, nullptr, nullptr, 0, 0},
};

APITableEntry* GetAPITable() { return gTable; }

APICheckEntry* GetAPICheckTable() { return gCheckTable; }

}  // extern "C"
