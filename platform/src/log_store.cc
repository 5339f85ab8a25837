// The log store and the log calls of the platform.

#include "src/log_store.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "kova/conf.h"
#include "kova/error.h"
#include "kova/log.h"
#include "src/conf_file.h"
#include "src/log_folder.h"
#include "src/log_migration.h"
#include "src/privilege.h"
#include "src/system_root.h"

namespace kova {
namespace {

// The store of each log type, under the system root, and where earlier
// versions kept it.
const char* StoreName(int type) { return type == kLogTypePerfEvent ? "perfevent" : nullptr; }

std::string FolderPath(int type) {
  return RootPath(std::string("/var/log/kova/") + StoreName(type));
}

std::string OldDatabasePath(int type) { return FolderPath(type) + ".db"; }

int64_t MaxRecords() {
  std::string text;
  if (ConfRead(RootPath(kKovaInfoConf), kLogMaxRecordsKey, text) <= 0) return kDefaultLogMaxRecords;
  char* end = nullptr;
  const long long max = strtoll(text.c_str(), &end, 10);
  return end != text.c_str() && *end == '\0' && max > 0 ? max : kDefaultLogMaxRecords;
}

bool IsLevel(const std::string& level) {
  return level == kLogLevelInfo || level == kLogLevelWarning || level == kLogLevelCritical;
}

// Appends `text` with the characters that would break a fetched line made blanks.
void PutOneLine(std::string_view text, bool keep_tabs, std::string& out) {
  const size_t at = out.size();
  out.append(text);
  for (size_t i = at; i < out.size(); ++i) {
    char& c = out[i];
    if (c == '\n' || c == '\r' || (c == '\t' && !keep_tabs)) c = ' ';
  }
}

// Moves a log that an earlier version kept in a database into its folder, or
// removes the database that a move ended by a crash left beside the folder.
// True when there is no database, or it was moved.
bool MoveOldStore(int type) {
  const std::string database = OldDatabasePath(type);
  struct stat info;
  if (lstat(database.c_str(), &info) != 0) return errno == ENOENT;
  return MigrateSqliteLog(database, FolderPath(type), SegmentLines(MaxRecords()));
}

// Opens the store of log `type`, moving it over from an earlier version's
// database first and, with `create`, making it when there is none. False with
// `missing` set when there is none and it wasn't to be made; false with the
// platform error set when it can't be opened.
bool OpenStore(int type, LogFolder::Access access, bool create, LogFolder& folder, bool& missing) {
  missing = false;
  const std::string path = FolderPath(type);
  if (MoveOldStore(type)) {
    if (folder.Open(path, access)) return true;
    if (errno == ENOENT && !create) {
      missing = true;
      return false;
    }
    if (errno == ENOENT && LogFolder::Create(path, 1, nullptr) && folder.Open(path, access)) {
      return true;
    }
  }
  KOVA_SET_ERROR(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_STORE);
  return false;
}

}  // namespace

size_t LogTimeFormatter::Format(int64_t seconds, char out[32]) {
  if (cached_ && seconds >= minute_start_ && seconds - minute_start_ < 60) {
    const int second = static_cast<int>(seconds - minute_start_);
    memcpy(out, prefix_, prefix_length_);
    out[prefix_length_] = static_cast<char>('0' + second / 10);
    out[prefix_length_ + 1] = static_cast<char>('0' + second % 10);
    out[prefix_length_ + 2] = '\0';
    return prefix_length_ + 2;
  }
  const std::string text = KOVALogConvertTime1(seconds);
  const size_t length = std::min(text.size(), size_t{31});
  memcpy(out, text.c_str(), length);
  out[length] = '\0';
  // A minute can be reused when local minutes start with UTC minutes, which
  // holds for every offset in whole minutes.
  const time_t when = static_cast<time_t>(seconds);
  struct tm local;
  cached_ = localtime_r(&when, &local) != nullptr && local.tm_gmtoff % 60 == 0 && length > 2 &&
            length == text.size();
  if (cached_) {
    minute_start_ = seconds - local.tm_sec;
    prefix_length_ = length - 2;
    memcpy(prefix_, out, prefix_length_);
  }
  return length;
}

void PutLogLine(int64_t id, std::string_view level, std::string_view time, std::string_view user,
                std::string_view source, std::string_view event, std::string& out) {
  char id_text[24];
  out.append(id_text, static_cast<size_t>(
                          snprintf(id_text, sizeof(id_text), "%lld", static_cast<long long>(id))));
  out += '\t';
  out.append(level);
  out += '\t';
  out.append(time);
  out += '\t';
  PutOneLine(user, false, out);
  out += '\t';
  PutOneLine(source, false, out);
  out += '\t';
  PutOneLine(event, true, out);
  out += '\n';
}

int AppendLogRecords(int type, const std::vector<LogRecord>& records) {
  if (StoreName(type) == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return -1;
  }
  for (const LogRecord& record : records) {
    if (!IsLevel(record.level) || record.user.empty() || record.source.empty()) {
      KOVA_SET_ERROR(KOVA_ERR_INVALID);
      return -1;
    }
  }
  if (records.empty()) return 0;
  const int64_t max_records = MaxRecords();
  RootScope root;
  LogFolder folder;
  bool missing;
  if (!OpenStore(type, LogFolder::Access::kWrite, true, folder, missing)) return -1;
  std::string text;
  LogTimeFormatter times;
  char time_text[32];
  int64_t id = folder.next_id();
  for (const LogRecord& record : records) {
    PutLogLine(id++, record.level,
               std::string_view(time_text, times.Format(record.time, time_text)), record.user,
               record.source, record.event, text);
  }
  if (!folder.Append(text, static_cast<int64_t>(records.size()), SegmentLines(max_records)) ||
      !folder.Trim(max_records)) {
    KOVA_SET_ERROR(KOVA_ERR_STORE);
    return -1;
  }
  return 0;
}

int DumpLogRecords(int type, int fd) {
  if (StoreName(type) == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return -1;
  }
  RootScope root;
  LogFolder folder;
  bool missing;
  if (!OpenStore(type, LogFolder::Access::kRead, false, folder, missing)) {
    return missing ? 0 : -1;  // a log never written has no records
  }
  if (!folder.CopyTo(fd)) {
    KOVA_SET_ERROR(KOVA_ERR_IO);
    return -1;
  }
  return 0;
}

}  // namespace kova

int KOVALogFilePathGet(int type, char* path, size_t size) {
  if (kova::StoreName(type) == nullptr || path == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return -1;
  }
  kova::RootScope root;
  kova::MoveOldStore(type);
  const std::string store = kova::FolderPath(type);
  if (store.size() >= size) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  memcpy(path, store.c_str(), store.size() + 1);
  return 0;
}

int KOVALogGet1(int type, const char* out_path, const char* language) {
  if (kova::StoreName(type) == nullptr || out_path == nullptr || language == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  kova::RootScope root;
  // The output may be a name in a shared directory: never follow a link there.
  const int fd = open(out_path, O_WRONLY | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600);
  if (fd < 0) {
    KOVA_SET_ERROR(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
    return -1;
  }
  // A file truncated on open is written out at close on ext4 (its guard for
  // files replaced by truncation), which costs more than the copy: the usual
  // output, a fresh empty file, is not truncated.
  struct stat info;
  if (fstat(fd, &info) != 0 || (info.st_size > 0 && ftruncate(fd, 0) != 0)) {
    KOVA_SET_ERROR(KOVA_ERR_IO);
    close(fd);
    return -1;
  }
  const int result = kova::DumpLogRecords(type, fd);
  if (close(fd) != 0 && result == 0) {
    KOVA_SET_ERROR(KOVA_ERR_IO);
    return -1;
  }
  return result;
}

int KOVALogClean(int type) {
  if (kova::StoreName(type) == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_NOT_FOUND);
    return -1;
  }
  kova::RootScope root;
  kova::LogFolder folder;
  bool missing;
  if (!kova::OpenStore(type, kova::LogFolder::Access::kWrite, false, folder, missing)) {
    return missing ? 0 : -1;
  }
  if (!folder.Clear()) {
    KOVA_SET_ERROR(KOVA_ERR_STORE);
    return -1;
  }
  return 0;
}

int KOVALogWrite(int type, const char* level, const char* user, const char* source,
                 const char* event) {
  if (level == nullptr || user == nullptr || source == nullptr || event == nullptr) {
    KOVA_SET_ERROR(KOVA_ERR_INVALID);
    return -1;
  }
  return kova::AppendLogRecords(type, {{level, time(nullptr), user, source, event}});
}
