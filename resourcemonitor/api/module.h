// The module's entry: the tables the host loads it by, and the string bundle
// built when it is loaded.

#ifndef RESOURCEMONITOR_API_MODULE_H_
#define RESOURCEMONITOR_API_MODULE_H_

#include "kova/text.h"
#include "kova/webapi.h"

// Marks the few symbols the module exports; everything else is hidden.
#define RESOURCEMONITOR_EXPORT __attribute__((visibility("default")))

extern "C" {

// The methods the module serves, ended by an all-zero row.
RESOURCEMONITOR_EXPORT extern APITableEntry gTable[];
// The methods the host checks before their handler, ended by an all-zero row.
RESOURCEMONITOR_EXPORT extern APICheckEntry gCheckTable[];

RESOURCEMONITOR_EXPORT APITableEntry* GetAPITable();
RESOURCEMONITOR_EXPORT APICheckEntry* GetAPICheckTable();

}  // extern "C"

// Texts of the sections "common", "log" and "tree", loaded with the module.
extern StringBundle gStringBundle;

#endif  // RESOURCEMONITOR_API_MODULE_H_
