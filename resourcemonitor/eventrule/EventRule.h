// The methods of "KOVA.ResourceMonitor.EventRule": list, get, set, delete and
// onoff of the rules of the performance-event daemon "kovaperfeventd", and the
// readers and writers of the rule store behind them.
//
// A rule leaves the module as the object {"id", "enable", "service", "name",
// "type", "severity", "resource", "threshold"}, where "name" is the display name
// of the rule's object. Every list fetched from the store is freed before the
// function that fetched it returns.

#ifndef RESOURCEMONITOR_EVENTRULE_EVENTRULE_H_
#define RESOURCEMONITOR_EVENTRULE_EVENTRULE_H_

#include <json/value.h>

#include <string>
#include <vector>

#include "kova/perfevent.h"
#include "kova/webapi.h"

// Parameters are converted as the JSON library converts them (the number 1 as
// the text "1", 0 and null as off, 90.0 as 90); 101 answers one it can't convert.

// Answers {"total", "rules", "support_internal"}: the page of rules that
// "offset" (default 0) and "limit" (default -1, no limit) cut, or 101 for a
// parameter that can't be read as an integer.
void rule_list_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
// Answers the rule object of "id", 101 when "id" can't be read as a non-empty
// text, or the error record's code (6102) when the rule can't be read.
void rule_get_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
// Creates a rule, or changes the rule "id", inside the privileged section; answers
// null data, 101 for a parameter that can't be converted, or the error record.
void rule_set_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
// Deletes the rules whose ids "id_list" holds; 101 when it is not an array.
void rule_delete_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);
// Switches rules as the objects {"id", "enable"} of "id_list" say; 101 when it
// is not an array.
void rule_onoff_v1(KOVA::APIRequest* request, KOVA::APIResponse* response);

// The display name of a rule's object: a service's display name (for a
// package's service the package's name in `language`), an iSCSI LUN's name, or
// the object text itself. Every failed lookup falls back; never fails.
std::string translateName(const std::string& language, KOVAPERFEVENT_EVENT_TYPE type,
                          std::string object);

// Replaces `rule` with the rule object of `id`. False, with only the error
// record's code set (6102), when the store gives no rule.
bool GetEventRules(const std::string& language, std::string id, Json::Value& rule);

// Appends the object of every stored rule to `rules`, in the store's order; a
// store that can't be read adds nothing.
void ListEventRules(const std::string& language, std::vector<Json::Value>& rules);

// Creates a rule (no "id") or overwrites every field of the rule "id" from the
// request's parameters, absent ones as 0, empty or off, then reloads the daemon.
// False, with only the record's code set: 6107 for an unknown id, 6106 when the
// store refuses a duplicate, 6102 for any other failure. A parameter that can't
// be converted reads as absent.
bool SetEventRules(KOVA::APIRequest* request);

// Deletes each stored rule whose id is a string of `ids`, then reloads the daemon.
void DelEventRules(const Json::Value& ids);

// Sets `enable` of each stored rule named by an object {"id", "enable"} of
// `switches`, "id" read as text and "enable" as a boolean; logs and skips an
// element that is no such object or whose members can't be converted. Then
// reloads the daemon.
void OnOffEventRules(const Json::Value& switches);

#endif  // RESOURCEMONITOR_EVENTRULE_EVENTRULE_H_
