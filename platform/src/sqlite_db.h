// A small owner of SQLite connections and statements for the platform's stores.
//
// Every store runs in WAL mode, so that readers and a writer in different
// processes don't block each other, and waits up to a few seconds for a lock
// held by another process before giving up.

#ifndef KOVA_PLATFORM_SRC_SQLITE_DB_H_
#define KOVA_PLATFORM_SRC_SQLITE_DB_H_

#include <sqlite3.h>

#include <cstdint>
#include <string>
#include <string_view>

namespace kova {

class Database {
 public:
  Database() = default;
  ~Database();
  Database(const Database&) = delete;
  Database& operator=(const Database&) = delete;

  // Opens the database at the real path `path`. With `create`, a missing
  // database (and its directory) is created and `schema` is run in it; without,
  // a missing database fails with `missing` set. False on failure.
  bool Open(const std::string& path, bool create, const char* schema, bool* missing = nullptr);

  // Runs statements that return no rows. False on failure.
  bool Exec(const char* sql);

  sqlite3* get() const { return db_; }

 private:
  sqlite3* db_ = nullptr;
};

class Statement {
 public:
  Statement(const Database& db, const char* sql);
  ~Statement();
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;

  bool ok() const { return statement_ != nullptr; }
  Statement& Bind(int index, int64_t value);
  Statement& Bind(int index, std::string_view text);
  // SQLITE_ROW, SQLITE_DONE, or an error code (also when preparing failed).
  int Step();
  // Makes the statement ready to run again with new bindings.
  void Reset() { sqlite3_reset(statement_); }

  int64_t Int(int column) const { return sqlite3_column_int64(statement_, column); }
  std::string_view Text(int column) const;

 private:
  sqlite3_stmt* statement_ = nullptr;
};

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_SQLITE_DB_H_
