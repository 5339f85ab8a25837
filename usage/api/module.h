// The entry of KOVA.ResourceMonitor.Usage.so: the tables the host loads it by,
// and the texts of its errors, loaded with the module.

#ifndef USAGE_API_MODULE_H_
#define USAGE_API_MODULE_H_

#include "kova/text.h"
#include "kova/webapi.h"

// Marks the few symbols the module exports; everything else is hidden.
#define USAGE_EXPORT __attribute__((visibility("default")))

extern "C" {

// The methods the module serves, ended by an all-zero row.
USAGE_EXPORT extern APITableEntry gTable[];
// The methods the host checks before their handler: none, only the all-zero row.
USAGE_EXPORT extern APICheckEntry gCheckTable[];

USAGE_EXPORT APITableEntry* GetAPITable();
USAGE_EXPORT APICheckEntry* GetAPICheckTable();

}  // extern "C"

// Texts of the section "usage" in the system's language, loaded with the module.
extern StringBundle gStringBundle;

#endif  // USAGE_API_MODULE_H_
