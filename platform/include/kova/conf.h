// Configuration files and temporary files of the system.
//
// A configuration file holds one `key="value"` line per key; other lines (blank
// lines, comments starting with #) are kept as they are when a key is written.
// Absolute paths are taken under the system root (KOVA_ROOT, "/" by default).

#ifndef KOVA_CONF_H_
#define KOVA_CONF_H_

#include <cstddef>

#include "kova/export.h"

// The system-wide settings file, written by QLIBCINFOSetKeyValue.
inline constexpr char kKovaInfoConf[] = "/etc/kovainfo.conf";

// Reads the value of `key` in `file` into `value` of `size` bytes, NUL-terminated
// and cut to fit. `flags` is reserved; pass 0. Returns a positive number when the
// key was found, 0 when the file has no such key (`value` left untouched), and a
// negative number when the file could not be read (the last platform error says why).
// A file that doesn't exist has no keys.
KOVA_API int QLIBCFileGetKeyValue(const char* file, const char* key, char* value, size_t size,
                                  int flags);

// Sets `key` to `value` in kKovaInfoConf, adding the key when it is absent; the
// file is replaced whole, so that readers see the old or the new file and never
// a part. Returns 0 on success, negative on failure (file unchanged).
KOVA_API int QLIBCINFOSetKeyValue(const char* key, const char* value);

// Tells whether `key` in `file` holds exactly `value`. `flags` is reserved; pass 0.
// Returns 1 when it does, 0 when it doesn't or the key is absent, negative when
// the file could not be read.
KOVA_API int QLIBCFileCheckKeyValue(const char* file, const char* key, const char* value,
                                    int flags);

// Creates a new empty file, readable and writable by its owner only, whose path
// begins with `prefix`, and writes that path into `name` of `size` bytes. The file
// is made exclusively, so no other user can have planted a file or link there.
// Returns 0 on success; -1 when no file could be made (`name` then empty).
KOVA_API int QLIBCFileITmpName(const char* prefix, char* name, size_t size);

#endif  // KOVA_CONF_H_
