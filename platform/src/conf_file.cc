// Configuration files, and the configuration calls of the platform.

#include "src/conf_file.h"

#include <errno.h>

#include <cstdio>
#include <cstring>
#include <unordered_map>

#include "kova/conf.h"
#include "kova/error.h"
#include "src/atomic_file.h"
#include "src/file_cache.h"
#include "src/privilege.h"
#include "src/system_root.h"

namespace kova {
namespace {

constexpr std::string_view kBlanks = " \t\r";

std::string_view Trim(std::string_view text) {
  const size_t first = text.find_first_not_of(kBlanks);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kBlanks) - first + 1);
}

// Splits a key line; false for blank lines, comments and other text.
bool ParseLine(std::string_view line, std::string_view& key, std::string_view& value) {
  const std::string_view text = Trim(line);
  if (text.empty() || text.front() == '#') return false;
  const size_t equals = text.find('=');
  if (equals == std::string_view::npos) return false;
  key = Trim(text.substr(0, equals));
  if (!IsConfKey(key)) return false;
  value = Trim(text.substr(equals + 1));
  if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
    value = value.substr(1, value.size() - 2);
  }
  return true;
}

// Calls `visit(line)` for each line of `content`, without its line feed.
template <typename Visit>
void ForEachLine(std::string_view content, Visit visit) {
  while (!content.empty()) {
    const size_t end = content.find('\n');
    const std::string_view line = content.substr(0, end);
    visit(line);
    if (end == std::string_view::npos) break;
    content.remove_prefix(end + 1);
  }
}

// The first line of a key counts.
bool ParseConf(const std::string& path, ConfKeys& keys) {
  std::string content;
  if (!ReadWholeFile(path, content)) return false;
  ForEachLine(content, [&](std::string_view line) {
    std::string_view key, value;
    if (ParseLine(line, key, value)) keys.emplace(key, value);
  });
  return true;
}

// Service descriptions and package INFO files are read once per look-up burst.
FileCache<ConfKeys>& ConfCache() {
  static FileCache<ConfKeys> cache(512);
  return cache;
}

}  // namespace

bool IsConfKey(std::string_view key) {
  if (key.empty() || key.size() > 128) return false;
  for (char c : key) {
    const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                    c == '_' || c == '.' || c == '-';
    if (!ok) return false;
  }
  return true;
}

std::shared_ptr<const ConfKeys> ConfReadAll(const std::string& path) {
  return ConfCache().Get(path, ParseConf);
}

int ConfRead(const std::string& path, std::string_view key, std::string& value) {
  if (!IsConfKey(key)) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  const std::shared_ptr<const ConfKeys> keys = ConfReadAll(path);
  if (keys == nullptr) {
    if (errno == ENOENT) return 0;
    KOVA_SET_ERROR(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
    return -1;
  }
  const auto it = keys->find(std::string(key));
  if (it == keys->end()) return 0;
  value = it->second;
  return 1;
}

int ConfWrite(const std::string& path, std::string_view key, std::string_view value) {
  if (!IsConfKey(key) || value.find_first_of(std::string_view("\n\r\0", 3)) != value.npos) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  const size_t slash = path.rfind('/');
  if (slash != std::string::npos && slash > 0 && !MakeDirectories(path.substr(0, slash), 0755)) {
    KOVA_SET_ERROR(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
    return -1;
  }
  FileLock lock(path);
  std::string content;
  if (!lock.locked() || (!ReadWholeFile(path, content) && errno != ENOENT)) {
    KOVA_SET_ERROR(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
    return -1;
  }
  const std::string wanted = std::string(key) + "=\"" + std::string(value) + "\"";
  std::string out;
  bool written = false;
  ForEachLine(content, [&](std::string_view line) {
    std::string_view line_key, line_value;
    if (ParseLine(line, line_key, line_value) && line_key == key) {
      if (written) return;  // a later duplicate goes
      out += wanted;
      written = true;
    } else {
      out += line;
    }
    out += '\n';
  });
  if (!written) out += wanted + "\n";
  RemoveStaleTemporaries(path);
  if (!ReplaceFile(path, out, 0644)) {
    KOVA_SET_ERROR(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
    return -1;
  }
  return 0;
}

}  // namespace kova

int QLIBCFileGetKeyValue(const char* file, const char* key, char* value, size_t size, int) {
  if (file == nullptr || key == nullptr || value == nullptr || size == 0) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  std::string found;
  const int result = kova::ConfRead(kova::RootPath(file), key, found);
  if (result > 0) snprintf(value, size, "%s", found.c_str());
  return result;
}

int QLIBCINFOSetKeyValue(const char* key, const char* value) {
  if (key == nullptr || value == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  kova::RootScope root;
  return kova::ConfWrite(kova::RootPath(kKovaInfoConf), key, value);
}

int QLIBCFileCheckKeyValue(const char* file, const char* key, const char* value, int) {
  if (file == nullptr || key == nullptr || value == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  std::string found;
  const int result = kova::ConfRead(kova::RootPath(file), key, found);
  if (result < 0) return result;
  return result > 0 && found == value ? 1 : 0;
}
