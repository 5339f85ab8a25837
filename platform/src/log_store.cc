// The log store and the log calls of the platform.

#include "src/log_store.h"

#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string_view>

#include "kova/conf.h"
#include "kova/error.h"
#include "kova/log.h"
#include "src/conf_file.h"
#include "src/privilege.h"
#include "src/sqlite_db.h"
#include "src/system_root.h"

namespace kova {
namespace {

constexpr char kSchema[] =
    "CREATE TABLE IF NOT EXISTS records("
    "id INTEGER PRIMARY KEY AUTOINCREMENT, level TEXT NOT NULL, time INTEGER NOT NULL, "
    "user TEXT NOT NULL, source TEXT NOT NULL, event TEXT NOT NULL)";

// The database of each log type, under the system root.
const char* StoreName(int type) { return type == kLogTypePerfEvent ? "perfevent" : nullptr; }

std::string StorePath(int type) {
  return RootPath(std::string("/var/log/kova/") + StoreName(type) + ".db");
}

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

// `text` with the characters that would break a fetched line made blanks.
std::string OneLine(std::string text, bool keep_tabs) {
  for (char& c : text) {
    if (c == '\n' || c == '\r' || (c == '\t' && !keep_tabs)) c = ' ';
  }
  return text;
}

// Appends to a file through a large buffer.
class Output {
 public:
  explicit Output(int fd) : fd_(fd) {}
  void Put(std::string_view text) {
    if (used_ + text.size() > sizeof(buffer_)) Flush();
    if (text.size() > sizeof(buffer_)) {
      Write(text.data(), text.size());
      return;
    }
    memcpy(buffer_ + used_, text.data(), text.size());
    used_ += text.size();
  }
  void Put(char c) {
    if (used_ == sizeof(buffer_)) Flush();
    buffer_[used_++] = c;
  }
  void Flush() {
    Write(buffer_, used_);
    used_ = 0;
  }
  bool ok() const { return ok_; }

 private:
  void Write(const char* data, size_t size) {
    while (ok_ && size > 0) {
      const ssize_t wrote = write(fd_, data, size);
      if (wrote < 0 && errno == EINTR) continue;
      if (wrote <= 0) {
        ok_ = false;
        break;
      }
      data += wrote;
      size -= static_cast<size_t>(wrote);
    }
  }

  int fd_;
  bool ok_ = true;
  size_t used_ = 0;
  char buffer_[1 << 20];
};

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
  const int64_t max_records = MaxRecords();
  RootScope root;
  Database db;
  if (!db.Open(StorePath(type), true, kSchema) || !db.Exec("BEGIN IMMEDIATE")) {
    KOVA_SET_ERROR(KOVA_ERR_STORE);
    return -1;
  }
  Statement insert(db,
                   "INSERT INTO records(level, time, user, source, event) VALUES(?, ?, ?, ?, ?)");
  bool ok = insert.ok();
  for (const LogRecord& record : records) {
    if (!ok) break;
    insert.Bind(1, record.level)
        .Bind(2, record.time)
        .Bind(3, OneLine(record.user, false))
        .Bind(4, OneLine(record.source, false))
        .Bind(5, OneLine(record.event, true));
    ok = insert.Step() == SQLITE_DONE;
    insert.Reset();
  }
  // Ids grow by one per record and only the oldest are ever removed, so the
  // records to keep are the last `max_records` ids.
  Statement trim(db, "DELETE FROM records WHERE id <= (SELECT max(id) FROM records) - ?");
  ok = ok && trim.Bind(1, max_records).Step() == SQLITE_DONE && db.Exec("COMMIT");
  if (!ok) {
    db.Exec("ROLLBACK");
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
  Database db;
  bool missing = false;
  if (!db.Open(StorePath(type), false, nullptr, &missing)) {
    if (missing) return 0;  // a log never written has no records
    KOVA_SET_ERROR(KOVA_ERR_STORE);
    return -1;
  }
  Statement select(db, "SELECT id, level, time, user, source, event FROM records ORDER BY id");
  auto output = std::make_unique<Output>(fd);
  LogTimeFormatter times;
  char id[24];
  char time_text[32];
  int step;
  while ((step = select.Step()) == SQLITE_ROW) {
    const int id_length = snprintf(id, sizeof(id), "%lld", static_cast<long long>(select.Int(0)));
    output->Put(std::string_view(id, id_length));
    output->Put('\t');
    output->Put(select.Text(1));
    output->Put('\t');
    output->Put(std::string_view(time_text, times.Format(select.Int(2), time_text)));
    output->Put('\t');
    output->Put(select.Text(3));
    output->Put('\t');
    output->Put(select.Text(4));
    output->Put('\t');
    output->Put(select.Text(5));
    output->Put('\n');
  }
  output->Flush();
  if (step != SQLITE_DONE || !output->ok()) {
    KOVA_SET_ERROR(step != SQLITE_DONE ? KOVA_ERR_STORE : KOVA_ERR_IO);
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
  const std::string store = kova::StorePath(type);
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
  const int fd = open(out_path, O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0600);
  if (fd < 0) {
    KOVA_SET_ERROR(errno == EACCES ? KOVA_ERR_PERMISSION : KOVA_ERR_IO);
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
  kova::Database db;
  bool missing = false;
  if (!db.Open(kova::StorePath(type), false, nullptr, &missing)) {
    if (missing) return 0;
    KOVA_SET_ERROR(KOVA_ERR_STORE);
    return -1;
  }
  if (!db.Exec("DELETE FROM records")) {
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
