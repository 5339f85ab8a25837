#include "src/sqlite_db.h"

#include <errno.h>
#include <sys/stat.h>

#include "src/system_root.h"

namespace kova {

namespace {
constexpr int kBusyTimeoutMs = 5000;
}  // namespace

Database::~Database() { sqlite3_close(db_); }

bool Database::Open(const std::string& path, bool create, const char* schema, bool* missing) {
  if (missing != nullptr) *missing = false;
  struct stat info;
  const bool exists = stat(path.c_str(), &info) == 0;
  if (!exists && !create) {
    if (missing != nullptr) *missing = errno == ENOENT;
    return false;
  }
  if (!exists && !MakeDirectories(path.substr(0, path.rfind('/')), 0755)) return false;
  const int flags = SQLITE_OPEN_READWRITE | (create ? SQLITE_OPEN_CREATE : 0) |
                    SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_NOFOLLOW;
  if (sqlite3_open_v2(path.c_str(), &db_, flags, nullptr) != SQLITE_OK) return false;
  sqlite3_busy_timeout(db_, kBusyTimeoutMs);
  sqlite3_extended_result_codes(db_, 1);
  if (!Exec("PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL;")) return false;
  return !create || Exec(schema);
}

bool Database::Exec(const char* sql) {
  return sqlite3_exec(db_, sql, nullptr, nullptr, nullptr) == SQLITE_OK;
}

Statement::Statement(const Database& db, const char* sql) {
  if (db.get() == nullptr ||
      sqlite3_prepare_v2(db.get(), sql, -1, &statement_, nullptr) != SQLITE_OK) {
    sqlite3_finalize(statement_);
    statement_ = nullptr;
  }
}

Statement::~Statement() { sqlite3_finalize(statement_); }

Statement& Statement::Bind(int index, int64_t value) {
  if (statement_ != nullptr) sqlite3_bind_int64(statement_, index, value);
  return *this;
}

Statement& Statement::Bind(int index, std::string_view text) {
  if (statement_ != nullptr) {
    sqlite3_bind_text(statement_, index, text.data(), static_cast<int>(text.size()),
                      SQLITE_TRANSIENT);
  }
  return *this;
}

int Statement::Step() { return statement_ != nullptr ? sqlite3_step(statement_) : SQLITE_MISUSE; }

std::string_view Statement::Text(int column) const {
  const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(statement_, column));
  return text != nullptr ? std::string_view(text, sqlite3_column_bytes(statement_, column))
                         : std::string_view();
}

}  // namespace kova
