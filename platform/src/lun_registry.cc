#include "src/lun_registry.h"

#include <errno.h>
#include <json/reader.h>
#include <json/writer.h>

#include <algorithm>
#include <memory>
#include <unordered_map>

#include "kova/error.h"
#include "src/atomic_file.h"
#include "src/file_cache.h"
#include "src/privilege.h"
#include "src/system_root.h"

namespace kova {
namespace {

constexpr char kRegistryPath[] = "/etc/kova/iscsi/luns.json";

bool IsUuid(const std::string& uuid) {
  return !uuid.empty() && uuid.size() <= 64 && std::all_of(uuid.begin(), uuid.end(), [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-';
  });
}

bool IsValid(const Lun& lun) {
  return IsUuid(lun.uuid) && !lun.name.empty() && lun.name.size() < 128 &&
         std::none_of(lun.name.begin(), lun.name.end(),
                      [](char c) { return static_cast<unsigned char>(c) < 0x20; }) &&
         lun.size_mb >= 0;
}

// Records `error` where it happened and fails with -1.
#define FAIL(error) (KOVA_SET_ERROR(error), -1)

// Reads the registry from `path`; false with the platform error set.
bool Load(const std::string& path, std::vector<Lun>& luns) {
  luns.clear();
  std::string text;
  if (!ReadWholeFile(path, text)) {
    if (errno == ENOENT) return true;
    KOVA_SET_ERROR(KOVA_ERR_IO);
    return false;
  }
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value root;
  if (!reader->parse(text.data(), text.data() + text.size(), &root, nullptr) || !root.isObject() ||
      !root["luns"].isArray()) {
    KOVA_SET_ERROR(KOVA_ERR_FORMAT);
    return false;
  }
  for (const Json::Value& entry : root["luns"]) {
    if (!entry.isObject() || !entry["uuid"].isString() || !entry["name"].isString()) {
      KOVA_SET_ERROR(KOVA_ERR_FORMAT);
      return false;
    }
    luns.push_back({entry["uuid"].asString(), entry["name"].asString(),
                    entry["size_mb"].isInt64() ? entry["size_mb"].asInt64() : 0,
                    entry["location"].isString() ? entry["location"].asString() : ""});
  }
  return true;
}

// The registry as read, with the position of each uuid (its first entry).
struct LunTable {
  std::vector<Lun> luns;
  std::unordered_map<std::string, size_t> by_uuid;
};

bool LoadTable(const std::string& path, LunTable& table) {
  if (!Load(path, table.luns)) return false;
  for (size_t i = 0; i < table.luns.size(); ++i) table.by_uuid.emplace(table.luns[i].uuid, i);
  return true;
}

// The registry of the current system root; nullptr with the platform error set.
std::shared_ptr<const LunTable> CachedTable() {
  static FileCache<LunTable> cache(16);
  RootScope root;
  return cache.Get(RootPath(kRegistryPath), LoadTable);
}

bool Save(const std::string& path, const std::vector<Lun>& luns) {
  Json::Value root;
  root["luns"] = Json::Value(Json::arrayValue);
  for (const Lun& lun : luns) root["luns"].append(LunToJson(lun));
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "  ";
  if (!ReplaceFile(path, Json::writeString(builder, root) + "\n", 0644)) {
    KOVA_SET_ERROR(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
    return false;
  }
  return true;
}

// Runs `change` on the registry under its lock and saves the result; a
// non-zero result of `change` is the platform error to fail with.
template <typename Change>
int Update(Change change) {
  RootScope root;
  const std::string path = RootPath(kRegistryPath);
  return UpdateFile<std::vector<Lun>>(
      path, [&path](std::vector<Lun>& luns) { return Load(path, luns); },
      [&change](std::vector<Lun>& luns) {
        const int error = change(luns);
        return error != 0 ? FAIL(error) : 0;
      },
      [&path](const std::vector<Lun>& luns) { return Save(path, luns); });
}

}  // namespace

int ReadLuns(std::vector<Lun>& luns) {
  const std::shared_ptr<const LunTable> table = CachedTable();
  if (table == nullptr) return -1;
  luns = table->luns;
  return 0;
}

int FindLun(const std::string& uuid, Lun& lun) {
  const std::shared_ptr<const LunTable> table = CachedTable();
  if (table == nullptr) return -1;
  const auto it = table->by_uuid.find(uuid);
  if (it == table->by_uuid.end()) return 0;
  lun = table->luns[it->second];
  return 1;
}

int AddLun(const Lun& lun) {
  if (!IsValid(lun)) return FAIL(KOVA_ERR_INVALID);
  return Update([&lun](std::vector<Lun>& luns) {
    for (const Lun& other : luns) {
      if (other.uuid == lun.uuid) return static_cast<int>(KOVA_ERR_INVALID);
    }
    luns.push_back(lun);
    return 0;
  });
}

int RemoveLun(const std::string& uuid) {
  return Update([&uuid](std::vector<Lun>& luns) {
    auto it = std::find_if(luns.begin(), luns.end(), [&](const Lun& l) { return l.uuid == uuid; });
    if (it == luns.end()) return static_cast<int>(KOVA_ERR_NOT_FOUND);
    luns.erase(it);
    return 0;
  });
}

Json::Value LunToJson(const Lun& lun) {
  Json::Value out;
  out["uuid"] = lun.uuid;
  out["name"] = lun.name;
  out["size_mb"] = static_cast<Json::Int64>(lun.size_mb);
  out["location"] = lun.location;
  return out;
}

}  // namespace kova
