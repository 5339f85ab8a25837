// System services and shared folders.
//
// A service is started, stopped and reloaded by name. The service of a package
// <pkg> is named "pkgctl-<pkg>"; unless it was given a display name of its own,
// its display name is its service name.

#ifndef KOVA_SERVICE_H_
#define KOVA_SERVICE_H_

#include <cstddef>

#include "kova/export.h"

// 1 when the service `name` is running, 0 when it is not or is unknown.
KOVA_API int QLIBServiceIsRunning(const char* name);

// Starts the service `name` and returns once it runs; a running service is left
// as it is. `flags` is reserved; pass 0. Returns 0 on success; negative when the
// service is unknown or could not be started (the last platform error says why).
KOVA_API int QLIBServiceStart(const char* name, int flags);

// Stops the service `name`; a stopped service is left as it is. `flags` is
// reserved; pass 0. Returns 0 on success, negative on failure.
KOVA_API int QLIBServiceStop(const char* name, int flags);

// Asks the running service `name` to read its configuration again. Returns 0 on
// success, -1 when the service is unknown, not running or could not be told.
KOVA_API int QLIBServiceReload(const char* name);

// Writes the display name of the service `name`, NUL-terminated, into `display`
// of `size` bytes. Returns 0 on success, negative when the service is unknown.
KOVA_API int QLIBServicecfgDisplayNameGet(const char* name, char* display, size_t size);

// Looks up the volume that holds the shared folder behind the link `link`.
// Returns 1 and writes the volume's path into `volume` of `size` bytes when the
// link leads to an existing folder; 0 when it doesn't; negative on a bad argument.
KOVA_API int KOVAShareServiceVolumeGetbyLink(const char* link, char* volume, size_t size);

#endif  // KOVA_SERVICE_H_
