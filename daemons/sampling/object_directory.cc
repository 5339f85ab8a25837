#include "sampling/object_directory.h"

#include <sys/stat.h>

#include <cstdio>

#include "kova/perfevent.h"
#include "src/atomic_file.h"
#include "src/services.h"
#include "src/system_root.h"

namespace sampling {
namespace {

constexpr char kLunRegistry[] = "/etc/kova/iscsi/luns.json";

}  // namespace

void SystemDirectory::Refresh() {
  // Read the registry again only when its file changed.
  struct stat info {};
  const bool exists = stat(kova::RootPath(kLunRegistry).c_str(), &info) == 0;
  if (luns_read_ &&
      (exists ? info.st_ino == luns_inode_ && info.st_ctim.tv_sec == luns_changed_.tv_sec &&
                    info.st_ctim.tv_nsec == luns_changed_.tv_nsec
              : luns_inode_ == 0)) {
    return;
  }
  std::vector<kova::Lun> luns;
  if (kova::ReadLuns(luns) != 0) return;  // keep what was read; try again next cycle
  luns_ = std::move(luns);
  luns_read_ = true;
  luns_inode_ = exists ? info.st_ino : 0;
  luns_changed_ = exists ? info.st_ctim : timespec{};
}

std::optional<RecordedProcess> SystemDirectory::ServiceProcess(const std::string& name) {
  std::string text;
  if (!kova::IsPlainName(name) ||
      !kova::ReadWholeFile(kova::RootPath("/run/kova/" + name + ".pid"), text)) {
    return std::nullopt;
  }
  long long pid = 0;
  unsigned long long start_time = 0;
  if (sscanf(text.c_str(), "%lld %llu", &pid, &start_time) != 2 || pid <= 0) return std::nullopt;
  return RecordedProcess{static_cast<pid_t>(pid), start_time};
}

std::optional<std::string> SystemDirectory::LunVolume(const std::string& uuid) {
  for (const kova::Lun& lun : luns_) {
    if (lun.uuid == uuid) return lun.location;
  }
  return std::nullopt;
}

std::string SystemDirectory::RealPath(const std::string& path) { return kova::RootPath(path); }

std::string SystemDirectory::DisplayName(int32_t type, const std::string& object) {
  if (type == PERFEVENT_TYPE_ISCSI_LUN) {
    for (const kova::Lun& lun : luns_) {
      if (lun.uuid == object) return lun.name;
    }
    return object;
  }
  return type == PERFEVENT_TYPE_SERVICE ? kova::ServiceDisplayName(object) : object;
}

}  // namespace sampling
