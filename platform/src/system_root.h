// The system root: the directory under which the platform takes every absolute
// system path, so that a whole system can live in one directory.

#ifndef KOVA_PLATFORM_SRC_SYSTEM_ROOT_H_
#define KOVA_PLATFORM_SRC_SYSTEM_ROOT_H_

#include <sys/types.h>

#include <string>
#include <string_view>

namespace kova {

// $KOVA_ROOT without trailing slashes, or "/" when it is unset or empty.
std::string SystemRoot();

// The real path of the system path `path` ("/etc/kovainfo.conf") under the root.
std::string RootPath(std::string_view path);

// Creates `path` and its missing parents with `mode`. False with errno set when
// a component can't be made or is not a directory.
bool MakeDirectories(const std::string& path, mode_t mode);

// Whether `name` can stand as one path component of a store or service name:
// 1 to 64 of A-Z a-z 0-9 . _ - @, not starting with a dot.
bool IsPlainName(std::string_view name);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_SYSTEM_ROOT_H_
