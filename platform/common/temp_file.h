// Exclusive creation of temporary files, for the platform implementations.

#ifndef KOVA_PLATFORM_COMMON_TEMP_FILE_H_
#define KOVA_PLATFORM_COMMON_TEMP_FILE_H_

#include <cstddef>
#include <string>

namespace kova {

// Creates a new empty file of mode 0600 whose path is `prefix` followed by six
// random characters, failing rather than opening a file or link that exists, and
// writes the path into `name` of `size` bytes. Returns 0 on success; -1 with the
// last platform error set when the path doesn't fit or no file could be made.
int MakeTempFile(const std::string& prefix, char* name, size_t size);

}  // namespace kova

#endif  // KOVA_PLATFORM_COMMON_TEMP_FILE_H_
