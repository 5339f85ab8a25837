// Configuration files of `key="value"` lines.
//
// A key line is `key=value` with optional blanks around the key and the value;
// a value in double quotes loses them (everything between the first and the
// last quote is the value). Blank lines, comments (#) and other lines are kept
// as they are when a key is written. When a key appears twice, the first line
// counts and a write leaves only that one.

#ifndef KOVA_PLATFORM_SRC_CONF_FILE_H_
#define KOVA_PLATFORM_SRC_CONF_FILE_H_

#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>

namespace kova {

// Whether `key` can be a configuration key: 1 to 128 of A-Z a-z 0-9 _ . -
bool IsConfKey(std::string_view key);

// Reads `key` of the file at the real path `path` into `value`. Returns 1 when
// found, 0 when the file has no such key or doesn't exist, -1 when it can't be
// read (the last platform error says why).
int ConfRead(const std::string& path, std::string_view key, std::string& value);

// Every key of the file at the real path `path` with its value, as ConfRead
// reads them: nullptr with errno set when the file can't be read (ENOENT when
// it doesn't exist).
using ConfKeys = std::unordered_map<std::string, std::string>;
std::shared_ptr<const ConfKeys> ConfReadAll(const std::string& path);

// Sets `key` to `value` in the file at the real path `path`, creating the file
// (mode 0644) and its directories when missing. The write holds the file's lock
// and replaces the file whole. Returns 0, or -1 with the last platform error set
// and the file unchanged: a bad key, a value holding a line break or NUL, or a
// failed write.
int ConfWrite(const std::string& path, std::string_view key, std::string_view value);

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_CONF_FILE_H_
