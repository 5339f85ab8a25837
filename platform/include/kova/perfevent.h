// The rule store of the performance-event daemon "kovaperfeventd".
//
// A rule watches one resource of one object (a service, an iSCSI LUN, or the
// whole system) and raises an event of its severity when the resource stays
// above the threshold for a while. Rules are exchanged as fixed 1180-byte
// records; lists of records are allocated by the store and freed by the caller
// with KOVAPerfEventConfListFree.

#ifndef KOVA_PERFEVENT_H_
#define KOVA_PERFEVENT_H_

#include <cstddef>
#include <cstdint>

#include "kova/export.h"

// What a rule's object is.
enum KOVAPERFEVENT_EVENT_TYPE : int32_t {
  PERFEVENT_TYPE_SYSTEM = 0,     // the whole system; `service` is free text
  PERFEVENT_TYPE_SERVICE = 1,    // a service; `service` is its name
  PERFEVENT_TYPE_ISCSI_LUN = 2,  // an iSCSI LUN; `service` is its uuid
};

// Resources a rule can watch, with the unit of its threshold. A service's rule
// watches the CPU or memory of the service's processes; a LUN's rule its I/O
// rate or latency; a system rule any of the four for the whole system.
enum KOVAPERFEVENT_RESOURCE : int32_t {
  PERFEVENT_RESOURCE_CPU = 1,         // CPU use, percent of all CPUs
  PERFEVENT_RESOURCE_MEMORY = 2,      // memory in use, percent of all memory
  PERFEVENT_RESOURCE_IO_RATE = 3,     // bytes read and written, KiB per second
  PERFEVENT_RESOURCE_IO_LATENCY = 4,  // average time of one I/O, milliseconds
};

// Severities of the events a rule raises.
enum KOVAPERFEVENT_SEVERITY : int32_t {
  PERFEVENT_SEVERITY_WARNING = 1,   // logged at level "Warning"
  PERFEVENT_SEVERITY_CRITICAL = 2,  // logged at level "Critical"
};

// One rule. Integers are 32-bit little-endian, texts NUL-terminated.
struct KOVAPERFEVENT_CONF_SETTING {
  char id[1024];                  // assigned by the store; all zero in a new rule
  KOVAPERFEVENT_EVENT_TYPE type;  // what `service` names
  char service[128];              // the rule's object
  int32_t resource;               // a KOVAPERFEVENT_RESOURCE
  int32_t severity;               // a KOVAPERFEVENT_SEVERITY
  int32_t threshold;              // in the resource's unit
  int32_t preset_a;               // seconds between two samples
  int32_t preset_b;               // seconds the resource must stay above the threshold
  int32_t enable;                 // 1 when the rule is on, 0 when off
};

static_assert(sizeof(KOVAPERFEVENT_EVENT_TYPE) == 4);
static_assert(sizeof(KOVAPERFEVENT_CONF_SETTING) == 1180);
static_assert(offsetof(KOVAPERFEVENT_CONF_SETTING, id) == 0);
static_assert(offsetof(KOVAPERFEVENT_CONF_SETTING, type) == 1024);
static_assert(offsetof(KOVAPERFEVENT_CONF_SETTING, service) == 1028);
static_assert(offsetof(KOVAPERFEVENT_CONF_SETTING, resource) == 1156);
static_assert(offsetof(KOVAPERFEVENT_CONF_SETTING, severity) == 1160);
static_assert(offsetof(KOVAPERFEVENT_CONF_SETTING, threshold) == 1164);
static_assert(offsetof(KOVAPERFEVENT_CONF_SETTING, preset_a) == 1168);
static_assert(offsetof(KOVAPERFEVENT_CONF_SETTING, preset_b) == 1172);
static_assert(offsetof(KOVAPERFEVENT_CONF_SETTING, enable) == 1176);

// A node of a list of rules. A list ends at a null `next` or at a node whose
// `setting` is null; a head whose `setting` is null is an empty list.
struct KovaPerfEventConfSettingNode {
  KOVAPERFEVENT_CONF_SETTING* setting;
  KovaPerfEventConfSettingNode* next;
};

// With an id, a list whose first record is the rule of that id; with null, a
// list of all rules in the order they were added. Returns null when the rule is
// unknown or the store can't be read. The caller owns the list: its records may
// be changed and passed to KOVAPerfEventConfSet, and its head must be given to
// KOVAPerfEventConfListFree exactly once.
KOVA_API KovaPerfEventConfSettingNode* KOVAPerfEventConfListGet(const char* id);

// Frees a whole list that KOVAPerfEventConfListGet returned; null is ignored.
KOVA_API void KOVAPerfEventConfListFree(KovaPerfEventConfSettingNode* head);

// 1 when a rule with the id `id` is stored, 0 when not.
KOVA_API int KOVAPerfEventIsConfExisted(const char* id);

// Stores `setting` as a new rule, assigning it a new id that is written into its
// `id`; ids are never given twice. Type, object, resource, severity and threshold
// are kept as they come, also where the daemon can't measure them (it skips such
// a rule). Returns 0 on success; negative on failure, with the last platform
// error KOVA_ERR_PERFEVENT_DUPLICATE when another rule has the same type, object,
// resource and severity, and KOVA_ERR_INVALID for a record that is none: an
// object text without its terminator, `preset_a` below 1, `preset_b` below 0, or
// `enable` other than 0 and 1.
KOVA_API int KOVAPerfEventConfAdd(KOVAPERFEVENT_CONF_SETTING* setting);

// Overwrites the stored rule whose id `setting` carries. Returns 0 on success;
// negative on failure, with KOVA_ERR_PERFEVENT_DUPLICATE and KOVA_ERR_INVALID as
// for KOVAPerfEventConfAdd and KOVA_ERR_NOT_FOUND for an unknown id.
KOVA_API int KOVAPerfEventConfSet(const KOVAPERFEVENT_CONF_SETTING* setting);

// Deletes the rule `id`. Returns 0 on success, negative when it is unknown.
KOVA_API int KOVAPerfEventConfDelete(const char* id);

#endif  // KOVA_PERFEVENT_H_
