#include "api/module.h"

#include "eventrule/EventRule.h"
#include "log/log_handlers.h"
#include "setting/resource_api.h"

namespace {

// The settings methods pass their checks unconditionally; each row keeps a
// callback of its own.
int SettingSetCheck(KOVA::APIRequest*) { return 1; }
int SettingGetCheck(KOVA::APIRequest*) { return 1; }

}  // namespace

StringBundle gStringBundle("common", "log", "tree", nullptr, nullptr, nullptr);

extern "C" {

APITableEntry gTable[] = {
    {"KOVA.ResourceMonitor.Setting", 1, "set", set_v1},
    {"KOVA.ResourceMonitor.Setting", 1, "get", get_v1},
    {"KOVA.ResourceMonitor.Log", 1, "list", log_list_v1},
    {"KOVA.ResourceMonitor.Log", 1, "clear", log_clear_v1},
    {"KOVA.ResourceMonitor.Log", 1, "export", log_export_v1},
    {"KOVA.ResourceMonitor.EventRule", 1, "list", rule_list_v1},
    {"KOVA.ResourceMonitor.EventRule", 1, "get", rule_get_v1},
    {"KOVA.ResourceMonitor.EventRule", 1, "set", rule_set_v1},
    {"KOVA.ResourceMonitor.EventRule", 1, "delete", rule_delete_v1},
    {"KOVA.ResourceMonitor.EventRule", 1, "onoff", rule_onoff_v1},
    {nullptr, 0, nullptr, nullptr},
};

APICheckEntry gCheckTable[] = {
    {"KOVA.ResourceMonitor.Setting", 1, "set", SettingSetCheck, 0, 0},
    {"KOVA.ResourceMonitor.Setting", 1, "get", SettingGetCheck, 0, 0},
    {nullptr, 0, nullptr, nullptr, 0, 0},
};

APITableEntry* GetAPITable() { return gTable; }

APICheckEntry* GetAPICheckTable() { return gCheckTable; }

}  // extern "C"
